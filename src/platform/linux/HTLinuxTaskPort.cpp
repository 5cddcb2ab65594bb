#include "platform/linux/HTLinuxTaskPort.h"

#include "platform/linux/HTLiveThread.h"
#include "platform/linux/HTPagemapScan.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <unistd.h>

namespace {
enum : uint8_t { kNotAsked, kNoZeroPage, kZeroPage, kUnknown };
}  // namespace

HTLinuxTaskPort::HTLinuxTaskPort(int32_t pid, std::optional<uint64_t> startTime) : pid_(pid), startTime_(startTime) {}

HTLinuxTaskPort::~HTLinuxTaskPort() = default;

bool HTLinuxTaskPort::openDirectory()
{
    if (procDirFd_.isOpen()) return true;
    char path[32] = "/proc/";
    *std::to_chars(path + 6, path + sizeof(path) - 1, pid_).ptr = '\0';
    HTFileDescriptor process(::open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!process.isOpen()) {
        if (errno == ENOENT) errno = ESRCH;
        return false;
    }
    thread_local HTProcBuffer buffer;
    const bool read = buffer.readFile(process.get(), "stat", HTProcBuffer::End::ShortRead);
    std::optional<HTProcStat> stat = read ? htParseProcStat(buffer.view()) : std::nullopt;
    if (!stat || (startTime_ && stat->starttime != *startTime_)) {
        // Gone, or the pid names another process now.
        int error = read || errno == ENOENT ? ESRCH : errno;
        process.reset();
        errno = error;
        return false;
    }
    startTime_ = stat->starttime;
    // A main thread that has exited reads an empty address space: a live
    // thread reads the process's. With none left the process is a zombie,
    // and reads through its own directory say so.
    if (stat->hasExited()) {
        HTFileDescriptor thread = htOpenLiveThreadDirectory(process.get());
        if (thread.isOpen()) process = std::move(thread);
    }
    procDirFd_ = std::move(process);
    return true;
}

void HTLinuxTaskPort::closeDirectory() { procDirFd_.reset(); }

HTLinuxTaskPort::DirectoryUse::DirectoryUse(HTLinuxTaskPort& task) : task_(task)
{
    if (task.procDirFd_.isOpen()) return;
    opened_ = task.openDirectory();
    if (!opened_) error_ = errno;
}

HTLinuxTaskPort::DirectoryUse::~DirectoryUse()
{
    if (opened_) task_.closeDirectory();
}

int HTLinuxTaskPort::DirectoryUse::fd() const
{
    if (!task_.procDirFd_.isOpen()) errno = error_;
    return task_.procDirFd_.get();
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
    if (pagemapFd_.isOpen()) return pagemapFd_.get();
    DirectoryUse directory(*this);
    if (directory.fd() < 0) return -1;
    pagemapFd_.reset(::openat(directory.fd(), "pagemap", O_RDONLY | O_CLOEXEC));
    return pagemapFd_.get();
}

void HTLinuxTaskPort::closePagemap() { pagemapFd_.reset(); }

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
