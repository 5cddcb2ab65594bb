#include "model/HTRangeList.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"

#include <algorithm>
#include <iterator>
#include <optional>

namespace {

// The five totals of a span, in the order the per-kind loops below use.
constexpr uint64_t HTRangeListNode::*kKinds[] = {&HTRangeListNode::dirty, &HTRangeListNode::swapped,
                                                 &HTRangeListNode::clean, &HTRangeListNode::reclaimable,
                                                 &HTRangeListNode::wired};
constexpr size_t kKindCount = std::size(kKinds);

}  // namespace

// What the exact runs of one list have laid on the inexact span they last
// covered. The runs of a list share no page, so the span holds at least as
// many bytes of a kind as they lay on it all told, not just as many as the
// largest of them: one process's runs over a span that another process
// reported only in totals then still count in full.
struct HTRangeListTally {
    const HTRangeListNode* node = nullptr;
    uint64_t before[kKindCount] = {};
    uint64_t laid[kKindCount] = {};
};

namespace {

// The kinds that fill a span wholly, one bit per entry of kKinds.
using KindSet = uint8_t;

bool fills(KindSet kinds, size_t kind) { return (kinds >> kind) & 1u; }

uint64_t roundDown(uint64_t value, uint64_t pageSize) { return value & ~(pageSize - 1); }
uint64_t roundUp(uint64_t value, uint64_t pageSize) { return (value + pageSize - 1) & ~(pageSize - 1); }

uint64_t end(const HTRangeListNode& node) { return node.start + node.size; }
uint64_t alignedStart(const HTRangeListNode& node, uint64_t pageSize) { return roundDown(node.start, pageSize); }
uint64_t alignedEnd(const HTRangeListNode& node, uint64_t pageSize) { return roundUp(end(node), pageSize); }

// The kinds that fill the span, when it is page aligned and every total is 0
// or its size; otherwise nullopt, for the span does not say which of its
// pages hold a kind it has some of. A span that shares a page with another
// says nothing about that page either, so unaligned spans are never exact.
std::optional<KindSet> fullKinds(const HTRangeListNode& node, uint64_t pageSize)
{
    if (node.size == 0 || ((node.start | node.size) & (pageSize - 1)) != 0) return std::nullopt;
    KindSet full = 0;
    for (size_t kind = 0; kind < kKindCount; ++kind) {
        const uint64_t total = node.*kKinds[kind];
        if (total == node.size)
            full |= static_cast<KindSet>(1u << kind);
        else if (total != 0)
            return std::nullopt;
    }
    return full;
}

// Sets every total of the span to its size or 0, as `full` says.
void fill(HTRangeListNode& node, KindSet full)
{
    for (size_t kind = 0; kind < kKindCount; ++kind) node.*kKinds[kind] = fills(full, kind) ? node.size : 0;
}

// Links a new span [start, start + size) filled as `full` says at *link;
// returns the link that follows it.
HTRangeListNode** insertFilled(HTRangeListNode** link, uint64_t start, uint64_t size, KindSet full)
{
    auto* node = new HTRangeListNode{start, size, 0, 0, 0, 0, 0, *link};
    fill(*node, full);
    *link = node;
    return &node->next;
}

// The exact span at *link lies under [at, to) of an exact range: cuts off
// the parts of the span outside the range, which keep the span's kinds, and
// gives the shared part the kinds of both (a page is of a kind when either
// view says so). Returns the link after the shared part.
HTRangeListNode** overlayExactNode(HTRangeListNode** link, uint64_t at, uint64_t to, KindSet full, KindSet nodeFull)
{
    HTRangeListNode* node = *link;
    if (node->start < at) {
        link = insertFilled(link, node->start, at - node->start, nodeFull);
        node->size = end(*node) - at;
        node->start = at;
    }
    if (end(*node) > to) {
        insertFilled(&node->next, to, end(*node) - to, nodeFull);
        node->size = to - node->start;
    }
    fill(*node, nodeFull | full);
    return &node->next;
}

// An inexact span lies under [at, covered) of an exact range and takes that
// part in, growing to cover it. Which of its pages hold a kind is unknown, so
// a kind the range fills there can only be said to cover at least
// `covered - at` bytes of the span, added to what earlier runs of the same
// list laid there; a kind the range lacks adds nothing.
void raiseInexactNode(HTRangeListNode& node, uint64_t at, uint64_t covered, KindSet full, HTRangeListTally& tally)
{
    if (tally.node != &node) {
        tally.node = &node;
        for (size_t kind = 0; kind < kKindCount; ++kind) {
            tally.before[kind] = node.*kKinds[kind];
            tally.laid[kind] = 0;
        }
    }
    for (size_t kind = 0; kind < kKindCount; ++kind) {
        if (!fills(full, kind)) continue;
        tally.laid[kind] += covered - at;
        node.*kKinds[kind] = std::max(tally.before[kind], tally.laid[kind]);
    }
    const uint64_t grownEnd = std::max(end(node), covered);
    node.start = std::min(node.start, at);
    node.size = grownEnd - node.start;
}

// Lays the page-aligned range [from, to), full of the kinds in `full`, over
// the spans from *link on. Parts of it that no span lies under become spans
// of their own. Returns false when an inexact span lay under it and a lower
// bound had to do.
bool overlayExact(HTRangeListNode** link, uint64_t from, uint64_t to, KindSet full, uint64_t pageSize,
                  HTRangeListTally& tally)
{
    bool exact = true;
    uint64_t at = from;
    while (at < to) {
        HTRangeListNode* node = *link;
        const uint64_t nodeStart = node ? alignedStart(*node, pageSize) : to;
        if (nodeStart >= to) {
            insertFilled(link, at, to - at, full);
            break;
        }
        if (nodeStart > at) {
            link = insertFilled(link, at, nodeStart - at, full);
            at = nodeStart;
        }
        const uint64_t covered = std::min(alignedEnd(*node, pageSize), to);
        if (std::optional<KindSet> nodeFull = fullKinds(*node, pageSize)) {
            link = overlayExactNode(link, at, covered, full, *nodeFull);
        } else {
            raiseInexactNode(*node, at, covered, full, tally);
            link = &node->next;
            exact = false;
        }
        at = covered;
    }
    return exact;
}

// Merges `added` with every span from *link on that shares a page with it
// into one span over all their extents, and links it at *link; returns
// whether any span was merged. Per kind, the spans' totals summed (S) are
// disjoint bytes, and at most K of them can lie on the range's pages (each
// span's total capped by the pages it shares with the range). So at least
// r - K of the range's r bytes lie outside them and the union is at least
// S + max(0, r - K): never below any one input, never above their sum.
bool mergeInexact(HTRangeListNode** link, HTRangeListNode* added, uint64_t pageSize)
{
    const uint64_t from = alignedStart(*added, pageSize);
    const uint64_t to = alignedEnd(*added, pageSize);
    uint64_t sums[kKindCount] = {};
    uint64_t onRange[kKindCount] = {};
    bool merged = false;
    HTRangeListNode* node = *link;
    while (node && alignedStart(*node, pageSize) < to) {
        const uint64_t shared =
            std::min(alignedEnd(*node, pageSize), to) - std::max(alignedStart(*node, pageSize), from);
        for (size_t kind = 0; kind < kKindCount; ++kind) {
            sums[kind] += node->*kKinds[kind];
            onRange[kind] += std::min(node->*kKinds[kind], shared);
        }
        const uint64_t mergedEnd = std::max(end(*added), end(*node));
        added->start = std::min(added->start, node->start);
        added->size = mergedEnd - added->start;

        HTRangeListNode* next = node->next;
        delete node;
        node = next;
        merged = true;
    }
    for (size_t kind = 0; kind < kKindCount; ++kind) {
        const uint64_t range = added->*kKinds[kind];
        added->*kKinds[kind] = sums[kind] + (range > onRange[kind] ? range - onRange[kind] : 0);
    }
    added->next = node;
    *link = added;
    return merged;
}

// Touching spans exact in every kind with the same full kinds say no more
// apart than joined.
bool joinable(const HTRangeListNode& first, const HTRangeListNode& second, uint64_t pageSize)
{
    if (end(first) != second.start) return false;
    std::optional<KindSet> firstFull = fullKinds(first, pageSize);
    return firstFull && firstFull == fullKinds(second, pageSize);
}

// Joins the joinable neighbours from `node` through the first span that
// starts at or after `to`: the stretch an addition changed and its edges.
// A span the tally follows may have become exact and be joined away.
void coalesce(HTRangeListNode* node, uint64_t to, uint64_t pageSize, HTRangeListTally& tally)
{
    while (node && node->next && alignedStart(*node->next, pageSize) <= to) {
        HTRangeListNode* next = node->next;
        if (!joinable(*node, *next, pageSize)) {
            node = next;
            continue;
        }
        node->size += next->size;
        for (uint64_t HTRangeListNode::*total : kKinds) node->*total += next->*total;
        node->next = next->next;
        if (tally.node == next) tally.node = nullptr;
        delete next;
    }
}

}  // namespace

HTRangeList::~HTRangeList() { clear(); }

void HTRangeList::clear()
{
    // A loop, not recursion: a list can hold hundreds of thousands of spans.
    while (head_) {
        HTRangeListNode* next = head_->next;
        delete head_;
        head_ = next;
    }
    hint_ = nullptr;
    exact_ = true;
}

HTRangeListNode* HTRangeList::_nodeBefore(uint64_t alignedStart, uint64_t pageSize) const
{
    // Ranges mostly come in ascending order: the span before the last one
    // added is then before this one too, and the walk is short.
    HTRangeListNode* node = hint_ && alignedEnd(*hint_, pageSize) <= alignedStart ? hint_ : nullptr;
    HTRangeListNode* next = node ? node->next : head_;
    while (next && alignedEnd(*next, pageSize) <= alignedStart) {
        node = next;
        next = next->next;
    }
    return node;
}

void HTRangeList::addRange(uint64_t location, uint64_t length, uint64_t pageSize, const HTMemoryTotals& memoryTotal)
{
    const HTRangeListNode added{
        location,          length, memoryTotal.clean, memoryTotal.dirty, memoryTotal.swapped, memoryTotal.reclaimable,
        memoryTotal.wired, nullptr};
    HTRangeListTally tally;
    _addRange(added, pageSize, tally);
}

void HTRangeList::_addRange(const HTRangeListNode& added, uint64_t pageSize, HTRangeListTally& tally)
{
    const uint64_t from = alignedStart(added, pageSize);
    const uint64_t to = alignedEnd(added, pageSize);
    if (from == to) return;

    HTRangeListNode* before = _nodeBefore(from, pageSize);
    HTRangeListNode** link = before ? &before->next : &head_;
    bool exact;
    if (std::optional<KindSet> full = fullKinds(added, pageSize)) {
        exact = overlayExact(link, from, to, *full, pageSize, tally);
    } else {
        // The merged span is a new one, which the tally must not take for
        // the span it followed.
        tally.node = nullptr;
        exact = !mergeInexact(link, new HTRangeListNode(added), pageSize);
    }
    if (!exact) exact_ = false;

    coalesce(before ? before : head_, to, pageSize, tally);
    // `before` survives both: it ends before the range and takes in, never
    // is taken into, a neighbour.
    hint_ = before;
}

void HTRangeList::_addRangeList(const HTRangeList& other, uint64_t pageSize)
{
    HT_ASSERT("HTRangeList", &other != this, "&other != this");
    // The other list ascends, so each addition starts where the last one
    // left off (see _nodeBefore): one pass over both lists.
    HTRangeListTally tally;
    for (const HTRangeListNode* node = other.head_; node; node = node->next) _addRange(*node, pageSize, tally);
}

void HTRangeList::addRegion(const HTMemoryRegion& region, uint64_t pageSize)
{
    if (const HTRangeList* subranges = region.subrangeList()) {
        _addRangeList(*subranges, pageSize);
        return;
    }
    HTMemoryTotals totals{region.dirtySize(),       region.swappedSize(), region.cleanNonSpecSize(),
                          region.reclaimableSize(), region.wiredSize(),   0};
    addRange(region.offset(), region.size(), pageSize, totals);
}

HTMemoryTotals HTRangeList::sum() const
{
    HTMemoryTotals totals;
    for (const HTRangeListNode* node = head_; node; node = node->next) {
        totals.dirty += node->dirty;
        totals.swapped += node->swapped;
        totals.clean += node->clean;
        totals.reclaimable += node->reclaimable;
        totals.wired += node->wired;
    }
    return totals;
}
