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
    scanStart_ = scanEnd_ = 0;
    scannedZeroRuns_.clear();
    hasParsedVmas_ = true;
}

void HTLinuxTaskPort::clearVmas()
{
    vmas_.clear();
    zeroPageAnswers_.clear();
    scanStart_ = scanEnd_ = 0;
    scannedZeroRuns_.clear();
    hasParsedVmas_ = false;
}

void HTLinuxTaskPort::releaseVmas()
{
    clearVmas();
    vmas_.shrink_to_fit();
    zeroPageAnswers_.shrink_to_fit();
    scannedZeroRuns_.shrink_to_fit();
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

void HTLinuxTaskPort::noteScan(uint64_t start, uint64_t end, const std::vector<HTPagemapRun>& runs)
{
    scanStart_ = start;
    scanEnd_ = end;
    scannedZeroRuns_.clear();
    for (const HTPagemapRun& run : runs)
        if (run.zeroPage) scannedZeroRuns_.emplace_back(run.start, run.end);
    // A huge page entry may map the huge zero page, which kernels have not
    // always reported as a zero page.
    auto run = runs.begin();
    for (auto vma = std::partition_point(vmas_.begin(), vmas_.end(),
                                         [start](const HTSmapsEntry& entry) { return entry.start < start; });
         vma != vmas_.end() && vma->end <= end; ++vma) {
        while (run != runs.end() && run->end <= vma->start) ++run;
        bool mayHoldZero = false;
        for (auto inside = run; inside != runs.end() && inside->start < vma->end; ++inside)
            mayHoldZero = mayHoldZero || inside->zeroPage || inside->huge;
        zeroPageAnswers_[static_cast<size_t>(vma - vmas_.begin())] = mayHoldZero ? kZeroPage : kNoZeroPage;
    }
}

bool HTLinuxTaskPort::zeroPageRunsFromScan(uint64_t from, uint64_t to,
                                           std::vector<std::pair<uint64_t, uint64_t>>& runs) const
{
    if (from < scanStart_ || to > scanEnd_) return false;
    runs.clear();
    for (const auto& [start, end] : scannedZeroRuns_)
        if (start < to && end > from) runs.emplace_back(std::max(start, from), std::min(end, to));
    return true;
}
