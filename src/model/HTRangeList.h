#pragma once

#include "model/HTMemoryTotals.h"

#include <cstdint>

class HTMemoryRegion;

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
// are kept in ascending order of start; spans whose page-aligned extents
// overlap or touch are merged, and the bytes of the pages they share are
// subtracted once from each total. Sizes are exact bytes; the page size only
// aligns extents and must be a power of two.
//
// A list is changed by one thread at a time and takes no lock.
class HTRangeList {
public:
    HTRangeList() = default;
    ~HTRangeList();
    HTRangeList(const HTRangeList&) = delete;
    HTRangeList& operator=(const HTRangeList&) = delete;

    // Adds [location, location + length) with its five totals, merging it
    // with every span whose aligned extent overlaps or touches it.
    void addRange(uint64_t location, uint64_t length, uint64_t pageSize, const HTMemoryTotals& memoryTotal);
    // Adds the region's sub-ranges when it has some, else the region whole,
    // placed at its offset in the object.
    void addRegion(const HTMemoryRegion& region, uint64_t pageSize);
    // The five totals summed over all spans; `regions` stays 0.
    HTMemoryTotals sum() const;
    // Frees every span.
    void clear();

    // The first span, or null when the list is empty; for readers that walk it.
    const HTRangeListNode* head() const { return head_; }

private:
    // Adds every span of the other list, in its order, as addRange would.
    void _addRangeList(const HTRangeList& other, uint64_t pageSize);

    HTRangeListNode* head_ = nullptr;
};
