#include "model/HTRangeList.h"
#include "model/HTMemoryRegion.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <bitset>
#include <random>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t P = kPage;

HTMemoryTotals dirty(uint64_t bytes) { return HTMemoryTotals{bytes, 0, 0, 0, 0, 0}; }
HTMemoryTotals clean(uint64_t bytes) { return HTMemoryTotals{0, 0, bytes, 0, 0, 0}; }

// Each span as {start, size, dirty, clean, wired}.
using Spans = std::vector<std::vector<uint64_t>>;
Spans spans(const HTRangeList& list)
{
    Spans result;
    for (const HTRangeListNode* node = list.head(); node; node = node->next)
        result.push_back({node->start, node->size, node->dirty, node->clean, node->wired});
    return result;
}

// The five kinds in one order, in a total and in a span.
constexpr uint64_t HTMemoryTotals::*kTotals[] = {&HTMemoryTotals::dirty, &HTMemoryTotals::swapped,
                                                 &HTMemoryTotals::clean, &HTMemoryTotals::reclaimable,
                                                 &HTMemoryTotals::wired};
constexpr uint64_t HTRangeListNode::*kSpanTotals[] = {&HTRangeListNode::dirty, &HTRangeListNode::swapped,
                                                      &HTRangeListNode::clean, &HTRangeListNode::reclaimable,
                                                      &HTRangeListNode::wired};

struct Range {
    uint64_t start;
    uint64_t size;
    HTMemoryTotals totals;
};

void add(HTRangeList& list, const std::vector<Range>& ranges)
{
    for (const Range& range : ranges) list.addRange(range.start, range.size, kPage, range.totals);
}

// A region whose sub-ranges are the given runs, as a process reports them.
std::shared_ptr<HTMemoryRegion> runs(const std::vector<Range>& ranges)
{
    auto region = std::make_shared<HTMemoryRegion>();
    for (const Range& range : ranges) region->addSubrange(range.start, range.size, range.totals, kPage);
    return region;
}

}  // namespace

// Exact ranges are laid over each other page by page; only touching spans
// full of the same kinds are joined.
TEST(HTRangeList, ExactSpansAreCutWhereTheyDifferAndJoinedWhereAlike)
{
    const HTMemoryTotals dirtyWired{2 * P, 0, 0, 0, 2 * P, 0};
    struct Case {
        const char* what;
        std::vector<Range> ranges;
        Spans expected;
    } cases[] = {
        {"apart, in any order",
         {{8 * P, P, HTMemoryTotals{1, 2, 3, 4, 5, 77}}, {0, P, dirty(2)}, {4 * P, 2 * P, dirty(3)}},
         {{0, P, 2, 0, 0}, {4 * P, 2 * P, 3, 0, 0}, {8 * P, P, 1, 3, 5}}},
        {"touching, alike", {{0, P, dirty(P)}, {P, P, dirty(P)}}, {{0, 2 * P, 2 * P, 0, 0}}},
        {"touching, other kinds", {{0, P, dirty(P)}, {P, P, clean(P)}}, {{0, P, P, 0, 0}, {P, P, 0, P, 0}}},
        {"touching, one wired",
         {{0, 2 * P, dirtyWired}, {2 * P, P, dirty(P)}},
         {{0, 2 * P, 2 * P, 0, 2 * P}, {2 * P, P, P, 0, 0}}},
        {"touching, inexact: totals add",
         {{0, 2 * P, dirty(P)}, {2 * P, P, HTMemoryTotals{1, 2, 3, 4, 5, 0}}},
         {{0, 2 * P, P, 0, 0}, {2 * P, P, 1, 3, 5}}},
        {"unaligned ends on neighbouring pages",
         {{P + 50, 100, dirty(7)}, {10, 90, dirty(5)}},
         {{10, 90, 5, 0, 0}, {P + 50, 100, 7, 0, 0}}},
        {"overlapping kinds split three ways",
         {{0, 4 * P, dirty(4 * P)}, {2 * P, 4 * P, clean(4 * P)}},
         {{0, 2 * P, 2 * P, 0, 0}, {2 * P, 2 * P, 2 * P, 2 * P, 0}, {4 * P, 2 * P, 0, 2 * P, 0}}},
        {"a range inside a span cuts it",
         {{0, 6 * P, dirty(6 * P)}, {2 * P, P, clean(P)}},
         {{0, 2 * P, 2 * P, 0, 0}, {2 * P, P, P, P, 0}, {3 * P, 3 * P, 3 * P, 0, 0}}},
        {"an empty view changes no span, fills the gaps",
         {{P, P, dirty(P)}, {3 * P, P, clean(P)}, {0, 5 * P, {}}},
         {{0, P, 0, 0, 0}, {P, P, P, 0, 0}, {2 * P, P, 0, 0, 0}, {3 * P, P, 0, P, 0}, {4 * P, P, 0, 0, 0}}},
        {"filling a gap joins both neighbours",
         {{0, P, dirty(P)}, {2 * P, P, dirty(P)}, {10 * P, P, dirty(P)}, {P, P, dirty(P)}},
         {{0, 3 * P, 3 * P, 0, 0}, {10 * P, P, P, 0, 0}}},
        {"a range spanning several spans joins them",
         {{0, P, dirty(P)},
          {2 * P, P, dirty(P)},
          {4 * P, P, dirty(P)},
          {10 * P, P, dirty(P)},
          {P, 4 * P, dirty(4 * P)}},
         {{0, 5 * P, 5 * P, 0, 0}, {10 * P, P, P, 0, 0}}},
        {"a cut piece joins the alike span next to it",
         {{0, 2 * P, dirty(2 * P)}, {2 * P, 2 * P, HTMemoryTotals{2 * P, 0, 2 * P, 0, 0, 0}}, {0, 2 * P, clean(2 * P)}},
         {{0, 4 * P, 4 * P, 4 * P, 0}}},
        {"a run over a sub-page span takes it in and fills it",
         {{100, 100, dirty(100)}, {0, 2 * P, dirty(2 * P)}},
         {{0, 2 * P, 2 * P, 0, 0}}},
    };
    for (const Case& c : cases) {
        HTRangeList list;
        add(list, c.ranges);
        EXPECT_EQ(spans(list), c.expected) << c.what;
    }
}

// Each kind is a union of pages: exact where every view is, else a lower
// bound no smaller than any one view and no larger than all of them.
TEST(HTRangeList, SharedPagesCountOnce)
{
    struct Case {
        const char* what;
        std::vector<Range> ranges;
        HTMemoryTotals sum;
        bool exact;
    } cases[] = {
        {"overlapping runs", {{0, 4 * P, dirty(4 * P)}, {2 * P, 4 * P, dirty(4 * P)}}, dirty(6 * P), true},
        {"a smaller view of the same pages", {{0, 4 * P, dirty(4 * P)}, {0, 4 * P, dirty(2 * P)}}, dirty(4 * P), false},
        {"two kinds, two views",
         {{0, 4 * P, HTMemoryTotals{4 * P, P, 0, 0, 0, 0}}, {0, 4 * P, HTMemoryTotals{2 * P, 2 * P, 0, 0, 0, 0}}},
         HTMemoryTotals{4 * P, 2 * P, 0, 0, 0, 0},
         false},
        {"views disagree about a page: it counts in both kinds",
         {{0, 2 * P, dirty(2 * P)}, {0, 2 * P, clean(2 * P)}},
         HTMemoryTotals{2 * P, 0, 2 * P, 0, 0, 0},
         true},
        {"runs, then a view with none resident",
         {{0, 20 * P, clean(20 * P)}, {30 * P, 21 * P, clean(21 * P)}, {0, 100 * P, {}}},
         clean(41 * P),
         true},
        {"a view with none resident, then runs",
         {{0, 100 * P, {}}, {0, 20 * P, clean(20 * P)}, {30 * P, 21 * P, clean(21 * P)}},
         clean(41 * P),
         true},
        {"runs, then an inexact view over them",
         {{0, 20 * P, clean(20 * P)}, {30 * P, 21 * P, clean(21 * P)}, {0, 100 * P, dirty(5 * P)}},
         HTMemoryTotals{5 * P, 0, 41 * P, 0, 0, 0},
         false},
        // S = 4P over the two spans, of which at most 4P lie on the range.
        {"an inexact view over two inexact spans",
         {{0, 4 * P, dirty(2 * P)}, {8 * P, 4 * P, dirty(2 * P)}, {0, 12 * P, dirty(3 * P)}},
         dirty(4 * P),
         false},
        {"an inexact view larger than the spans can hold of it",
         {{0, 4 * P, dirty(2 * P)}, {8 * P, 4 * P, dirty(2 * P)}, {0, 12 * P, dirty(7 * P)}},
         dirty(7 * P),
         false},
        // At most 4P of the span's 6P lie on the range's pages.
        {"an inexact view over part of an inexact span",
         {{0, 8 * P, dirty(6 * P)}, {4 * P, 8 * P, dirty(6 * P)}},
         dirty(8 * P),
         false},
        // The span has 2P dirty somewhere; the run's 4P on it may include them.
        {"a run over an inexact span and past it",
         {{0, 8 * P, HTMemoryTotals{2 * P, 0, P, 0, 0, 0}}, {4 * P, 8 * P, dirty(8 * P)}},
         HTMemoryTotals{8 * P, 0, P, 0, 0, 0},
         false},
        {"runs of the same pages, one wired",
         {{0, 4 * P, HTMemoryTotals{4 * P, 0, 0, 0, 4 * P, 0}}, {2 * P, 4 * P, dirty(4 * P)}},
         HTMemoryTotals{6 * P, 0, 0, 0, 4 * P, 0},
         true},
        {"two ranges inside one page share it", {{100, 100, dirty(100)}, {300, 100, dirty(100)}}, dirty(100), false},
    };
    for (const Case& c : cases) {
        HTRangeList list;
        add(list, c.ranges);
        EXPECT_EQ(list.sum(), c.sum) << c.what;
        EXPECT_EQ(list.exact(), c.exact) << c.what;
    }

    // One process's runs count together over a span another process gave
    // only totals for, when they come as one region's sub-ranges.
    HTRangeList list;
    EXPECT_EQ(list.sum(), HTMemoryTotals{});
    list.addRange(0, 100 * P, kPage, HTMemoryTotals{5 * P, 1, 0, 2, 3, 77});
    list.addRegion(*runs({{0, 20 * P, clean(20 * P)}, {30 * P, 21 * P, clean(21 * P)}}), kPage);
    // Each total in its own field; sum() never fills `regions`.
    EXPECT_EQ(list.sum(), (HTMemoryTotals{5 * P, 1, 41 * P, 2, 3, 0}));
    list.clear();
    EXPECT_TRUE(list.exact());
}

// Processes with random pages, added in random order, against the union of
// their page sets. Some report runs of one kind, exact, as a region's
// sub-ranges; others only their totals over a whole range.
TEST(HTRangeList, TotalsMatchTheUnionOfPages)
{
    constexpr size_t kPages = 64;
    constexpr size_t kKinds = std::size(kTotals);
    using Pages = std::array<std::bitset<kPages>, kKinds>;
    auto bytes = [](const Pages& pages) {
        HTMemoryTotals totals;
        for (size_t kind = 0; kind < kKinds; ++kind) totals.*kTotals[kind] = pages[kind].count() * P;
        return totals;
    };
    // Full kinds of an exact span, one bit each; -1 for an inexact one.
    auto pattern = [](const HTRangeListNode& node) {
        int full = 0;
        for (size_t kind = 0; kind < kKinds; ++kind) {
            if (node.*kSpanTotals[kind] == node.size)
                full |= 1 << kind;
            else if (node.*kSpanTotals[kind] != 0)
                return -1;
        }
        return full;
    };

    std::mt19937 random(7);
    auto below = [&](size_t bound) { return static_cast<size_t>(random() % bound); };
    for (int iteration = 0; iteration < 3000 && !HasFailure(); ++iteration) {
        SCOPED_TRACE(iteration);
        HTRangeList list;
        Pages all{};
        HTMemoryTotals largest;  // per kind, the most any one process holds
        bool everyRangeExact = true;
        for (size_t process = 1 + below(4); process > 0; --process) {
            // Each page holds one kind or none; a wired region's pages are all wired.
            const size_t first = below(kPages);
            const size_t last = first + below(kPages - first);
            const bool wired = below(4) == 0;
            Pages own{};
            std::vector<Range> pieces;
            for (size_t page = first; page <= last; ++page) {
                const size_t kind = below(6);
                if (kind >= 4) continue;
                own[kind].set(page);
                if (wired) own[4].set(page);
                HTMemoryTotals totals;
                totals.*kTotals[kind] = P;
                totals.wired = wired ? P : 0;
                pieces.push_back({page * P, P, totals});
            }
            const uint64_t size = (last - first + 1) * P;
            const HTMemoryTotals whole = bytes(own);
            if (below(2) == 0) {
                list.addRegion(*runs(pieces), kPage);
            } else {
                list.addRange(first * P, size, kPage, whole);
                for (uint64_t HTMemoryTotals::*total : kTotals)
                    everyRangeExact = everyRangeExact && (whole.*total == 0 || whole.*total == size);
            }
            for (size_t kind = 0; kind < kKinds; ++kind) {
                all[kind] |= own[kind];
                largest.*kTotals[kind] = std::max(largest.*kTotals[kind], whole.*kTotals[kind]);
            }
        }

        const HTMemoryTotals sum = list.sum();
        const HTMemoryTotals unionOfPages = bytes(all);
        EXPECT_TRUE(list.exact() || !everyRangeExact);
        for (uint64_t HTMemoryTotals::*total : kTotals) {
            if (list.exact()) {
                EXPECT_EQ(sum.*total, unionOfPages.*total);
            }
            EXPECT_GE(sum.*total, largest.*total);
            EXPECT_LE(sum.*total, unionOfPages.*total);
        }
        // Spans ascend without sharing a page, and alike exact neighbours are joined.
        for (const HTRangeListNode* node = list.head(); node && node->next; node = node->next) {
            const HTRangeListNode& next = *node->next;
            EXPECT_LE(node->start + node->size, next.start);
            const bool alike = pattern(*node) != -1 && pattern(*node) == pattern(next);
            EXPECT_FALSE(alike && node->start + node->size == next.start) << "not joined at " << next.start;
        }
    }
}

TEST(HTRangeList, LongListsAreAddedInOnePassAndFreedWithoutRecursion)
{
    // Alternating runs stay apart; added again, as a forked process that
    // shares them would, each lands on its own span. Walking the list from
    // its head for each run would take minutes here.
    constexpr uint64_t count = 200000;
    std::vector<Range> alternating;
    for (uint64_t i = 0; i < count; ++i) alternating.push_back({i * P, P, i % 2 ? clean(P) : dirty(P)});
    auto region = runs(alternating);
    HTRangeList list;
    list.addRegion(*region, kPage);
    list.addRegion(*region, kPage);
    EXPECT_EQ(list.sum(), (HTMemoryTotals{count / 2 * P, 0, count / 2 * P, 0, 0, 0}));
    EXPECT_TRUE(list.exact());
    EXPECT_EQ(spans(list).size(), count);

    // Descending addresses go in at the head.
    HTRangeList descending;
    for (uint64_t i = 300000; i > 0; --i) descending.addRange(2 * i * kPage, kPage, kPage, dirty(1));
    EXPECT_EQ(descending.sum().dirty, 300000u);
    descending.clear();
    EXPECT_EQ(descending.head(), nullptr);
}
