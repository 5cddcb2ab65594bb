#pragma once

// The page-level questions about a task's address space, answered from
// /proc/PID/pagemap (read in chunks, or scanned with PAGEMAP_SCAN where the
// kernel has it) and /proc/kpageflags when it is readable: each page's
// disposition, the identities of shared anonymous pages, and the populated
// runs of a range. The mappings they rely on come from the address space's
// smaps reading.

#include "platform/HTPlatform.h"
#include "platform/linux/HTFileDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <vector>

class HTLinuxTaskPort;

class HTLinuxPageQueries {
public:
    HTLinuxPageQueries() = default;
    HTLinuxPageQueries(const HTLinuxPageQueries&) = delete;
    HTLinuxPageQueries& operator=(const HTLinuxPageQueries&) = delete;

    // KERN_INVALID_ARGUMENT when the process is gone or a zombie.
    kern_return_t pageRangeQuery(HTTaskPort& task, uint64_t address, uint64_t size, int32_t* dispositions,
                                 uint64_t* count);
    // True when heft may read physical frame numbers from pagemap (as root).
    bool canIdentifySharedPages();
    // Frames of resident anonymous pages that are not mapped exclusively,
    // and swap slots where smaps shows shared swap (SwapPss below Swap).
    // Only private mappings whose smaps shows pages shared with other
    // processes are read; zero pages are left out.
    kern_return_t sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages, uint64_t* identities);
    // From the kernel's pagemap scan; the whole range where the kernel
    // lacks it.
    void populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs);

private:
    // The identities of the pages [from, to) of the task's mapping at
    // `index` into `identities`.
    kern_return_t identifyPages(HTLinuxTaskPort& task, size_t index, uint64_t from, uint64_t to, uint64_t* identities);
    // Whether the frame is a zero page, from its kpageflags.
    bool isZeroFrame(uint64_t frame);
    // /proc/kpageflags when heft may read it (as root), else -1; opened once.
    int kpageflagsFd();

    std::once_flag identifyOnce_;
    bool canIdentify_ = false;
    std::once_flag kpageflagsOnce_;
    HTFileDescriptor kpageflags_;
};
