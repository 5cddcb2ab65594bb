#include "model/HTRangeList.h"
#include "model/HTMemoryRegion.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <bitset>
#include <fstream>
#include <random>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t P = kPage;

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

// A region whose sub-ranges are the given runs, as a process reports them.
std::shared_ptr<HTMemoryRegion> runs(const std::vector<Range>& ranges)
{
    auto region = std::make_shared<HTMemoryRegion>();
    for (const Range& range : ranges) region->addSubrange(range.start, range.size, range.totals, kPage);
    return region;
}

// Figures and ranges written as in data/range-lists.txt: "2P+50" is two pages and 50 bytes.
uint64_t number(const std::string& text)
{
    uint64_t sum = 0;
    std::istringstream terms(text);
    for (std::string term; std::getline(terms, term, '+');)
        sum += term.back() != 'P' ? std::stoull(term) : term.size() == 1 ? P : std::stoull(term) * P;
    return sum;
}

std::string text(uint64_t n)
{
    const std::string pages = n < P ? "" : n < 2 * P ? "P" : std::to_string(n / P) + "P";
    if (n % P == 0 && n != 0) return pages;
    return pages.empty() ? std::to_string(n) : pages + "+" + std::to_string(n % P);
}

// The five kinds of a total or a span, each that is not 0.
template<class Of>
std::string text(const Of& of, uint64_t Of::*const (&kinds)[5])
{
    std::string result;
    for (size_t kind = 0; kind < 5; ++kind)
        if (of.*kinds[kind] != 0) result += std::string(" ") + "dscrw"[kind] + text(of.*kinds[kind]);
    return result;
}

std::vector<Range> ranges(const std::string& line)
{
    std::vector<Range> result;
    std::istringstream items(line);
    for (std::string item; std::getline(items, item, ';');) {
        std::istringstream words(item);
        std::string start, size;
        words >> start >> size;
        Range& range = result.emplace_back(Range{number(start), number(size), {}});
        for (std::string kind; words >> kind;) {
            if (kind[0] == 'g')
                range.totals.regions = static_cast<uint32_t>(number(kind.substr(1)));
            else
                range.totals.*kTotals[std::string_view("dscrw").find(kind[0])] = number(kind.substr(1));
        }
    }
    return result;
}

}  // namespace

TEST(HTRangeList, SpansAndTotalsOfTheRangesInTheDataFile)
{
    std::ifstream file(HEFT_TEST_DATA_DIR "/range-lists.txt");
    HTRangeList list;
    std::string title;
    int cases = 0;
    for (std::string line; std::getline(file, line);) {
        std::istringstream words(line);
        std::string keyword, rest;
        words >> keyword >> std::ws;
        std::getline(words, rest);
        if (keyword == "case") {
            // Cleared, the list is as new.
            list.clear();
            EXPECT_TRUE(list.head() == nullptr && list.exact() && list.sum() == HTMemoryTotals{}) << title;
            title = rest;
            ++cases;
        } else if (keyword == "add") {
            for (const Range& range : ranges(rest)) list.addRange(range.start, range.size, kPage, range.totals);
        } else if (keyword == "region") {
            list.addRegion(*runs(ranges(rest)), kPage);
        } else if (keyword == "spans") {
            std::string spans;
            for (const HTRangeListNode* node = list.head(); node; node = node->next)
                spans +=
                    (spans.empty() ? "" : "; ") + text(node->start) + " " + text(node->size) + text(*node, kSpanTotals);
            EXPECT_EQ(spans, rest) << title;
        } else if (keyword == "sum") {
            const HTMemoryTotals sum = list.sum();
            EXPECT_EQ(text(sum, kTotals) + (list.exact() ? " exact" : " inexact"), " " + rest) << title;
            EXPECT_EQ(sum.regions, 0u) << title;
        }
    }
    EXPECT_EQ(cases, 27);
}

// Processes with random pages against the union of their page sets: some report runs of one kind, exact, as a
// region's sub-ranges; others only their totals over a whole range.
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
        for (size_t kind = 0; kind < kKinds; ++kind)
            full = node.*kSpanTotals[kind] == node.size ? full | 1 << kind : node.*kSpanTotals[kind] != 0 ? -1 : full;
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
    // Alternating runs stay apart; added again, as by a forked process, each lands on its own span. Walking
    // the list from its head for each run would take minutes here.
    constexpr uint64_t count = 200000;
    std::vector<Range> alternating;
    for (uint64_t i = 0; i < count; ++i)
        alternating.push_back({i * P, P, HTMemoryTotals{i % 2 ? 0 : P, 0, i % 2 ? P : 0, 0, 0, 0}});
    auto region = runs(alternating);
    HTRangeList list;
    list.addRegion(*region, kPage);
    list.addRegion(*region, kPage);
    EXPECT_EQ(list.sum(), (HTMemoryTotals{count / 2 * P, 0, count / 2 * P, 0, 0, 0}));
    EXPECT_TRUE(list.exact());
    uint64_t spans = 0;
    for (const HTRangeListNode* node = list.head(); node; node = node->next) ++spans;
    EXPECT_EQ(spans, count);

    // Descending addresses go in at the head.
    HTRangeList descending;
    for (uint64_t i = 300000; i > 0; --i)
        descending.addRange(2 * i * kPage, kPage, kPage, HTMemoryTotals{1, 0, 0, 0, 0, 0});
    EXPECT_EQ(descending.sum().dirty, 300000u);
    descending.clear();
    EXPECT_EQ(descending.head(), nullptr);
}
