#include "model/HTRangeList.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"

#include <algorithm>

namespace {

uint64_t roundDown(uint64_t value, uint64_t pageSize) { return value & ~(pageSize - 1); }
uint64_t roundUp(uint64_t value, uint64_t pageSize) { return (value + pageSize - 1) & ~(pageSize - 1); }

uint64_t alignedStart(const HTRangeListNode& node, uint64_t pageSize) { return roundDown(node.start, pageSize); }
uint64_t alignedEnd(const HTRangeListNode& node, uint64_t pageSize)
{
    return roundUp(node.start + node.size, pageSize);
}

// Combines one total of two spans that share `overlap` bytes of pages: the
// shared bytes count once, yet the result is never below either input (a
// span may report fewer bytes than its pages hold) and never wraps.
uint64_t mergeTotal(uint64_t a, uint64_t b, uint64_t overlap)
{
    uint64_t combined = a + b;
    return std::max(combined - std::min(combined, overlap), std::max(a, b));
}

// Folds `absorbed` into `merged`. The overlap is measured against the range
// being added ([addedStart, addedEnd), aligned), never against the grown
// merged span: each absorbed span was disjoint from the others, so this is
// the same as measuring against everything merged so far.
void absorbNode(HTRangeListNode& merged, const HTRangeListNode& absorbed, uint64_t addedStart, uint64_t addedEnd,
                uint64_t pageSize)
{
    uint64_t lower = std::max(addedStart, alignedStart(absorbed, pageSize));
    uint64_t upper = std::min(addedEnd, alignedEnd(absorbed, pageSize));
    uint64_t overlap = upper > lower ? upper - lower : 0;

    merged.dirty = mergeTotal(merged.dirty, absorbed.dirty, overlap);
    merged.swapped = mergeTotal(merged.swapped, absorbed.swapped, overlap);
    merged.clean = mergeTotal(merged.clean, absorbed.clean, overlap);
    merged.reclaimable = mergeTotal(merged.reclaimable, absorbed.reclaimable, overlap);
    merged.wired = mergeTotal(merged.wired, absorbed.wired, overlap);

    uint64_t end = std::max(merged.start + merged.size, absorbed.start + absorbed.size);
    merged.start = std::min(merged.start, absorbed.start);
    merged.size = end - merged.start;
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
}

void HTRangeList::addRange(uint64_t location, uint64_t length, uint64_t pageSize, const HTMemoryTotals& memoryTotal)
{
    const uint64_t addedStart = roundDown(location, pageSize);
    const uint64_t addedEnd = roundUp(location + length, pageSize);
    auto* added = new HTRangeListNode{location,          length,
                                      memoryTotal.clean, memoryTotal.dirty,
                                      memoryTotal.swapped, memoryTotal.reclaimable,
                                      memoryTotal.wired, nullptr};

    // `link` ends at the pointer to the first span that is not wholly before
    // the added range; `after` is the first span wholly after it.
    HTRangeListNode** link = &head_;
    HTRangeListNode* after = head_;
    while (after && alignedStart(*after, pageSize) <= addedEnd) {
        if (alignedEnd(*after, pageSize) < addedStart) link = &after->next;
        after = after->next;
    }

    // Every span from *link up to `after` overlaps or touches the range.
    HTRangeListNode* touching = *link;
    while (touching != after) {
        HTRangeListNode* next = touching->next;
        absorbNode(*added, *touching, addedStart, addedEnd, pageSize);
        delete touching;
        touching = next;
    }
    added->next = after;
    *link = added;
}

void HTRangeList::_addRangeList(const HTRangeList& other, uint64_t pageSize)
{
    HT_ASSERT("HTRangeList", &other != this, "rangeList != self");
    for (const HTRangeListNode* node = other.head_; node; node = node->next) {
        HTMemoryTotals totals{node->dirty, node->swapped, node->clean, node->reclaimable, node->wired, 0};
        addRange(node->start, node->size, pageSize, totals);
    }
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
