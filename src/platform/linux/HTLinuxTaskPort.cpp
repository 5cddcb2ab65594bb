#include "platform/linux/HTLinuxTaskPort.h"

#include <algorithm>
#include <fcntl.h>
#include <unistd.h>

HTLinuxTaskPort::HTLinuxTaskPort(int32_t pid, int procDirFd, int pidFd)
    : pid_(pid), procDirFd_(procDirFd), pidFd_(pidFd)
{
}

HTLinuxTaskPort::~HTLinuxTaskPort()
{
    if (pagemapFd_ >= 0) ::close(pagemapFd_);
    if (procDirFd_ >= 0) ::close(procDirFd_);
    if (pidFd_ >= 0) ::close(pidFd_);
}

void HTLinuxTaskPort::parseVmas(std::string_view smaps)
{
    htParseSmaps(smaps, vmas_);
    hasParsedVmas_ = true;
}

void HTLinuxTaskPort::clearVmas()
{
    vmas_.clear();
    hasParsedVmas_ = false;
}

const HTSmapsEntry* HTLinuxTaskPort::vmaAtOrAbove(uint64_t address) const
{
    // Mappings do not overlap, so their ends ascend with their starts.
    auto found = std::partition_point(vmas_.begin(), vmas_.end(),
                                      [address](const HTSmapsEntry& vma) { return vma.end <= address; });
    return found == vmas_.end() ? nullptr : &*found;
}

const HTSmapsEntry* HTLinuxTaskPort::vmaContaining(uint64_t address) const
{
    const HTSmapsEntry* vma = vmaAtOrAbove(address);
    return vma != nullptr && vma->start <= address ? vma : nullptr;
}

int HTLinuxTaskPort::pagemapFd()
{
    if (pagemapFd_ < 0) pagemapFd_ = ::openat(procDirFd_, "pagemap", O_RDONLY | O_CLOEXEC);
    return pagemapFd_;
}
