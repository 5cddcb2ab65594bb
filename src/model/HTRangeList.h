#pragma once

#include "model/HTMemoryTotals.h"

#include <cstdint>

class HTMemoryRegion;
struct HTRangeListTally;

// One disjoint span of a range list, in bytes of the object's offset space.
// A plain heap block: the list is walked node by node and keeps no index.
struct HTRangeListNode {
    uint64_t start;
    uint64_t size;
    uint64_t clean;
    uint64_t dirty;
    uint64_t swapped;
    uint64_t reclaimable;
    uint64_t wired;
    HTRangeListNode* next;
};

// Counts each page of a VM object once, however many regions map it. Spans
// are kept in ascending order of start and their page-aligned extents never
// overlap. Sizes are exact bytes; the page size only aligns extents and must
// be a power of two.
//
// Each of the five totals is a union of pages of its own kind. A span's total
// is exact when it is 0 or the span's size: it then says which pages are of
// that kind. Page-aligned ranges whose totals are all exact (the runs of one
// kind a region is made of) are laid over the spans page by page, cutting
// spans where they differ, so their totals are the union of their pages.
// Touching spans stay apart unless both are exact in every kind with the same
// full kinds; those are joined so that runs stay few. Where a total is
// inexact, the spans a range overlaps are merged into one and get a lower
// bound of the union: never below any one input, never above their sum.
//
// Adding ranges in ascending order costs a constant each: the list remembers
// where the last one went and starts looking from there.
//
// A list is changed by one thread at a time and takes no lock.
class HTRangeList {
public:
    HTRangeList() = default;
    ~HTRangeList();
    HTRangeList(const HTRangeList&) = delete;
    HTRangeList& operator=(const HTRangeList&) = delete;

    // Adds [location, location + length) with its five totals, combining it
    // with every span whose aligned extent shares a page with it. A range
    // that holds no page (zero length on a page boundary) adds nothing.
    void addRange(uint64_t location, uint64_t length, uint64_t pageSize, const HTMemoryTotals& memoryTotal);
    // Adds the region's sub-ranges when it has some, else the region whole,
    // placed at its offset in the object.
    void addRegion(const HTMemoryRegion& region, uint64_t pageSize);
    // The five totals summed over all spans; `regions` stays 0.
    HTMemoryTotals sum() const;
    // Frees every span; the list is exact again.
    void clear();
    // True while no addition had to settle for a lower bound: the totals are
    // then the union of the pages of every kind added.
    bool exact() const { return exact_; }

    // The first span, or null when the list is empty; for readers that walk it.
    const HTRangeListNode* head() const { return head_; }

private:
    // Adds every span of the other list, in its order, as addRange would,
    // except that its exact runs count together on an inexact span.
    void _addRangeList(const HTRangeList& other, uint64_t pageSize);
    // Adds one range; `tally` carries what the ranges of one list laid on an
    // inexact span from one addition to the next.
    void _addRange(const HTRangeListNode& added, uint64_t pageSize, HTRangeListTally& tally);
    // The last span whose aligned extent ends at or before `alignedStart`, or
    // null when there is none.
    HTRangeListNode* _nodeBefore(uint64_t alignedStart, uint64_t pageSize) const;

    HTRangeListNode* head_ = nullptr;
    // A span that ended before the last range added, where the search for
    // the next one starts when it begins no earlier; null for the head.
    HTRangeListNode* hint_ = nullptr;
    bool exact_ = true;
};
