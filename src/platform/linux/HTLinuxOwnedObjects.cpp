#include "platform/linux/HTLinuxOwnedObjects.h"

#include "base/HTNoticeLog.h"
#include "base/HTStringFormat.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTLinuxProcessTable.h"
#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"
#include "platform/linux/HTProcText.h"
#include "platform/linux/HTShmemParsers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <limits>
#include <optional>
#include <string>
#include <string_view>

#ifndef __NR_cachestat
#define __NR_cachestat 451
#endif

namespace {

struct CachestatRange {
    uint64_t offset;
    uint64_t length;
};
struct Cachestat {
    uint64_t cached;
    uint64_t dirty;
    uint64_t writeback;
    uint64_t evicted;
    uint64_t recentlyEvicted;
};

// Whether the descriptor `name` of the directory leads to a file under
// /dev/shm, which the mappings name as shared memory.
bool isDevShm(int directory, const char* name)
{
    char target[32];
    ssize_t length = readlinkat(directory, name, target, sizeof(target));
    return length >= 9 && std::string_view(target, static_cast<size_t>(length)).starts_with("/dev/shm/");
}

uint64_t pageUp(uint64_t bytes, uint64_t pageSize) { return (bytes + pageSize - 1) / pageSize * pageSize; }

// The device of the kernel's own tmpfs, which holds memfd files, System V
// segments and shared anonymous memory: that of a memfd of heft's own.
std::pair<uint32_t, uint32_t> internalShmemDevice()
{
    HTFileDescriptor probe(static_cast<int>(syscall(SYS_memfd_create, "heft-probe", MFD_CLOEXEC)));
    struct stat status {};
    if (!probe.isOpen() || fstat(probe.get(), &status) != 0) return {0, 1};
    return {major(status.st_dev), minor(status.st_dev)};
}

// The resident and swapped bytes of the tmpfs file open as `fd`, of `size`
// bytes and `blocks` blocks of 512 bytes allocated in memory or swap.
void measureFile(int fd, uint64_t size, uint64_t blocks, uint64_t pageSize, vm_owned_object& record)
{
    CachestatRange range{0, 0};
    Cachestat stat{};
    if (syscall(__NR_cachestat, fd, &range, &stat, 0) == 0) {
        // A tmpfs file's evicted pages are the ones in swap.
        record.resident_size = stat.cached * pageSize;
        record.compressed_size = stat.evicted * pageSize;
        return;
    }
    const uint64_t allocated = blocks * 512;
    record.resident_size = allocated;
    if (size == 0) return;
    void* mapping = mmap(nullptr, size, PROT_READ, MAP_SHARED, fd, 0);
    if (mapping == MAP_FAILED) return;
    std::vector<unsigned char> pages(pageUp(size, pageSize) / pageSize);
    if (mincore(mapping, size, pages.data()) == 0) {
        const uint64_t resident = static_cast<uint64_t>(
            std::count_if(pages.begin(), pages.end(), [](unsigned char page) { return page & 1; }));
        record.resident_size = resident * pageSize;
        record.compressed_size = allocated > record.resident_size ? allocated - record.resident_size : 0;
    }
    munmap(mapping, size);
}

}  // namespace

int HTLinuxOwnedObjects::ownedObjects(int32_t pid, void* oldp, size_t* oldlenp)
{
    if (oldlenp == nullptr) {
        errno = EINVAL;
        return -1;
    }
    std::call_once(gathered_, [this] { gather(); });
    static const std::vector<vm_owned_object> none;
    auto found = byOwner_.find(pid);
    const std::vector<vm_owned_object>& records = found != byOwner_.end() ? found->second : none;
    const uint64_t count = records.size();
    const size_t length = sizeof(count) + records.size() * sizeof(vm_owned_object);
    if (oldp == nullptr) {
        *oldlenp = length;
        return 0;
    }
    if (*oldlenp < length) {
        errno = ENOMEM;
        return -1;
    }
    std::memcpy(oldp, &count, sizeof(count));
    if (!records.empty())
        std::memcpy(static_cast<char*>(oldp) + sizeof(count), records.data(), records.size() * sizeof(vm_owned_object));
    *oldlenp = length;
    return 0;
}

const std::map<HTLinuxOwnedObjects::FileKey, uint64_t>& HTLinuxOwnedObjects::heldFileBytes()
{
    std::call_once(gathered_, [this] { gather(); });
    return heldFileBytes_;
}

void HTLinuxOwnedObjects::gather()
{
    const uint64_t pageSize = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
    const Device shmDevice = internalShmemDevice();
    std::vector<Device> devices = {shmDevice};
    HTProcBuffer mountinfo;
    if (mountinfo.readFile(AT_FDCWD, "/proc/self/mountinfo"))
        for (const HTTmpfsMount& mount : htParseTmpfsMounts(mountinfo.view())) devices.push_back(mount.device);

    HTLinuxProcessTable::forEachPid([&](int32_t pid) { readDescriptors(pid, devices, shmDevice); });
    addHeldFiles(pageSize);
    addSysvSegments(shmDevice, pageSize);
    if (unreadable_ > 0)
        HTNoticeLog::standardError().add(
            "Unable to read the open files of %s (that needs root): shared memory they hold without mapping it is "
            "not seen",
            0, htStringWithFormat("%zu process%s", unreadable_, unreadable_ == 1 ? "" : "es"));
}

void HTLinuxOwnedObjects::readDescriptors(int32_t pid, const std::vector<Device>& devices, const Device& shmDevice)
{
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/fd", pid);
    HTFileDescriptor directory(open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory.isOpen()) {
        if (errno == EACCES) ++unreadable_;
        return;
    }
    // The listing takes a descriptor of its own; the first stays for fstatat.
    HTDirectoryListing entries = htListDirectory(HTFileDescriptor(fcntl(directory.get(), F_DUPFD_CLOEXEC, 0)));
    if (!entries) return;
    std::optional<uint64_t> started;
    // Files of other tmpfs mounts, which the process may map as files.
    std::vector<FileKey> others;
    while (dirent* entry = readdir(entries.get())) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        struct stat status {};
        // The descriptor's link leads to the open file itself.
        if (fstatat(directory.get(), entry->d_name, &status, 0) != 0 || !S_ISREG(status.st_mode)) continue;
        const Device device{major(status.st_dev), minor(status.st_dev)};
        if (std::find(devices.begin(), devices.end(), device) == devices.end()) continue;
        if (device != shmDevice && !isDevShm(directory.get(), entry->d_name)) others.push_back({device, status.st_ino});
        if (!started) started = startTime(pid);
        HeldFile& file = heldFiles_[{device, status.st_ino}];
        if (file.ownerFd >= 0 && std::make_pair(file.ownerStart, file.owner) <= std::make_pair(*started, pid)) continue;
        const int fd = htNumber<int>(entry->d_name).value_or(-1);
        // An older holder takes the file over; whether some holder maps it
        // stays as it was.
        file = HeldFile{pid,
                        *started,
                        fd,
                        static_cast<uint64_t>(status.st_size),
                        static_cast<uint64_t>(status.st_blocks),
                        file.mappedAsFile};
    }
    if (!others.empty()) noteMappedFiles(pid, others);
}

void HTLinuxOwnedObjects::noteMappedFiles(int32_t pid, const std::vector<FileKey>& files)
{
    thread_local HTProcBuffer maps;
    if (!processes_.readProcessFile(pid, "/maps", maps)) return;
    std::string_view text = maps.view();
    while (!text.empty()) {
        std::optional<HTMapsFileLine> mapping = htParseMapsFileLine(htTakeLine(text));
        if (!mapping) continue;
        const FileKey key{mapping->device, mapping->inode};
        if (std::find(files.begin(), files.end(), key) != files.end()) heldFiles_[key].mappedAsFile = true;
    }
}

uint64_t HTLinuxOwnedObjects::startTime(int32_t pid)
{
    thread_local HTProcBuffer buffer;
    if (!processes_.readProcessFile(pid, "/stat", buffer)) return std::numeric_limits<uint64_t>::max();
    std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
    return stat ? stat->starttime : std::numeric_limits<uint64_t>::max();
}

void HTLinuxOwnedObjects::addHeldFiles(uint64_t pageSize)
{
    for (const auto& [key, file] : heldFiles_) {
        heldFileBytes_[key] = file.blocks * 512;
        if (file.mappedAsFile) continue;
        vm_owned_object record{};
        record.object_id = htFileObjectId(key.first.first, key.first.second, key.second);
        record.virtual_size = pageUp(file.size, pageSize);
        char path[64];
        std::snprintf(path, sizeof(path), "/proc/%d/fd/%d", file.owner, file.ownerFd);
        HTFileDescriptor fd(open(path, O_RDONLY | O_CLOEXEC));
        if (fd.isOpen())
            measureFile(fd.get(), file.size, file.blocks, pageSize, record);
        else
            record.resident_size = file.blocks * 512;
        byOwner_[file.owner].push_back(record);
    }
    heldFiles_.clear();
}

void HTLinuxOwnedObjects::addSysvSegments(const Device& shmDevice, uint64_t pageSize)
{
    HTProcBuffer text;
    if (!text.readFile(AT_FDCWD, "/proc/sysvipc/shm")) return;
    for (const HTSysvSegment& segment : htParseSysvShm(text.view())) {
        // A segment whose creator is gone belongs to nobody.
        proc_bsdinfo info{};
        if (segment.cpid <= 0 || !processes_.readBsdInfo(segment.cpid, info)) continue;
        vm_owned_object record{};
        record.object_id = htFileObjectId(shmDevice.first, shmDevice.second, static_cast<uint64_t>(segment.shmid));
        record.virtual_size = pageUp(segment.size, pageSize);
        record.resident_size = segment.rss;
        record.compressed_size = segment.swap;
        byOwner_[segment.cpid].push_back(record);
    }
}
