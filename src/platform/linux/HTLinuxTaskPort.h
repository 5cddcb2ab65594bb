#pragma once

#include "platform/HTTaskPort.h"
#include "platform/linux/HTPagemapScan.h"
#include "platform/linux/HTSmapsParser.h"

#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

// A handle on a live Linux process: its /proc/PID directory, through which
// every file of the process is read with openat. The directory stands for
// the process itself, not its number: once the process is gone nothing
// can be opened through it, even when the pid is recycled. The handle owns
// the descriptor.
//
// It also keeps what the address-space calls learnt of the process: the
// mappings of its smaps, parsed once per walk and then searched, and the
// descriptor of its pagemap. A handle is used by one thread at a time.
class HTLinuxTaskPort : public HTTaskPort {
public:
    // Takes ownership of the descriptor.
    HTLinuxTaskPort(int32_t pid, int procDirFd);
    ~HTLinuxTaskPort() override;
    HTLinuxTaskPort(const HTLinuxTaskPort&) = delete;
    HTLinuxTaskPort& operator=(const HTLinuxTaskPort&) = delete;

    int32_t pid() const override { return pid_; }
    int procDirFd() const { return procDirFd_; }

    // The mappings of the last parse, in address order.
    bool hasParsedVmas() const { return hasParsedVmas_; }
    const std::vector<HTSmapsEntry>& vmas() const { return vmas_; }
    // Parses a new smaps text, reusing the records of the last one.
    void parseVmas(std::string_view smaps);
    // Forgets the mappings: the next look-up reads them again.
    void clearVmas();
    // Marks the mappings just parsed as the ones the next walk of the
    // address space takes, instead of reading them anew as a walk does.
    void keepVmasForNextWalk() { keptForNextWalk_ = true; }
    // Whether the next walk takes the mappings parsed last; asking ends it.
    bool takeVmasKeptForWalk() { return std::exchange(keptForNextWalk_, false) && hasParsedVmas_; }
    // Forgets the mappings and frees what held them.
    void releaseVmas();
    // The first mapping whose end is above the address (the one holding
    // it, or the next one); null when there is none.
    const HTSmapsEntry* vmaAtOrAbove(uint64_t address) const;
    // The mapping that holds the address; null when none does.
    const HTSmapsEntry* vmaContaining(uint64_t address) const;

    // The process's pagemap, opened on first use after the last close; -1
    // with errno when it cannot be opened.
    int pagemapFd();
    void closePagemap();
    // Whether the mapping at `index` of the last parse may hold a zero page
    // (see htPagemapMayMapZeroPage); asked of the kernel once per parse.
    // nullopt when it cannot say.
    std::optional<bool> mayMapZeroPage(size_t index);
    // Keeps what a scan of the populated pages of [start, end) found: which
    // mappings wholly inside may hold a zero page, and where zero pages
    // are, so that neither is asked of the kernel again.
    void noteScan(uint64_t start, uint64_t end, const std::vector<HTPagemapRun>& runs);
    // The runs of zero pages in [from, to), when the last scan covered it;
    // false when it did not.
    bool zeroPageRunsFromScan(uint64_t from, uint64_t to, std::vector<std::pair<uint64_t, uint64_t>>& runs) const;

private:
    int32_t pid_;
    int procDirFd_;
    int pagemapFd_ = -1;
    bool hasParsedVmas_ = false;
    bool keptForNextWalk_ = false;
    std::vector<HTSmapsEntry> vmas_;
    // Per mapping, what mayMapZeroPage learnt.
    std::vector<uint8_t> zeroPageAnswers_;
    // The stretch the last scan covered, and the zero pages in it.
    uint64_t scanStart_ = 0;
    uint64_t scanEnd_ = 0;
    std::vector<std::pair<uint64_t, uint64_t>> scannedZeroRuns_;
};
