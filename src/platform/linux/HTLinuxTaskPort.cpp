#include "platform/linux/HTLinuxTaskPort.h"

#include "platform/linux/HTPagemapScan.h"

#include <algorithm>
#include <fcntl.h>
#include <unistd.h>

namespace {
enum : uint8_t { kNotAsked, kNoZeroPage, kZeroPage, kUnknown };
}

HTLinuxTaskPort::HTLinuxTaskPort(int32_t pid, int procDirFd) : pid_(pid), procDirFd_(procDirFd)
{
}

HTLinuxTaskPort::~HTLinuxTaskPort()
{
    if (pagemapFd_ >= 0) ::close(pagemapFd_);
    if (procDirFd_ >= 0) ::close(procDirFd_);
}

void HTLinuxTaskPort::parseVmas(std::string_view smaps)
{
    htParseSmaps(smaps, vmas_);
    zeroPageAnswers_.assign(vmas_.size(), kNotAsked);
    hasParsedVmas_ = true;
}

void HTLinuxTaskPort::clearVmas()
{
    vmas_.clear();
    zeroPageAnswers_.clear();
    hasParsedVmas_ = false;
}

void HTLinuxTaskPort::releaseVmas()
{
    clearVmas();
    vmas_.shrink_to_fit();
    zeroPageAnswers_.shrink_to_fit();
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

void HTLinuxTaskPort::closePagemap()
{
    if (pagemapFd_ >= 0) ::close(pagemapFd_);
    pagemapFd_ = -1;
}

std::optional<bool> HTLinuxTaskPort::mayMapZeroPage(size_t index)
{
    if (index >= vmas_.size()) return std::nullopt;
    uint8_t& answer = zeroPageAnswers_[index];
    if (answer == kNotAsked) {
        int pagemap = pagemapFd();
        std::optional<bool> found =
            pagemap < 0 ? std::nullopt : htPagemapMayMapZeroPage(pagemap, vmas_[index].start, vmas_[index].end);
        answer = !found ? kUnknown : *found ? kZeroPage : kNoZeroPage;
    }
    if (answer == kUnknown) return std::nullopt;
    return answer == kZeroPage;
}
