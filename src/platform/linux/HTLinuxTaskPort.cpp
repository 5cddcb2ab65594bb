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

void closeKeepingErrno(int fd)
{
    int savedErrno = errno;
    ::close(fd);
    errno = savedErrno;
}
}  // namespace

HTLinuxTaskPort::HTLinuxTaskPort(int32_t pid, std::optional<uint64_t> startTime) : pid_(pid), startTime_(startTime)
{
}

HTLinuxTaskPort::~HTLinuxTaskPort()
{
    closePagemap();
    closeDirectory();
}

bool HTLinuxTaskPort::openDirectory()
{
    if (procDirFd_ >= 0) return true;
    char path[32] = "/proc/";
    *std::to_chars(path + 6, path + sizeof(path) - 1, pid_).ptr = '\0';
    int process = ::open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (process < 0) {
        if (errno == ENOENT) errno = ESRCH;
        return false;
    }
    thread_local HTProcBuffer buffer;
    const bool read = buffer.readFile(process, "stat", HTProcBuffer::End::ShortRead);
    std::optional<HTProcStat> stat = read ? htParseProcStat(buffer.view()) : std::nullopt;
    if (!stat || (startTime_ && stat->starttime != *startTime_)) {
        // Gone, or the pid names another process now.
        int error = read || errno == ENOENT ? ESRCH : errno;
        ::close(process);
        errno = error;
        return false;
    }
    startTime_ = stat->starttime;
    procDirFd_ = process;
    // A main thread that has exited reads an empty address space: a live
    // thread reads the process's. With none left the process is a zombie,
    // and reads through its own directory say so.
    if (stat->hasExited()) {
        int thread = htOpenLiveThreadDirectory(process);
        if (thread >= 0) {
            ::close(process);
            procDirFd_ = thread;
        }
    }
    return true;
}

void HTLinuxTaskPort::closeDirectory()
{
    if (procDirFd_ >= 0) closeKeepingErrno(procDirFd_);
    procDirFd_ = -1;
}

HTLinuxTaskPort::DirectoryUse::DirectoryUse(HTLinuxTaskPort& task) : task_(task)
{
    if (task.procDirFd_ >= 0) return;
    opened_ = task.openDirectory();
    if (!opened_) error_ = errno;
}

HTLinuxTaskPort::DirectoryUse::~DirectoryUse()
{
    if (opened_) task_.closeDirectory();
}

int HTLinuxTaskPort::DirectoryUse::fd() const
{
    if (task_.procDirFd_ < 0) errno = error_;
    return task_.procDirFd_;
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
    if (pagemapFd_ >= 0) return pagemapFd_;
    DirectoryUse directory(*this);
    if (directory.fd() < 0) return -1;
    pagemapFd_ = ::openat(directory.fd(), "pagemap", O_RDONLY | O_CLOEXEC);
    return pagemapFd_;
}

void HTLinuxTaskPort::closePagemap()
{
    if (pagemapFd_ >= 0) closeKeepingErrno(pagemapFd_);
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
