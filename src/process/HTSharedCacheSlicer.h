#pragma once

#include "platform/HTPlatform.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

class HTImageEnumerator;
class HTMemoryRegion;
class HTPageRunWalker;

// Cuts the mappings of a process's shared region (the shared library cache)
// into one piece per image segment and pieces of unused cache between them,
// and measures a writable piece page by page. Pieces need not start or end
// on a page boundary: a page that two pieces share is queried once, with
// the piece it ends, and counted for both.
//
// One slicer serves one process's walk, in ascending address order.
class HTSharedCacheSlicer {
public:
    // Measures a writable piece; false when a page query failed.
    using MeasureCallback =
        std::function<bool(const std::shared_ptr<HTMemoryRegion>& piece, const vm_region_submap_info_64& info)>;

    // Segments laid out on boundaries of this size own the padding up to the
    // next boundary.
    static constexpr uint64_t kAlignment = 4096;

    explicit HTSharedCacheSlicer(uint64_t pageSize) : pageSize_(pageSize) {}

    // Cuts one mapping of the shared region into image pieces and unused
    // pieces and appends them, measuring the writable ones with `measure`;
    // false when a measurement failed.
    bool addRegions(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t start, uint64_t size,
                    const vm_region_submap_info_64& info, HTImageEnumerator& enumerator,
                    const MeasureCallback& measure);

    // Measures one piece page by page: dirty and swapped bytes. KERN_SUCCESS
    // or the code of the page query that failed.
    kern_return_t measurePiece(const std::shared_ptr<HTMemoryRegion>& region, const HTPageRunWalker& walker);

private:
    uint64_t pageSize_;
    // The last page of the piece measured last, when the next piece starts
    // in it.
    uint64_t cachedDispositionAddress_ = 0;
    int32_t cachedDisposition_ = 0;
    // An unused piece whose last page the next piece's query measures.
    std::shared_ptr<HTMemoryRegion> pendingUnusedSharedRegion_;
};
