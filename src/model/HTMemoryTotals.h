#pragma once

#include <cstdint>

// Five byte totals and a region count, the record in which sizes travel in
// and out of range lists and make up category and process totals. Range
// lists read and write the five sizes only; `regions` is for callers that
// count regions.
struct HTMemoryTotals {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
    uint32_t regions = 0;

    bool operator==(const HTMemoryTotals&) const = default;
};
