#include "model/HTRangeList.h"

#include <gtest/gtest.h>

#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

// Each span as {start, size, dirty}.
std::vector<std::vector<uint64_t>> spans(const HTRangeList& list)
{
    std::vector<std::vector<uint64_t>> result;
    for (const HTRangeListNode* node = list.head(); node; node = node->next)
        result.push_back({node->start, node->size, node->dirty});
    return result;
}

HTMemoryTotals dirty(uint64_t bytes) { return HTMemoryTotals{bytes, 0, 0, 0, 0, 0}; }

using Spans = std::vector<std::vector<uint64_t>>;

}  // namespace

TEST(HTRangeList, SeparateRangesStaySortedAndApart)
{
    HTRangeList list;
    EXPECT_EQ(list.sum(), HTMemoryTotals{});
    // Each total lands in its own field; sum() never fills `regions`.
    list.addRange(8 * kPage, kPage, kPage, HTMemoryTotals{1, 2, 3, 4, 5, 77});
    EXPECT_EQ(list.sum(), (HTMemoryTotals{1, 2, 3, 4, 5, 0}));
    list.addRange(0, kPage, kPage, dirty(2));
    // A page of gap on either side: linked in between, nothing merged.
    list.addRange(4 * kPage, 2 * kPage, kPage, dirty(3));
    EXPECT_EQ(spans(list), (Spans{{0, kPage, 2}, {4 * kPage, 2 * kPage, 3}, {8 * kPage, kPage, 1}}));
}

TEST(HTRangeList, TouchingExtentsMergeWithoutOverlap)
{
    HTRangeList list;
    list.addRange(0, kPage, kPage, HTMemoryTotals{10, 20, 30, 40, 50, 0});
    list.addRange(kPage, kPage, kPage, HTMemoryTotals{1, 2, 3, 4, 5, 0});
    EXPECT_EQ(spans(list), (Spans{{0, 2 * kPage, 11}}));
    EXPECT_EQ(list.sum(), (HTMemoryTotals{11, 22, 33, 44, 55, 0}));

    // Unaligned ends on neighbouring pages touch too; the merged span keeps
    // the exact start and end.
    HTRangeList unaligned;
    unaligned.addRange(kPage + 50, 100, kPage, dirty(7));
    unaligned.addRange(10, 90, kPage, dirty(5));
    EXPECT_EQ(spans(unaligned), (Spans{{10, kPage + 140, 12}}));
}

TEST(HTRangeList, SharedPagesCountOnce)
{
    HTRangeList list;
    list.addRange(0, 16384, kPage, dirty(16384));
    list.addRange(8192, 16384, kPage, dirty(16384));
    EXPECT_EQ(spans(list), (Spans{{0, 24576, 24576}}));

    // max(a + b - overlap, max(a, b)): never below either input, never wrapping.
    HTRangeList twice;
    twice.addRange(0, 16384, kPage, HTMemoryTotals{16384, 4096, 0, 0, 0, 0});
    twice.addRange(0, 16384, kPage, HTMemoryTotals{8192, 8192, 0, 0, 0, 0});
    EXPECT_EQ(twice.sum(), (HTMemoryTotals{16384, 8192, 0, 0, 0, 0}));

    // Two ranges inside one page share the whole page.
    HTRangeList onePage;
    onePage.addRange(100, 100, kPage, dirty(100));
    onePage.addRange(300, 100, kPage, dirty(100));
    EXPECT_EQ(spans(onePage), (Spans{{100, 300, 100}}));
}

TEST(HTRangeList, RangeSpanningSeveralNodesAbsorbsThemAll)
{
    HTRangeList list;
    for (uint64_t page : {0, 2, 4, 10}) list.addRange(page * kPage, kPage, kPage, dirty(kPage));
    // Touches the first span (overlap 0) and overlaps the next two by a page each.
    list.addRange(kPage, 4 * kPage, kPage, dirty(4 * kPage));
    EXPECT_EQ(spans(list), (Spans{{0, 5 * kPage, 5 * kPage}, {10 * kPage, kPage, kPage}}));
}

TEST(HTRangeList, LongListIsFreedWithoutRecursion)
{
    HTRangeList list;
    constexpr uint64_t count = 300000;
    // Descending addresses go in at the head, so building is linear.
    for (uint64_t i = count; i > 0; --i) list.addRange(2 * i * kPage, kPage, kPage, dirty(1));
    EXPECT_EQ(list.sum().dirty, count);
    list.clear();
    EXPECT_EQ(list.head(), nullptr);
}
