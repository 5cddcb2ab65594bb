// What whole reports (analysis/HTReportGoldenTest) do not pin down: pages
// without a page size, path shortening at its edges and the row order under
// every sort column, with ties.

#include "output/HTOutputFormatterText.h"

#include "model/HTCategoryMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

class TextFormatter : public HTOutputFormatterText {
public:
    TextFormatter(int64_t format, int64_t options, const char* sort)
        : HTOutputFormatterText(HTSettings{.summaryFormat = format, .textOptions = options, .textSort = sort}, stdout)
    {
    }
    using HTOutputFormatterText::_sortedKeysForCategories;
    using HTOutputFormatterText::_truncatedNameForString;
};

TEST(HTOutputFormatterText, PagesRoundUpAndNeedAPageSize)
{
    TextFormatter pages(HTTextFormatPages, 0, "Dirty");
    EXPECT_EQ(pages.formattedStringForSize(12345), "0 pages");
    pages.setPageSize(16384);
    for (const auto& [size, shown] :
         std::vector<std::pair<uint64_t, std::string>>{{0, "0 pages"},
                                                       {1, "1 pages"},
                                                       {16384, "1 pages"},
                                                       {16385, "2 pages"},
                                                       {UINT64_MAX, "1125899906842624 pages"}})
        EXPECT_EQ(pages.formattedStringForSize(size), shown) << size;
}

TEST(HTOutputFormatterText, ShortensPathsUnlessWide)
{
    TextFormatter narrow(HTTextFormatFormatted, 0, "Dirty");
    for (const auto& [path, shown] : std::vector<std::pair<std::string, std::string>>{{"/usr/lib/libx", ".../libx"},
                                                                                      {"libx", "libx"},
                                                                                      {"/usr/lib/", ".../lib"},
                                                                                      {"/", "/"},
                                                                                      {"", ""}})
        EXPECT_EQ(narrow._truncatedNameForString(path), shown) << path;
    EXPECT_EQ(TextFormatter(HTTextFormatFormatted, HTTextOptionWide, "Dirty")._truncatedNameForString("/usr/lib/libx"),
              "/usr/lib/libx");
}

TEST(HTOutputFormatterText, RowOrderUnderEachSortColumn)
{
    // D and T tie on dirty and reclaimable and differ in clean; S ties with
    // both on dirty and has more reclaimable; U is all zeros.
    HTCategoryMap categories;
    auto add = [&](const char* key, std::vector<uint64_t> sizes, int regions) {
        auto category = std::make_shared<HTMemoryCategory>(HTSegmentNoImage);
        auto object = std::make_shared<HTMemoryObject>();
        for (int i = 0; i < regions; ++i) {
            auto region = std::make_shared<HTMemoryRegion>();
            region->setStart(static_cast<uint64_t>(i) * 4096);
            region->setSize(4096);
            object->addRegion(region, 4096);
        }
        object->finalize(false);
        if (regions) category->addMemoryObject(object);
        category->setTotalDirtySize(sizes[0]);
        category->setTotalSwappedSize(sizes[1]);
        category->setTotalCleanSize(sizes[2]);
        category->setTotalReclaimableSize(sizes[3]);
        category->setTotalWiredSize(sizes[4]);
        categories.add(key, category);
    };
    add("D", {4096, 0, 8192, 0, 0}, 1);
    add("T", {4096, 0, 16384, 0, 0}, 2);
    add("M", {8192, 4096, 0, 0, 8192}, 1);
    add("S", {4096, 0, 0, 4096, 0}, 3);
    add("U", {0, 0, 0, 0, 0}, 0);
    add("_", {0, 0, 0, 0, 0}, 0);
    add("a", {0, 0, 0, 0, 0}, 0);
    // Equal rows keep the map's order; "Category" goes by character codes.
    const std::pair<const char*, const char*> rows[] = {
        {"Dirty", "MSTDU_a"}, {"Swapped", "MDTSU_a"}, {"Clean", "TDMSU_a"},    {"Reclaimable", "SDTMU_a"},
        {"Wired", "MDTSU_a"}, {"Regions", "STDMU_a"}, {"Category", "DMSTU_a"},
    };
    for (const auto& [sort, order] : rows) {
        std::string keys;
        for (const auto& key : TextFormatter(HTTextFormatFormatted, 0, sort)._sortedKeysForCategories(categories))
            keys += key;
        EXPECT_EQ(keys, order) << sort;
    }
    EXPECT_DEATH(TextFormatter(HTTextFormatFormatted, 0, "dirty")._sortedKeysForCategories(categories),
                 "Unhandled text sort column");
}

}  // namespace
