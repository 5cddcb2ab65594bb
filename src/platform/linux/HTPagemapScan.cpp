#include "platform/linux/HTPagemapScan.h"

#include <sys/ioctl.h>

#include <cstring>

namespace {

// The kernel's pagemap scan interface (linux/fs.h from 6.7 on), spelled out
// here because the build machine's headers may be older than the kernel
// heft runs on.
struct PageRegion {
    uint64_t start;
    uint64_t end;
    uint64_t categories;
};

struct PagemapScanArg {
    uint64_t size;
    uint64_t flags;
    uint64_t start;
    uint64_t end;
    uint64_t walk_end;
    uint64_t vec;
    uint64_t vec_len;
    uint64_t max_pages;
    uint64_t category_inverted;
    uint64_t category_mask;
    uint64_t category_anyof_mask;
    uint64_t return_mask;
};

constexpr uint64_t kPageIsPresent = 1 << 3;
constexpr uint64_t kPageIsSwapped = 1 << 4;
constexpr uint64_t kPageIsZeroFrame = 1 << 5;
constexpr uint64_t kPageIsHuge = 1 << 6;
constexpr unsigned long kPagemapScan = _IOWR('f', 16, PagemapScanArg);

// The first page in [start, end) with any of the categories; `end` when
// there is none.
std::optional<uint64_t> firstPageWithAny(int pagemapFd, uint64_t start, uint64_t end, uint64_t categories)
{
    if (start >= end) return end;
    PageRegion region{};
    PagemapScanArg arg{};
    arg.size = sizeof(arg);
    arg.start = start;
    arg.end = end;
    arg.vec = reinterpret_cast<uint64_t>(&region);
    arg.vec_len = 1;
    arg.max_pages = 1;
    arg.category_anyof_mask = categories;
    arg.return_mask = categories;
    long found = ::ioctl(pagemapFd, kPagemapScan, &arg);
    if (found < 0) return std::nullopt;
    return found == 0 ? end : region.start;
}

// Calls `found(start, end, categories)` for the runs of pages in
// [start, end) that have all of `required` and any of `anyOf`, in address
// order; runs are told apart by those categories and by `alsoReturned`.
// False when the kernel does not offer the scan or it fails.
template<typename Found>
bool scanRuns(int pagemapFd, uint64_t start, uint64_t end, uint64_t required, uint64_t anyOf, uint64_t alsoReturned,
              Found found)
{
    PageRegion regions[256];
    while (start < end) {
        PagemapScanArg arg{};
        arg.size = sizeof(arg);
        arg.start = start;
        arg.end = end;
        arg.vec = reinterpret_cast<uint64_t>(regions);
        arg.vec_len = sizeof(regions) / sizeof(regions[0]);
        arg.category_mask = required;
        arg.category_anyof_mask = anyOf;
        arg.return_mask = required | anyOf | alsoReturned;
        long count = ::ioctl(pagemapFd, kPagemapScan, &arg);
        if (count < 0) return false;
        for (long i = 0; i < count; ++i) found(regions[i].start, regions[i].end, regions[i].categories);
        // The kernel says where its walk stopped: at `end`, or where the
        // vector filled up.
        if (arg.walk_end <= start) return false;
        start = arg.walk_end;
    }
    return true;
}

}  // namespace

std::optional<bool> htPagemapMayMapZeroPage(int pagemapFd, uint64_t start, uint64_t end)
{
    std::optional<uint64_t> first = firstPageWithAny(pagemapFd, start, end, kPageIsZeroFrame | kPageIsHuge);
    if (!first) return std::nullopt;
    return *first < end;
}

bool htPagemapZeroPageRuns(int pagemapFd, uint64_t start, uint64_t end,
                           std::vector<std::pair<uint64_t, uint64_t>>& runs)
{
    runs.clear();
    return scanRuns(pagemapFd, start, end, kPageIsZeroFrame, 0, 0,
                    [&](uint64_t from, uint64_t to, uint64_t) { runs.emplace_back(from, to); });
}

bool htPagemapPopulatedRuns(int pagemapFd, uint64_t start, uint64_t end, std::vector<HTPagemapRun>& runs)
{
    runs.clear();
    return scanRuns(pagemapFd, start, end, 0, kPageIsPresent | kPageIsSwapped, kPageIsZeroFrame | kPageIsHuge,
                    [&](uint64_t from, uint64_t to, uint64_t categories) {
                        const HTPagemapRun run{from, to, (categories & kPageIsSwapped) != 0,
                                               (categories & kPageIsZeroFrame) != 0, (categories & kPageIsHuge) != 0};
                        // A walk cut short by a full vector goes on where it stopped.
                        HTPagemapRun* last = runs.empty() ? nullptr : &runs.back();
                        if (last && last->end == from && last->swapped == run.swapped &&
                            last->zeroPage == run.zeroPage && last->huge == run.huge)
                            last->end = to;
                        else
                            runs.push_back(run);
                    });
}
