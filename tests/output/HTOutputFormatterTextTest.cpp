// The text report's size rendering and its category tables: the private and
// shared tables and the summary across processes. Expected texts are written
// out in full, spaces counted by hand from the column widths.

#include "output/HTOutputFormatterText.h"

#include "analysis/HTProcessGroup.h"
#include "model/HTCategoryMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include "output/HTOutputCapture.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

using Capture = HTOutputCapture;

// Exposes the protected helpers.
class TextFormatter : public HTOutputFormatterText {
public:
    using HTOutputFormatterText::HTOutputFormatterText;
    using HTOutputFormatterText::_sortedKeysForCategories;
    using HTOutputFormatterText::_truncatedNameForString;
};

std::shared_ptr<HTProcess> process(int32_t pid, const std::string& displayString, uint64_t pageSize = kPage)
{
    auto made = std::make_shared<HTProcess>(std::make_shared<HTFakePlatform>());
    made->setPid(pid);
    made->setName(displayString.substr(0, displayString.find(' ')));
    made->setDisplayString(displayString);
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
std::shared_ptr<HTProcessGroup> group(const std::vector<std::shared_ptr<HTProcess>>& members)
{
    auto made = std::make_shared<HTProcessGroup>();
    for (const auto& member : members) made->addProcess(member);
    made->freeze();
    return made;
}

const std::string kRule70(70, '=');
const std::string kRule80(80, '=');

}  // namespace

TEST(HTOutputFormatterText, RendersSizesInEachFormat)
{
    Capture out;
    HTOutputFormatterText bytes(HTTextFormatBytes, 0, "Dirty", true, out.file());
    EXPECT_EQ(bytes.formattedStringForSize(0), "0 B");
    EXPECT_EQ(bytes.formattedStringForSize(16384), "16384 B");

    HTOutputFormatterText pages(HTTextFormatPages, 0, "Dirty", true, out.file());
    EXPECT_EQ(pages.formattedStringForSize(12345), "0 pages");  // no page size yet
    pages.setPageSize(16384);
    EXPECT_EQ(pages.formattedStringForSize(0), "0 pages");
    EXPECT_EQ(pages.formattedStringForSize(1), "1 pages");
    EXPECT_EQ(pages.formattedStringForSize(16384), "1 pages");
    EXPECT_EQ(pages.formattedStringForSize(16385), "2 pages");
    EXPECT_EQ(pages.formattedStringForSize(UINT64_MAX), "1125899906842624 pages");

    // Powers of 1024, no decimals, at most four digits before the unit.
    HTOutputFormatterText formatted(HTTextFormatFormatted, 0, "Dirty", true, out.file());
    EXPECT_EQ(formatted.formattedStringForSize(0), "0 B");
    EXPECT_EQ(formatted.formattedStringForSize(1023), "1023 B");
    EXPECT_EQ(formatted.formattedStringForSize(1024), "1024 B");
    EXPECT_EQ(formatted.formattedStringForSize(1536), "1536 B");
    EXPECT_EQ(formatted.formattedStringForSize(16384), "16 KB");
    EXPECT_EQ(formatted.formattedStringForSize(10 * 1024 * 1024), "10 MB");
    EXPECT_EQ(formatted.formattedStringForSize(1023 * 1024), "1023 KB");
    EXPECT_EQ(formatted.formattedStringForSize(2 * 1024 * 1024), "2048 KB");
    EXPECT_EQ(out.take(), "");
}

TEST(HTOutputFormatterText, ShortensPathsUnlessWide)
{
    Capture out;
    TextFormatter narrow(HTTextFormatFormatted, 0, "Dirty", true, out.file());
    EXPECT_EQ(narrow._truncatedNameForString("/usr/lib/libexample"), ".../libexample");
    EXPECT_EQ(narrow._truncatedNameForString("libexample"), "libexample");
    EXPECT_EQ(narrow._truncatedNameForString("/usr/lib/"), ".../lib");
    EXPECT_EQ(narrow._truncatedNameForString("/"), "/");
    EXPECT_EQ(narrow._truncatedNameForString(""), "");
    EXPECT_EQ(narrow._truncatedNameForString(std::nullopt), std::nullopt);

    TextFormatter wide(HTTextFormatFormatted, 7, "Dirty", true, out.file());
    EXPECT_EQ(wide._truncatedNameForString("/usr/lib/libexample"), "/usr/lib/libexample");
}

TEST(HTOutputFormatterText, EmptyTableColumnsFollowFormatAndOptions)
{
    HTCategoryMap none;
    {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());
        formatter.printProcessCategories(none, kTotal);
        EXPECT_EQ(out.take(),
                  "  Dirty      Clean  Reclaimable    Regions    Category\n"
                  "    ---        ---          ---        ---    ---\n"
                  "    ---        ---          ---        ---    ---\n"
                  "  12 MB     1536 B          0 B         12    TOTAL\n"
                  "\n");
    }
    {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatFormatted, 7, "Dirty", true, out.file());
        formatter.printProcessCategories(none, kTotal);
        EXPECT_EQ(out.take(),
                  "  Dirty  (Swapped)      Clean  Reclaimable    (Wired)    Regions    Category\n"
                  "    ---        ---        ---          ---        ---        ---    ---\n"
                  "    ---        ---        ---          ---        ---        ---    ---\n"
                  "  12 MB    2048 KB     1536 B          0 B      16 KB         12    TOTAL\n"
                  "\n");
    }
    {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatBytes, HTTextOptionSwapped, "Dirty", true, out.file());
        formatter.printProcessCategories(none, kTotal);
        EXPECT_EQ(out.take(),
                  "      Dirty     (Swapped)         Clean   Reclaimable    Regions    Category\n"
                  "        ---           ---           ---           ---        ---    ---\n"
                  "        ---           ---           ---           ---        ---    ---\n"
                  " 12582912 B     2097152 B        1536 B           0 B         12    TOTAL\n"
                  "\n");
    }
    {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatPages, HTTextOptionWired, "Dirty", true, out.file());
        formatter.setPageSize(16384);
        formatter.printProcessCategories(none, kTotal);
        EXPECT_EQ(out.take(),
                  "      Dirty         Clean   Reclaimable       (Wired)    Regions    Category\n"
                  "        ---           ---           ---           ---        ---    ---\n"
                  "        ---           ---           ---           ---        ---    ---\n"
                  "  768 pages       1 pages       0 pages       1 pages         12    TOTAL\n"
                  "\n");
    }
}

TEST(HTOutputFormatterText, PrivateTableRowsSortedByDirty)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());
    const HTMemoryTotals total{20480, 4096, 24576, 4096, 8192, 7};
    formatter.printProcessCategories(sampleCategories(), total);
    EXPECT_EQ(out.take(),
              "  Dirty      Clean  Reclaimable    Regions    Category\n"
              "    ---        ---          ---        ---    ---\n"
              "  12 KB        0 B          0 B          1    MALLOC_SMALL\n"
              " 4096 B        0 B       4096 B          3    stack\n"
              " 4096 B      16 KB          0 B          2    __TEXT .../libexample\n"
              " 4096 B     8192 B          0 B          1    __DATA libplain\n"
              "    0 B        0 B          0 B          0    unnamed\n"
              "    ---        ---          ---        ---    ---\n"
              "  24 KB      24 KB       4096 B          7    TOTAL\n"
              "\n");
}

TEST(HTOutputFormatterText, RowOrderUnderEachSortColumn)
{
    using Keys = std::vector<std::string>;
    const HTCategoryMap categories = sampleCategories();
    auto keysSortedBy = [&](const char* sort) {
        TextFormatter formatter(HTTextFormatFormatted, 0, sort, true, stdout);
        return formatter._sortedKeysForCategories(categories);
    };
    // Equal rows keep the map's order.
    EXPECT_EQ(keysSortedBy("Swapped"),
              (Keys{"MALLOC_SMALL", "__DATA libplain", "__TEXT /usr/lib/libexample", "stack", "unnamed"}));
    EXPECT_EQ(keysSortedBy("Clean"),
              (Keys{"__TEXT /usr/lib/libexample", "__DATA libplain", "MALLOC_SMALL", "stack", "unnamed"}));
    EXPECT_EQ(keysSortedBy("Reclaimable"),
              (Keys{"stack", "__DATA libplain", "__TEXT /usr/lib/libexample", "MALLOC_SMALL", "unnamed"}));
    EXPECT_EQ(keysSortedBy("Wired"),
              (Keys{"MALLOC_SMALL", "__DATA libplain", "__TEXT /usr/lib/libexample", "stack", "unnamed"}));
    EXPECT_EQ(keysSortedBy("Regions"),
              (Keys{"stack", "__TEXT /usr/lib/libexample", "__DATA libplain", "MALLOC_SMALL", "unnamed"}));
    // Character codes: upper case before "_" before lower case.
    EXPECT_EQ(keysSortedBy("Category"),
              (Keys{"MALLOC_SMALL", "__DATA libplain", "__TEXT /usr/lib/libexample", "stack", "unnamed"}));

    EXPECT_DEATH(keysSortedBy("dirty"), "HTOutputFormatterText.*Unhandled text sort column");
}

TEST(HTOutputFormatterText, SharedTableTitles)
{
    std::vector<std::shared_ptr<HTProcess>> members;
    for (int32_t pid = 101; pid <= 121; ++pid)
        members.push_back(process(pid, "p" + std::to_string(pid) + " [" + std::to_string(pid) + "]"));
    const auto& self = *members[1];

    HTCategoryMap one;
    addCategory(one, "big", "big", std::nullopt, {1000000000, 0, 0, 0, 0, 1});
    const HTMemoryTotals total{1000000000, 0, 0, 0, 0, 1};

    {
        // Sizes wider than their column widen the row. The member's own
        // name is left out of the title.
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatBytes, 0, "Dirty", true, out.file());
        formatter.printSharedCategories(one, *group({members[0], members[1]}), self, false, total);
        EXPECT_EQ(out.take(),
                  "Shared with p101 [101]:\n"
                  "      Dirty         Clean   Reclaimable    Regions    Category\n"
                  "        ---           ---           ---        ---    ---\n"
                  "1000000000 B           0 B           0 B          1    big\n"
                  "        ---           ---           ---        ---    ---\n"
                  "1000000000 B           0 B           0 B          1    TOTAL\n"
                  "\n");
    }

    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());
    HTCategoryMap none;
    const std::string emptyTable =
        "  Dirty      Clean  Reclaimable    Regions    Category\n"
        "    ---        ---          ---        ---    ---\n"
        "    ---        ---          ---        ---    ---\n"
        "    0 B        0 B          0 B          0    TOTAL\n"
        "\n";

    auto twenty = group(std::vector<std::shared_ptr<HTProcess>>(members.begin(), members.begin() + 20));
    formatter.printSharedCategories(none, *twenty, self, true, HTMemoryTotals{});
    std::string names;
    for (int32_t pid = 101; pid <= 120; ++pid) {
        if (pid == 102) continue;
        names += " p" + std::to_string(pid) + " [" + std::to_string(pid) + "]" + (pid == 120 ? ":" : ",");
    }
    EXPECT_EQ(out.take(), "Shared with" + names + "\n" + emptyTable);

    formatter.printSharedCategories(none, *group(members), self, false, HTMemoryTotals{});
    EXPECT_EQ(out.take(), "Shared with 21 processes:\n" + emptyTable);
}

TEST(HTOutputFormatterText, SummaryOfOneProcessIsTheModeLineAtMost)
{
    HTCategoryMap none;
    for (bool breakDown : {true, false}) {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", breakDown, out.file());
        formatter.printProcessHeader(*process(812, "cat [812]"));
        out.take();
        formatter.printSummaryCategories(none, kTotal, true);
        EXPECT_EQ(out.take(), breakDown ? "" : "VM Object Dirty Analysis: Enabled\n");
    }
}

TEST(HTOutputFormatterText, SummaryOfSeveralProcesses)
{
    {
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());
        formatter.printProcessHeader(*process(1, "a [1]"));
        formatter.printProcessHeader(*process(2, "b [2]"));
        out.take();
        HTCategoryMap categories;
        addCategory(categories, "stack", "stack", std::nullopt, {4096, 0, 0, 4096, 0, 3});
        const HTMemoryTotals total{20480, 4096, 24576, 4096, 8192, 7};
        formatter.printSummaryCategories(categories, total, false);
        EXPECT_EQ(out.take(), kRule70 + "\n" +
                                  "Summary Heft: 24 KB\n" + kRule70 + "\n\n" +
                                  "  Dirty      Clean  Reclaimable    Regions    Category\n"
                                  "    ---        ---          ---        ---    ---\n"
                                  " 4096 B        0 B       4096 B          3    stack\n"
                                  "    ---        ---          ---        ---    ---\n"
                                  "  24 KB      24 KB       4096 B          7    TOTAL\n");
    }
    {
        // Pages are counted with the page size of the last process printed,
        // and the rule grows with the swapped column.
        Capture out;
        HTOutputFormatterText formatter(HTTextFormatPages, HTTextOptionSwapped, "Dirty", false, out.file());
        formatter.printProcessHeader(*process(1, "a [1]", 4096));
        formatter.printProcessHeader(*process(2, "b [2]", 16384));
        formatter.printProcessHeader(*process(3, "c [3]", 16384));
        EXPECT_EQ(formatter.processCount(), 2);
        out.take();
        const HTMemoryTotals total{16384, 16385, 1, 0, 0, 2};
        formatter.printSummaryCategories(HTCategoryMap{}, total, true);
        EXPECT_EQ(out.take(), "VM Object Dirty Analysis: Enabled\n" + kRule80 + "\n" +
                                  "Summary Heft: 3 pages (may be invalid due to errors)\n" + kRule80 + "\n\n" +
                                  "      Dirty     (Swapped)         Clean   Reclaimable    Regions    Category\n"
                                  "        ---           ---           ---           ---        ---    ---\n"
                                  "        ---           ---           ---           ---        ---    ---\n"
                                  "    3 pages       2 pages       1 pages       0 pages          2    TOTAL\n");
    }
}
