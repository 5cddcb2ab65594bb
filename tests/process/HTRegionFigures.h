#pragma once

#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"

#include <ostream>

// A region's measured sizes as one value, so that a test states them together.
struct HTRegionFigures {
    uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0;
    bool operator==(const HTRegionFigures&) const = default;
};

inline std::ostream& operator<<(std::ostream& out, const HTRegionFigures& f)
{
    return out << "{d" << f.dirty << " s" << f.swapped << " c" << f.clean << " r" << f.reclaimable << "}";
}

inline HTRegionFigures figures(const HTMemoryRegion& region)
{
    return {region.dirtySize(), region.swappedSize(), region.cleanNonSpecSize(), region.reclaimableSize()};
}

// The page-range queries the fake platform answered, as {address, size}.
using HTPageQueries = decltype(HTFakePlatform::pageQueries);

// A scripted region with the page counts the kernel reports for it.
inline HTFakePlatform::Region withPages(HTFakePlatform::Region region, uint32_t resident, uint32_t dirtied,
                                        uint32_t swapped = 0)
{
    region.info.pages_resident = resident;
    region.info.pages_dirtied = dirtied;
    region.info.pages_swapped_out = swapped;
    return region;
}
