#pragma once

#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

// A run [start, end) of resident pages, or of pages swapped out, all of one
// kind: zero pages (the shared zero page), pages mapped by a huge page
// entry, or neither.
struct HTPagemapRun {
    uint64_t start;
    uint64_t end;
    bool swapped;
    bool zeroPage = false;
    bool huge = false;
};

// Asks the kernel, through the pagemap's scan request, for the runs of
// pages in [start, end) that are resident or swapped out, in address order,
// into `runs`. The kernel walks its page tables and steps over empty
// stretches whole, so a terabyte-sized sparse reservation costs what its
// populated pages cost, not one entry per page. The same walk says which
// pages are zero pages or huge, so that nothing else need walk the range
// again for them. False when the kernel does not offer the request
// (kernels before 6.7) or it fails.
bool htPagemapPopulatedRuns(int pagemapFd, uint64_t start, uint64_t end, std::vector<HTPagemapRun>& runs);

// Whether any page in [start, end) may be a zero page: the shared zero
// page, left by a read of anonymous memory never written, or a page mapped
// by a huge page entry, as the huge zero page is (kernels have not always
// reported that one as a zero page). nullopt when the kernel cannot say.
std::optional<bool> htPagemapMayMapZeroPage(int pagemapFd, uint64_t start, uint64_t end);

// The runs [start, end) of pages in [start, end) that map a zero page (the
// shared zero page or the huge zero page), in address order, into `runs`.
// False when the kernel does not offer the scan or it fails.
bool htPagemapZeroPageRuns(int pagemapFd, uint64_t start, uint64_t end,
                           std::vector<std::pair<uint64_t, uint64_t>>& runs);
