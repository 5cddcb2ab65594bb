#include "platform/linux/HTPageQueryChunk.h"

#include "platform/linux/HTPreadFully.h"

#include <algorithm>

namespace {

// Frames this close to each other are read in one pread: reading a few
// unwanted entries costs far less than another system call. Pages of one
// mapping often sit on nearby frames, though not in address order.
constexpr uint64_t kWindowGap = 32;

}  // namespace

void HTPageQueryChunk::readPageFlags(int kpageflagsFd, size_t count)
{
    std::fill(known_.begin(), known_.begin() + static_cast<ptrdiff_t>(count), false);
    if (kpageflagsFd < 0) return;
    size_t wanted = 0;
    for (size_t at = 0; at < count; ++at) {
        uint64_t frame = htPagemapFrame(entries[at]);
        if (frame != 0 && htPageFlagsMatter(entries[at], mappings[at]))
            wanted_[wanted++] = {frame, static_cast<uint32_t>(at)};
    }
    std::sort(wanted_.begin(), wanted_.begin() + static_cast<ptrdiff_t>(wanted));
    for (size_t first = 0; first < wanted;) {
        size_t last = first;
        while (last + 1 < wanted && wanted_[last + 1].first - wanted_[first].first < kPages &&
               wanted_[last + 1].first - wanted_[last].first <= kWindowGap)
            ++last;
        readWindow(kpageflagsFd, first, last);
        first = last + 1;
    }
}

// Reads the flags of the frames wanted_[first] to wanted_[last] in one go.
void HTPageQueryChunk::readWindow(int kpageflagsFd, size_t first, size_t last)
{
    uint64_t base = wanted_[first].first;
    size_t length = static_cast<size_t>(wanted_[last].first - base + 1) * sizeof(uint64_t);
    ssize_t done = htPreadFully(kpageflagsFd, window_.data(), length, base * sizeof(uint64_t));
    // Frames past the end of memory read short and stay unknown.
    size_t known = done > 0 ? static_cast<size_t>(done) / sizeof(uint64_t) : 0;
    for (size_t at = first; at <= last; ++at) {
        uint64_t offset = wanted_[at].first - base;
        if (offset >= known) break;
        flags_[wanted_[at].second] = window_[offset];
        known_[wanted_[at].second] = true;
    }
}
