#pragma once

// One stretch of consecutive pages of a page query: their pagemap entries,
// their mappings, and the kpageflags of the physical pages behind them.
// Reused from one query to the next, so a query allocates nothing.

#include "platform/linux/HTPageDisposition.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <utility>

class HTPageQueryChunk {
public:
    // 32 KiB of pagemap at a time.
    static constexpr size_t kPages = 4096;

    std::array<uint64_t, kPages> entries;
    std::array<HTPageMapping, kPages> mappings;

    // Reads the flags of the first `count` pages' frames from /proc/kpageflags
    // (`kpageflagsFd`, -1 when it cannot be read), skipping the pages whose
    // flags cannot change their disposition.
    void readPageFlags(int kpageflagsFd, size_t count);
    int32_t disposition(size_t at) const
    {
        return htPageDisposition(entries[at], known_[at] ? &flags_[at] : nullptr, mappings[at]);
    }

private:
    void readWindow(int kpageflagsFd, size_t first, size_t last);

    std::array<uint64_t, kPages> flags_;
    std::array<bool, kPages> known_;
    // (frame, page index) of the pages whose flags are wanted, in frame order.
    std::array<std::pair<uint64_t, uint32_t>, kPages> wanted_;
    std::array<uint64_t, kPages> window_;
};
