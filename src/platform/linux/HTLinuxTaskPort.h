#pragma once

#include "platform/HTTaskPort.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTPagemapScan.h"
#include "platform/linux/HTSmapsParser.h"

#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

// A handle on a live Linux process, named by its pid and its start time
// (field 22 of its stat line, in clock ticks after boot).
//
// The handle holds no descriptor of the process between calls: a run over
// thousands of processes cannot keep one open for each. Every call that
// reads the process opens its directory anew (a DirectoryUse) and first
// reads the start time through it, so that a recycled pid is never read as
// the process: for another process to have the same pid, the pid space
// must have wrapped around since this one started, and the other's start
// time then differs, since no machine creates pid_max processes within one
// clock tick. A directory descriptor stays bound to the process it was
// opened on, so once its start time matches, nothing read through it can
// belong to another.
//
// The directory is /proc/PID, or, when the main thread has exited while
// other threads carry on, /proc/PID/task/TID of a live thread: the main
// thread then stays a zombie until the last one ends, and its own files
// read an empty address space, while every thread's files read the one
// they share.
//
// It also keeps what the address-space calls learnt of the process: the
// mappings of its smaps, parsed once per walk and then searched, and the
// descriptor of its pagemap while a walk is under way. A handle is used by
// one thread at a time.
class HTLinuxTaskPort : public HTTaskPort {
public:
    // A handle on the process `pid` that started at `startTime`; without
    // one, the first opening of the directory learns it.
    explicit HTLinuxTaskPort(int32_t pid, std::optional<uint64_t> startTime = std::nullopt);
    ~HTLinuxTaskPort() override;
    HTLinuxTaskPort(const HTLinuxTaskPort&) = delete;
    HTLinuxTaskPort& operator=(const HTLinuxTaskPort&) = delete;

    int32_t pid() const override { return pid_; }
    std::optional<uint64_t> startTime() const { return startTime_; }

    // Opens the directory through which the process is read, unless one is
    // open. The first opening learns the start time, every later one checks
    // it. False with errno: ESRCH when the process is gone or its pid now
    // names another one.
    bool openDirectory();
    void closeDirectory();
    // The open directory; -1 when none is.
    int procDirFd() const { return procDirFd_.get(); }

    // Keeps the directory open for its own lifetime, opening it unless it
    // is open already, and then closes what it opened.
    class DirectoryUse {
    public:
        explicit DirectoryUse(HTLinuxTaskPort& task);
        ~DirectoryUse();
        DirectoryUse(const DirectoryUse&) = delete;
        DirectoryUse& operator=(const DirectoryUse&) = delete;
        // The directory; -1 with errno set when it could not be opened.
        int fd() const;

    private:
        HTLinuxTaskPort& task_;
        bool opened_ = false;
        int error_ = 0;
    };

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
    std::optional<uint64_t> startTime_;
    HTFileDescriptor procDirFd_;
    HTFileDescriptor pagemapFd_;
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
