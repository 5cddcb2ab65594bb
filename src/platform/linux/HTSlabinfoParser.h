#pragma once

// Parsing of /proc/slabinfo (version 2.x): after a version line and a line
// of column names, one line a slab cache. Pure functions from bytes to
// records.

#include <cstdint>
#include <string_view>
#include <vector>

struct HTSlabCache {
    // Points into the parsed text.
    std::string_view name;
    uint64_t activeObjects = 0;
    uint64_t objects = 0;
    uint64_t objectSize = 0;
    uint64_t objectsPerSlab = 0;
    uint64_t pagesPerSlab = 0;
    uint64_t activeSlabs = 0;
    uint64_t slabs = 0;
};

// Appends one record a cache line, in the order of the file; lines that are
// not cache lines are skipped. False when the text does not begin with a
// version 2 header, whose columns these are.
bool htParseSlabinfo(std::string_view text, std::vector<HTSlabCache>& caches);
