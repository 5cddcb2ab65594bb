#pragma once

#include "platform/HTTaskPort.h"
#include "platform/linux/HTSmapsParser.h"

#include <cstdint>
#include <optional>
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

private:
    int32_t pid_;
    int procDirFd_;
    int pagemapFd_ = -1;
    bool hasParsedVmas_ = false;
    std::vector<HTSmapsEntry> vmas_;
    // Per mapping, what mayMapZeroPage learnt.
    std::vector<uint8_t> zeroPageAnswers_;
};
