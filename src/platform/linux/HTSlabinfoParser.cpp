#include "platform/linux/HTSlabinfoParser.h"

#include "platform/linux/HTProcText.h"

namespace {

// Reads the next words as numbers into `fields`; false at the first word
// that is not one.
template<size_t Count>
bool takeNumbers(std::string_view& line, uint64_t* const (&fields)[Count])
{
    for (uint64_t* field : fields) {
        auto value = htNumber<uint64_t>(htTakeWord(line));
        if (!value) return false;
        *field = *value;
    }
    return true;
}

bool takeLabel(std::string_view& line, std::string_view label)
{
    return htTakeWord(line) == ":" && htTakeWord(line) == label;
}

// "name active num size perslab pages : tunables l b s : slabdata active num
// shared", and with the SLAB allocator's statistics more groups after it.
bool parseCacheLine(std::string_view line, HTSlabCache& cache)
{
    cache.name = htTakeWord(line);
    uint64_t unused = 0;
    uint64_t* const counts[] = {&cache.activeObjects, &cache.objects, &cache.objectSize, &cache.objectsPerSlab,
                                &cache.pagesPerSlab};
    uint64_t* const tunables[] = {&unused, &unused, &unused};
    uint64_t* const slabdata[] = {&cache.activeSlabs, &cache.slabs, &unused};
    return !cache.name.empty() && takeNumbers(line, counts) && takeLabel(line, "tunables") &&
        takeNumbers(line, tunables) && takeLabel(line, "slabdata") && takeNumbers(line, slabdata);
}

}  // namespace

bool htParseSlabinfo(std::string_view text, std::vector<HTSlabCache>& caches)
{
    if (!htTakeLine(text).starts_with("slabinfo - version: 2.")) return false;
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        HTSlabCache cache;
        if (parseCacheLine(line, cache)) caches.push_back(cache);
    }
    return true;
}
