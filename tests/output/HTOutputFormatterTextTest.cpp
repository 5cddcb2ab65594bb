// The text report's pieces that whole reports (analysis/HTReportGoldenTest)
// do not reach: size rendering, path shortening and row order as values, and
// the tables, titles, headers, listings, diagnostics and auxiliary data of
// other formats and options, written to one expected report.

#include "output/HTOutputFormatterText.h"

#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTCategoryMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include "output/HTExpectedReport.h"
#include "output/HTOutputCapture.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

HTSettings textSettings(int64_t format, int64_t options, std::string sort, bool breakDown = true)
{
    HTSettings settings;
    settings.summaryFormat = format;
    settings.textOptions = options;
    settings.textSort = std::move(sort);
    settings.breakDownPhysHeft = breakDown;
    return settings;
}

// Exposes the protected helpers.
class TextFormatter : public HTOutputFormatterText {
public:
    using HTOutputFormatterText::_sortedKeysForCategories;
    using HTOutputFormatterText::_truncatedNameForString;
    using HTOutputFormatterText::HTOutputFormatterText;
};

// A process source that failed: errors can only be added from inside.
class TestProcess : public HTProcess {
public:
    using HTProcess::HTProcess;
    void fail(std::string error) { addError(std::move(error)); }
};

std::shared_ptr<TestProcess> process(int32_t pid, const std::string& name, uint64_t pageSize = kPage)
{
    auto made = std::make_shared<TestProcess>(std::make_shared<HTFakePlatform>());
    made->setPid(pid);
    made->setName(name);
    made->setDisplayString(name + " [" + std::to_string(pid) + "]");
    made->setIs64bit(true);
    made->setPageSize(pageSize);
    return made;
}

struct Sizes {
    uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0, wired = 0;
    int regions = 0;
};

// A category of `regions` distinct regions named `name` and `detail`, with
// the given totals. Without regions it has no name, and its row shows the key.
void addCategory(HTCategoryMap& map, const std::string& key, const std::optional<std::string>& name,
                 const std::optional<std::string>& detail, const Sizes& sizes)
{
    auto category = std::make_shared<HTMemoryCategory>(HTSegmentNoImage);
    if (sizes.regions > 0) {
        auto object = std::make_shared<HTMemoryObject>();
        for (int i = 0; i < sizes.regions; ++i) {
            auto region = std::make_shared<HTMemoryRegion>();
            region->setStart(static_cast<uint64_t>(i) * kPage);
            region->setSize(kPage);
            region->setName(name);
            region->setDetailedName(detail);
            object->addRegion(region, kPage);
        }
        object->finalize(false);
        category->addMemoryObject(object);
    }
    category->setTotalDirtySize(sizes.dirty);
    category->setTotalSwappedSize(sizes.swapped);
    category->setTotalCleanSize(sizes.clean);
    category->setTotalReclaimableSize(sizes.reclaimable);
    category->setTotalWiredSize(sizes.wired);
    map.add(key, category);
}

// Five categories whose order differs under every sort column; "__DATA"
// and "__TEXT" tie on dirty and reclaimable and differ in clean, "stack"
// ties with both on dirty and has more reclaimable.
HTCategoryMap sampleCategories()
{
    HTCategoryMap map;
    addCategory(map, "__DATA libplain", "__DATA", "libplain", {4096, 0, 8192, 0, 0, 1});
    addCategory(map, "__TEXT /usr/lib/libexample", "__TEXT", "/usr/lib/libexample", {4096, 0, 16384, 0, 0, 2});
    addCategory(map, "MALLOC_SMALL", "MALLOC_SMALL", std::nullopt, {8192, 4096, 0, 0, 8192, 1});
    addCategory(map, "stack", "stack", std::nullopt, {4096, 0, 0, 4096, 0, 3});
    addCategory(map, "unnamed", std::nullopt, std::nullopt, {});
    return map;
}

const HTMemoryTotals kTotal{10 * 1024 * 1024, 2 * 1024 * 1024, 1536, 0, 16384, 12};

// A frozen group of the given members, in that order.
std::shared_ptr<HTProcessGroup> group(const std::vector<std::shared_ptr<TestProcess>>& members)
{
    auto made = std::make_shared<HTProcessGroup>();
    for (const auto& member : members) made->addProcess(member);
    made->freeze();
    return made;
}

std::shared_ptr<HTMemoryRegion> region(uint64_t start, uint64_t size, uint64_t objectId, const char* name,
                                       std::optional<std::string> detail = std::nullopt)
{
    auto made = std::make_shared<HTMemoryRegion>();
    made->setStart(start);
    made->setSize(size);
    made->setObject_id(objectId);
    made->setName(name);
    made->setDetailedName(std::move(detail));
    return made;
}

std::shared_ptr<HTAuxDataMap> auxMap(std::initializer_list<std::pair<std::string, HTAuxDataMap::Value>> entries)
{
    auto made = std::make_shared<HTAuxDataMap>();
    for (const auto& [key, value] : entries) made->set(key, value);
    return made;
}

HTAuxDataMap::Value datum(int64_t value) { return std::make_shared<HTAuxData>(value, true); }

}  // namespace

TEST(HTOutputFormatterText, RendersSizesInEachFormat)
{
    // Formatted: powers of 1024, no decimals, at most four digits before the unit.
    struct Row {
        int64_t format;
        uint64_t pageSize;
        std::vector<std::pair<uint64_t, const char*>> sizes;
    } rows[] = {
        {HTTextFormatBytes, 0, {{0, "0 B"}, {16384, "16384 B"}}},
        {HTTextFormatPages, 0, {{12345, "0 pages"}}},  // no page size yet
        {HTTextFormatPages,
         16384,
         {{0, "0 pages"},
          {1, "1 pages"},
          {16384, "1 pages"},
          {16385, "2 pages"},
          {UINT64_MAX, "1125899906842624 pages"}}},
        {HTTextFormatFormatted,
         0,
         {{0, "0 B"},
          {1023, "1023 B"},
          {1024, "1024 B"},
          {1536, "1536 B"},
          {16384, "16 KB"},
          {10 * 1024 * 1024, "10 MB"},
          {1023 * 1024, "1023 KB"},
          {2 * 1024 * 1024, "2048 KB"}}},
    };
    HTOutputCapture out;
    for (const Row& row : rows) {
        HTOutputFormatterText formatter(textSettings(row.format, 0, "Dirty", true), out.file());
        if (row.pageSize) formatter.setPageSize(row.pageSize);
        for (const auto& [size, expected] : row.sizes)
            EXPECT_EQ(formatter.formattedStringForSize(size), expected) << row.format << " " << size;
    }
    EXPECT_EQ(out.take(), "");
}

TEST(HTOutputFormatterText, ShortensPathsUnlessWide)
{
    TextFormatter narrow(textSettings(HTTextFormatFormatted, 0, "Dirty", true), stdout);
    for (const auto& [path, shown] :
         std::vector<std::pair<std::string, std::string>>{{"/usr/lib/libexample", ".../libexample"},
                                                          {"libexample", "libexample"},
                                                          {"/usr/lib/", ".../lib"},
                                                          {"/", "/"},
                                                          {"", ""}})
        EXPECT_EQ(narrow._truncatedNameForString(path), shown) << path;
    EXPECT_EQ(narrow._truncatedNameForString(std::nullopt), std::nullopt);

    TextFormatter wide(textSettings(HTTextFormatFormatted, 7, "Dirty", true), stdout);
    EXPECT_EQ(wide._truncatedNameForString("/usr/lib/libexample"), "/usr/lib/libexample");
}

TEST(HTOutputFormatterText, RowOrderUnderEachSortColumn)
{
    using Keys = std::vector<std::string>;
    const HTCategoryMap categories = sampleCategories();
    auto keysSortedBy = [&](const char* sort) {
        TextFormatter formatter(textSettings(HTTextFormatFormatted, 0, sort, true), stdout);
        return formatter._sortedKeysForCategories(categories);
    };
    const std::string D = "__DATA libplain", T = "__TEXT /usr/lib/libexample", M = "MALLOC_SMALL", S = "stack",
                      U = "unnamed";
    // Equal rows keep the map's order; "Category" goes by character codes:
    // upper case before "_" before lower case.
    const std::pair<const char*, Keys> rows[] = {
        {"Dirty", {M, S, T, D, U}},       {"Swapped", {M, D, T, S, U}}, {"Clean", {T, D, M, S, U}},
        {"Reclaimable", {S, D, T, M, U}}, {"Wired", {M, D, T, S, U}},   {"Regions", {S, T, D, M, U}},
        {"Category", {M, D, T, S, U}},
    };
    for (const auto& [sort, keys] : rows) EXPECT_EQ(keysSortedBy(sort), keys) << sort;

    EXPECT_DEATH(keysSortedBy("dirty"), "HTOutputFormatterText.*Unhandled text sort column");
}

// Each piece is written after a line naming it, all into text-pieces.txt.
TEST(HTOutputFormatterText, PiecesOfOtherFormatsAndOptions)
{
    HTOutputCapture out;
    std::string report;
    auto piece = [&](const char* what) { report += out.take() + "--- " + what + "\n"; };
    // Headers that only set up the counts are left out of the report.
    auto quietly = [&](auto print) {
        report += out.take();
        print();
        out.take();
    };
    using Text = HTOutputFormatterText;

    piece("empty tables: formatted wide, bytes swapped, pages wired");
    Text(textSettings(HTTextFormatFormatted, 7, "Dirty", true), out.file()).printProcessCategories({}, kTotal);
    Text(textSettings(HTTextFormatBytes, HTTextOptionSwapped, "Dirty", true), out.file())
        .printProcessCategories({}, kTotal);
    Text pages(textSettings(HTTextFormatPages, HTTextOptionWired, "Dirty", true), out.file());
    pages.setPageSize(16384);
    pages.printProcessCategories({}, kTotal);

    piece("private table sorted by dirty, an unnamed category under its key");
    Text formatted(textSettings(HTTextFormatFormatted, 0, "Dirty", true), out.file());
    formatted.printProcessCategories(sampleCategories(), HTMemoryTotals{20480, 4096, 24576, 4096, 8192, 7});

    piece("shared tables: sizes wider than their column; 19 others named; 20 others counted");
    std::vector<std::shared_ptr<TestProcess>> members;
    for (int32_t pid = 101; pid <= 121; ++pid) members.push_back(process(pid, "p" + std::to_string(pid)));
    const auto& self = *members[1];
    HTCategoryMap big;
    addCategory(big, "big", "big", std::nullopt, {1000000000, 0, 0, 0, 0, 1});
    Text(textSettings(HTTextFormatBytes, 0, "Dirty", true), out.file())
        .printSharedCategories(big, *group({members[0], members[1]}), self, false, {1000000000, 0, 0, 0, 0, 1});
    formatted.printSharedCategories({}, *group({members.begin(), members.begin() + 20}), self, true, {});
    formatted.printSharedCategories({}, *group(members), self, false, {});

    piece("summaries: one process with and without the breakdown; two; pages of the last process, swapped");
    for (bool breakDown : {true, false}) {
        Text one(textSettings(HTTextFormatFormatted, 0, "Dirty", breakDown), out.file());
        quietly([&] { one.printProcessHeader(*process(812, "cat")); });
        one.printSummaryCategories({}, kTotal, true);
    }
    Text two(textSettings(HTTextFormatFormatted, 0, "Dirty", true), out.file());
    quietly([&] {
        two.printProcessHeader(*process(1, "a"));
        two.printProcessHeader(*process(2, "b"));
    });
    HTCategoryMap stack;
    addCategory(stack, "stack", "stack", std::nullopt, {4096, 0, 0, 4096, 0, 3});
    two.printSummaryCategories(stack, {20480, 4096, 24576, 4096, 8192, 7}, false);
    Text three(textSettings(HTTextFormatPages, HTTextOptionSwapped, "Dirty", false), out.file());
    quietly([&] {
        for (int32_t pid : {1, 2, 3}) three.printProcessHeader(*process(pid, "p", pid == 1 ? 4096 : 16384));
    });
    three.printSummaryCategories({}, {16384, 16385, 1, 0, 0, 2}, true);

    piece("listings: swapped and wired columns, odd sizes, an unmapped region; wide without a page size; empty");
    auto text = region(0x100000, 2 * 4096 + 1, 0x123456789abcULL, "__TEXT", "/usr/lib/libexample");
    text->setDirtySize(4096);
    text->setSwappedSize(1);
    text->setCleanNonSpecSize(4096);
    text->setWired(true);
    auto owned = region(HTNoAddress, 4096, 0x2a, "owned unmapped memory");
    owned->setDirtySize(4096);
    owned->setReclaimableSize(4095);
    Text(textSettings(HTTextFormatBytes, HTTextOptionSwapped | HTTextOptionWired, "Dirty", true), out.file())
        .printSpanlistLikeOutputForProcess(*process(812, "cat"), {text, owned});
    auto far = region(0x7f0000001000, 4096, 7, "__TEXT", "/usr/lib/libexample");
    far->setDirtySize(4096);
    Text wide(textSettings(HTTextFormatFormatted, HTTextOptionWide, "Dirty", true), out.file());
    wide.printSpanlistLikeOutputForProcess(*process(9, "odd", 0), {far});
    wide.printSpanlistLikeOutputForProcess(*process(10, "idle"), {});

    piece("headers: 32-bit with warnings; the rule of all columns");
    Text headers(textSettings(HTTextFormatFormatted, 0, "Dirty", true), out.file());
    auto warned = process(7, "old");
    warned->setIs64bit(false);
    warned->warnings() = {"process exited while being examined", "second warning"};
    headers.printProcessHeader(*warned);
    headers.printProcessTotal(0, *warned);
    headers.endProcessHeader(*warned);
    Text all(textSettings(HTTextFormatBytes, HTTextOptionWide | HTTextOptionSwapped | HTTextOptionWired, "Dirty", true),
             out.file());
    all.printProcessHeader(*process(812, "cat"));
    all.printProcessTotal(4096, *process(812, "cat"));
    all.endProcessHeader(*process(812, "cat"));

    piece("diagnostics: none; warnings alone; run errors alone");
    formatted.printProcessesWithWarnings({}, {}, {});
    formatted.printProcessesWithWarnings({process(1, "launchd"), process(2, "cat")}, {}, {});
    formatted.printProcessesWithWarnings({}, {}, {"interrupted"});

    piece("auxiliary data: nested in the order set; empty; none; in pages");
    formatted.printProcessAuxData(auxMap({
        {"phys_heft", datum(16384)},
        {"ledger", auxMap({{"page_table", datum(4096)}, {"purgeable", auxMap({{"volatile", datum(0)}})}})},
        {"tail", datum(1024)},
    }));
    formatted.printProcessAuxData(std::make_shared<HTAuxDataMap>());
    formatted.printProcessAuxData(nullptr);
    pages.setPageSize(4096);
    pages.printProcessAuxData(auxMap({{"phys_heft", datum(4097)}}));

    piece("run-wide auxiliary data: one process; two; none");
    Text global(textSettings(HTTextFormatBytes, 0, "Dirty", true), out.file());
    quietly([&] { global.printProcessHeader(*process(1, "a")); });
    global.printGlobalAuxData(auxMap({{"phys_heft", datum(8192)}}));
    quietly([&] { global.printProcessHeader(*process(2, "b")); });
    global.printGlobalAuxData(auxMap({{"phys_heft", datum(8192)}}));
    global.printGlobalAuxData(nullptr);
    global.end();

    expectReport("text-pieces.txt", report + out.take());
}
