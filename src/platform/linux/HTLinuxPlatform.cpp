#include "platform/linux/HTLinuxPlatform.h"
#include "platform/linux/HTPagemapScan.h"

#include "platform/HTMachErrorText.h"
#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTLiveThread.h"
#include "platform/linux/HTPageDisposition.h"
#include "platform/linux/HTPageQueryChunk.h"
#include "platform/linux/HTPreadFully.h"
#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"
#include "platform/linux/HTProcStatusParser.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <elf.h>
#include <fcntl.h>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr bool kHeftIs64bit = sizeof(void*) == 8;
constexpr const char* kSelfRegionHeftName = "vm.self_region_heft";
// Bounds of the argument-area size heft announces: the caller allocates
// that much for every process it names.
constexpr long kArgMaxFloor = 4096;
constexpr long kArgMaxCeiling = 1024L * 1024;

// Writes the decimal pid followed by `suffix` into `out` (NUL-terminated).
void formatPidPath(char (&out)[48], int32_t pid, std::string_view suffix)
{
    auto [end, error] = std::to_chars(out, out + 16, pid);
    (void)error;
    std::memcpy(end, suffix.data(), suffix.size());
    end[suffix.size()] = '\0';
}

// A /proc entry that is all digits names a process.
bool pidFromName(const char* name, int32_t& pid)
{
    size_t length = std::strlen(name);
    if (length == 0 || name[0] < '1' || name[0] > '9') return false;
    auto [end, error] = std::from_chars(name, name + length, pid);
    return error == std::errc() && end == name + length;
}

// Whether the executable behind /proc/PID/exe is a 64-bit ELF object; when
// it cannot be read (another user's process without root, a zombie, a
// format other than ELF), heft's own bitness stands in.
bool executableIs64bit(int procFd, int32_t pid)
{
    char path[48];
    formatPidPath(path, pid, "/exe");
    int fd = ::openat(procFd, path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return kHeftIs64bit;
    unsigned char ident[EI_NIDENT];
    ssize_t count = ::pread(fd, ident, sizeof(ident), 0);
    ::close(fd);
    if (count <= EI_CLASS || std::memcmp(ident, ELFMAG, SELFMAG) != 0) return kHeftIs64bit;
    return ident[EI_CLASS] == ELFCLASS64;
}

void copyName(char* field, size_t fieldSize, std::string_view name)
{
    std::memcpy(field, name.data(), std::min(fieldSize, name.size()));
}

void closeKeepingErrno(int fd)
{
    int savedErrno = errno;
    ::close(fd);
    errno = savedErrno;
}

// Whether the thread behind a /proc/PID or /proc/PID/task/TID descriptor
// has exited or is exiting: it is gone (its files vanish), a zombie (its
// files read empty), or on its way out, with its address space being torn
// down. Asked of the thread whose files were read, which is the main one
// unless that one exited before the others.
bool processHasExited(int dirfd)
{
    thread_local HTProcBuffer buffer;
    if (!buffer.readFile(dirfd, "stat", HTProcBuffer::End::ShortRead)) return errno == ESRCH || errno == ENOENT;
    std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
    return !stat || stat->hasExited();
}

bool meansGone(int error) { return error == ESRCH || error == ENOENT; }

// What the page rules need to know of the mapping at `index`.
HTPageMapping pageMapping(HTLinuxTaskPort& task, size_t index)
{
    const HTSmapsEntry& vma = task.vmas()[index];
    HTPageMapping mapping;
    mapping.sharedMemory = vma.isSharedMemory();
    mapping.hugetlb = vma.hasFlag(HTVmFlagHugetlb);
    mapping.privateFile = vma.kind == HTSmapsKind::File && !vma.shared;
    // Device memory has frames of its own kind.
    if (vma.mapsDeviceMemory()) return mapping;
    // A block device's file systems keep their pages on the device, never in
    // swap (tmpfs and its kin sit on anonymous devices, major number 0), and
    // without a dirty page, counted from the same smaps as the walk, no file
    // page can be dirty.
    mapping.cleanFile =
        vma.kind == HTSmapsKind::File && vma.devMajor != 0 && vma.sharedDirty == 0 && vma.privateDirty == 0;
    // The anonymous pages of a file's mapping are its copies on write: the
    // zero page only fills anonymous memory, and MADV_FREE takes nothing
    // else. Anonymous memory says in smaps what it holds freed, and the
    // kernel whether it may hold a zero page.
    if (vma.kind == HTSmapsKind::File || vma.isSharedMemory())
        mapping.plainAnonymous = true;
    else if (vma.kind != HTSmapsKind::KernelProvided && vma.lazyFree == 0)
        mapping.plainAnonymous = task.mayMapZeroPage(index) == false;
    return mapping;
}

// Whether the mapping can hold private anonymous pages that another process
// maps as well. Smaps says when some page or swap slot of a mapping is
// shared; in a private file mapping, pages shared clean are the file's own,
// and copies shared after a fork are dirty or swapped.
bool mayHoldSharedAnonymousPages(const HTSmapsEntry& vma)
{
    if (vma.shared || vma.hasFlag(HTVmFlagHugetlb) || vma.mapsDeviceMemory()) return false;
    switch (vma.kind) {
    case HTSmapsKind::Anonymous:
    case HTSmapsKind::Heap:
    case HTSmapsKind::Stack:
    case HTSmapsKind::NamedAnonymous:
        return vma.mayShareWithOtherProcesses();
    case HTSmapsKind::File:
        return vma.sharedDirty != 0 || vma.swapPss < vma.swap;
    default:
        return false;
    }
}

// The disposition that every resident page (or, with `swapped`, every
// page swapped out) of the mapping has, when the mapping alone settles it;
// 0 when each page's own entry and flags are needed. A page query of such
// a page answers the same.
int32_t uniformDisposition(const HTSmapsEntry& vma, bool swapped)
{
    if (swapped || vma.hasFlag(HTVmFlagHugetlb) || vma.mapsDeviceMemory()) return 0;
    // Shared memory is all swap-backed: dirty.
    if (vma.shared && vma.isSharedMemory()) return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
    // A file of a block device that smaps finds wholly clean, with no
    // anonymous copy in the mapping: every page is the file's, clean.
    if (vma.kind == HTSmapsKind::File && vma.devMajor != 0 && vma.sharedDirty == 0 && vma.privateDirty == 0 &&
        vma.anonymous == 0 && vma.swap == 0)
        return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    return 0;
}

// Walks ascending page addresses through ascending [start, end) runs.
class HTRunCursor {
public:
    explicit HTRunCursor(const std::vector<std::pair<uint64_t, uint64_t>>& runs) : runs_(runs) {}
    bool contains(uint64_t address)
    {
        while (next_ < runs_.size() && runs_[next_].second <= address) ++next_;
        return next_ < runs_.size() && runs_[next_].first <= address;
    }

private:
    const std::vector<std::pair<uint64_t, uint64_t>>& runs_;
    size_t next_ = 0;
};

// The pagemap entries of the last page query on this thread. Page queries
// and identity queries come in pairs over the same pages; the second one
// takes the entries from here instead of reading them again.
struct HTLastPagemapRead {
    const HTLinuxTaskPort* task = nullptr;
    uint64_t firstPage = 0;
    size_t count = 0;
    HTPageQueryChunk chunk;
};
thread_local HTLastPagemapRead lastPagemapRead;

// Reads `count` (at most a chunk's worth) pagemap entries from `firstPage`.
// A process without an address space reads nothing; a live one reads short
// only past the top of the user address space, where no page is mapped.
kern_return_t readPagemap(HTLinuxTaskPort& task, int pagemap, uint64_t firstPage, size_t count, uint64_t* entries)
{
    ssize_t bytes = htPreadFully(pagemap, entries, count * sizeof(uint64_t), firstPage * sizeof(uint64_t));
    const size_t read = bytes < 0 ? 0 : static_cast<size_t>(bytes) / sizeof(uint64_t);
    kern_return_t result = KERN_SUCCESS;
    if (bytes < 0) {
        result = meansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
    } else if (read < count) {
        HTLinuxTaskPort::DirectoryUse directory(task);
        if (directory.fd() < 0)
            result = meansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
        else if (processHasExited(directory.fd()))
            result = KERN_INVALID_ARGUMENT;
    }
    // A failed read ends the walk: its pagemap is let go at once.
    if (result != KERN_SUCCESS) {
        task.closePagemap();
        return result;
    }
    std::fill(entries + read, entries + count, uint64_t{0});
    return KERN_SUCCESS;
}

}  // namespace

HTLinuxPlatform::HTLinuxPlatform()
{
    procFd_ = ::open("/proc", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (procFd_ < 0) procErrno_ = errno;
    long ticks = ::sysconf(_SC_CLK_TCK);
    if (ticks > 0) clockTicks_ = ticks;
}

HTLinuxPlatform::~HTLinuxPlatform()
{
    if (procFd_ >= 0) ::close(procFd_);
    if (kpageflagsFd_ >= 0) ::close(kpageflagsFd_);
}

int HTLinuxPlatform::openProcessFile(int32_t pid, std::string_view suffix, int flags) const
{
    if (procFd_ < 0) {
        errno = procErrno_;
        return -1;
    }
    if (pid <= 0) {
        errno = ESRCH;
        return -1;
    }
    char name[48];
    formatPidPath(name, pid, suffix);
    int fd = ::openat(procFd_, name, O_RDONLY | O_CLOEXEC | flags);
    if (fd < 0 && errno == ENOENT) errno = ESRCH;
    return fd;
}

bool HTLinuxPlatform::readProcessFile(int32_t pid, std::string_view suffix, HTProcBuffer& buffer) const
{
    int fd = openProcessFile(pid, suffix);
    if (fd < 0) return false;
    bool read = buffer.readDescriptor(fd, HTProcBuffer::End::ShortRead);
    closeKeepingErrno(fd);
    if (!read && errno == ENOENT) errno = ESRCH;
    return read;
}

bool HTLinuxPlatform::readLiveThreadFile(int32_t pid, const char* name, HTProcBuffer& buffer) const
{
    int process = openProcessFile(pid, "", O_DIRECTORY);
    if (process < 0) return false;
    int thread = htOpenLiveThreadDirectory(process);
    closeKeepingErrno(process);
    if (thread < 0) return false;
    bool read = buffer.readFile(thread, name, HTProcBuffer::End::ShortRead);
    closeKeepingErrno(thread);
    if (!read && errno == ENOENT) errno = ESRCH;
    return read;
}

uint64_t HTLinuxPlatform::bootTime()
{
    std::call_once(bootTimeOnce_, [this] {
        HTProcBuffer buffer;
        if (procFd_ < 0 || !buffer.readFile(procFd_, "stat")) return;
        std::string_view text = buffer.view();
        constexpr std::string_view key = "\nbtime ";
        size_t at = text.find(key);
        if (at == std::string_view::npos) return;
        text.remove_prefix(at + key.size());
        std::from_chars(text.data(), text.data() + text.size(), bootTime_);
    });
    return bootTime_;
}

void HTLinuxPlatform::fillKernelInfo(proc_bsdinfo& info)
{
    info = proc_bsdinfo{};
    info.pbi_flags = PROC_FLAG_SYSTEM | (kHeftIs64bit ? PROC_FLAG_LP64 : 0);
    info.pbi_status = SRUN;
    copyName(info.pbi_comm, sizeof(info.pbi_comm), "kernel");
    copyName(info.pbi_name, sizeof(info.pbi_name), "kernel");
    info.pbi_start_tvsec = bootTime();
}

bool HTLinuxPlatform::readBsdInfo(int32_t pid, proc_bsdinfo& info)
{
    if (pid == 0) {
        fillKernelInfo(info);
        return true;
    }
    // Reused by every call on this thread: a listing reads thousands.
    thread_local HTProcBuffer buffer;
    int fd = openProcessFile(pid, "/stat");
    if (fd < 0) return false;
    // Every file of /proc/PID belongs to the process's effective user and
    // group (to root when the process is not dumpable).
    struct stat owner {};
    bool ownerKnown = ::fstat(fd, &owner) == 0;
    bool read = buffer.readDescriptor(fd, HTProcBuffer::End::ShortRead);
    closeKeepingErrno(fd);
    if (!read) {
        if (errno == ENOENT) errno = ESRCH;
        return false;
    }
    std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
    if (!stat || stat->isKernelThread()) {
        errno = ESRCH;
        return false;
    }
    // A main thread that exited before the others stays a zombie while they
    // carry on: the process is alive, and a live thread says what it is
    // doing and where its stack is.
    char state = stat->state;
    uint64_t startstack = stat->startstack;
    auto taskFlags = stat->flags;
    thread_local HTProcBuffer threadBuffer;
    if (stat->isZombie() && readLiveThreadFile(pid, "stat", threadBuffer)) {
        if (std::optional<HTProcStat> thread = htParseProcStat(threadBuffer.view())) {
            state = thread->state;
            startstack = thread->startstack;
            taskFlags = thread->flags;
        }
    }

    info = proc_bsdinfo{};
    if (ownerKnown) {
        info.pbi_uid = info.pbi_ruid = info.pbi_svuid = owner.st_uid;
        info.pbi_gid = info.pbi_rgid = info.pbi_svgid = owner.st_gid;
    }
    // A 64-bit address space puts the stack above 4 GiB; a 32-bit process
    // (ia32 or x32) has none above it. Only when the stack is hidden from
    // heft does the executable's ELF class decide.
    bool is64bit = startstack != 0 ? startstack > UINT32_MAX : executableIs64bit(procFd_, pid);

    info.pbi_flags = is64bit ? PROC_FLAG_LP64 : 0;
    info.pbi_status = htProcStatusForState(state);
    // Killed or exiting, not yet a zombie: its memory may be gone already.
    // (The main thread of a process whose other threads live on is exiting
    // too: the flags are those of the thread that speaks for it.)
    if ((taskFlags & HT_PF_EXITING) != 0 && info.pbi_status != SZOMB) info.pbi_flags |= PROC_FLAG_INEXIT;
    info.pbi_pid = static_cast<uint32_t>(stat->pid);
    info.pbi_ppid = static_cast<uint32_t>(stat->ppid);
    copyName(info.pbi_comm, sizeof(info.pbi_comm), stat->comm);
    copyName(info.pbi_name, sizeof(info.pbi_name), stat->comm);
    info.pbi_pgid = static_cast<uint32_t>(stat->pgrp);
    info.e_tdev = static_cast<uint32_t>(stat->tty_nr);
    info.e_tpgid = static_cast<uint32_t>(stat->tpgid);
    info.pbi_nice = stat->nice;
    auto ticks = static_cast<uint64_t>(clockTicks_);
    info.pbi_start_tvsec = bootTime() + stat->starttime / ticks;
    info.pbi_start_tvusec = (stat->starttime % ticks) * 1000000 / ticks;
    return true;
}

int HTLinuxPlatform::proc_listallpids(int32_t* buffer, int bufferSize)
{
    if (procFd_ < 0) {
        errno = procErrno_;
        return -1;
    }
    // A descriptor of its own, so that concurrent listings do not share a
    // directory position.
    int fd = ::openat(procFd_, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return -1;
    DIR* dir = ::fdopendir(fd);
    if (dir == nullptr) {
        closeKeepingErrno(fd);
        return -1;
    }

    size_t capacity = buffer == nullptr ? 0 : static_cast<size_t>(std::max(bufferSize, 0)) / sizeof(int32_t);
    size_t count = 0;
    if (buffer == nullptr || capacity > 0) {
        if (buffer != nullptr) buffer[0] = 0;  // the kernel
        count = 1;
    }
    thread_local HTProcBuffer statBuffer;
    for (;;) {
        if (buffer != nullptr && count >= capacity) break;
        errno = 0;
        dirent* entry = ::readdir(dir);
        if (entry == nullptr) {
            if (errno != 0) {
                int savedErrno = errno;
                ::closedir(dir);
                errno = savedErrno;
                return -1;
            }
            break;
        }
        int32_t pid = 0;
        if (!pidFromName(entry->d_name, pid)) continue;
        if (buffer == nullptr) {
            ++count;
            continue;
        }
        // Kernel threads share the kernel's memory: they are not processes
        // of their own here. A kernel thread has no executable, so a
        // readable exe link settles the question in one call; only when it
        // is not readable (kernel threads, zombies, another user's process
        // for an unprivileged caller) do the task flags decide. A process
        // that exits meanwhile drops out.
        char path[48];
        formatPidPath(path, pid, "/exe");
        char target[PATH_MAX];
        if (::readlinkat(procFd_, path, target, sizeof(target)) >= 0) {
            buffer[count++] = pid;
            continue;
        }
        formatPidPath(path, pid, "/stat");
        if (!statBuffer.readFile(procFd_, path, HTProcBuffer::End::ShortRead)) continue;
        std::optional<HTProcStat> stat = htParseProcStat(statBuffer.view());
        if (!stat || stat->isKernelThread()) continue;
        buffer[count++] = pid;
    }
    ::closedir(dir);
    return static_cast<int>(count);
}

int HTLinuxPlatform::proc_pidinfo(int32_t pid, int flavor, uint64_t, void* buffer, int bufferSize)
{
    size_t needed = flavor == PROC_PIDTBSDINFO ? sizeof(proc_bsdinfo)
        : flavor == PROC_PIDT_SHORTBSDINFO     ? sizeof(proc_bsdshortinfo)
                                               : 0;
    if (needed == 0) {
        errno = EINVAL;
        return 0;
    }
    if (buffer == nullptr || bufferSize < static_cast<int>(needed)) {
        errno = ENOMEM;
        return 0;
    }
    proc_bsdinfo info;
    if (!readBsdInfo(pid, info)) return 0;
    if (flavor == PROC_PIDTBSDINFO) {
        std::memcpy(buffer, &info, sizeof(info));
        return sizeof(info);
    }
    proc_bsdshortinfo shortInfo{};
    shortInfo.pbsi_pid = info.pbi_pid;
    shortInfo.pbsi_ppid = info.pbi_ppid;
    shortInfo.pbsi_pgid = info.pbi_pgid;
    shortInfo.pbsi_status = info.pbi_status;
    std::memcpy(shortInfo.pbsi_comm, info.pbi_comm, sizeof(shortInfo.pbsi_comm));
    shortInfo.pbsi_flags = info.pbi_flags;
    shortInfo.pbsi_uid = info.pbi_uid;
    shortInfo.pbsi_gid = info.pbi_gid;
    shortInfo.pbsi_ruid = info.pbi_ruid;
    shortInfo.pbsi_rgid = info.pbi_rgid;
    shortInfo.pbsi_svuid = info.pbi_svuid;
    shortInfo.pbsi_svgid = info.pbi_svgid;
    std::memcpy(buffer, &shortInfo, sizeof(shortInfo));
    return sizeof(shortInfo);
}

int HTLinuxPlatform::proc_get_dirty(int32_t, uint32_t*) { return ENOTSUP; }

int HTLinuxPlatform::readProcArgs(int32_t pid, void* oldp, size_t* oldlenp)
{
    if (pid <= 0 || oldlenp == nullptr) {
        errno = EINVAL;
        return -1;
    }
    // By path rather than through a directory descriptor: the name is all
    // this is for, and two system calls fewer count over thousands of
    // processes.
    char path[48];
    formatPidPath(path, pid, "/exe");
    char link[PATH_MAX + 1];
    ssize_t linkLength = ::readlinkat(procFd_, path, link, sizeof(link));
    if (linkLength < 0) {
        // A zombie has lost its executable (ENOENT); a process that is
        // gone has lost its directory as well.
        formatPidPath(path, pid, "");
        struct stat directory {};
        if (errno == ENOENT && ::fstatat(procFd_, path, &directory, 0) != 0) errno = ESRCH;
        return -1;
    }
    if (static_cast<size_t>(linkLength) == sizeof(link)) {
        errno = ENAMETOOLONG;
        return -1;
    }
    thread_local HTProcBuffer cmdline;
    if (!readProcessFile(pid, "/cmdline", cmdline)) return -1;

    std::string_view executable = htExecutablePathFromLink(std::string_view(link, static_cast<size_t>(linkLength)));
    size_t total = htBuildProcArgs(executable, cmdline.view(), nullptr, 0);
    if (oldp == nullptr) {
        *oldlenp = total;
        return 0;
    }
    if (*oldlenp < htProcArgsHeaderSize(executable)) {
        errno = ENOMEM;
        return -1;
    }
    htBuildProcArgs(executable, cmdline.view(), static_cast<char*>(oldp), *oldlenp);
    *oldlenp = std::min(total, *oldlenp);
    return 0;
}

int HTLinuxPlatform::sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp, size_t)
{
    if (name == nullptr || nameLength < 2 || name[0] != CTL_KERN) {
        errno = ENOENT;
        return -1;
    }
    bool known = (nameLength == 2 && name[1] == KERN_ARGMAX) || (nameLength == 3 && name[1] == KERN_PROCARGS2);
    if (!known) {
        errno = ENOENT;
        return -1;
    }
    if (newp != nullptr) {
        errno = EPERM;
        return -1;
    }
    if (name[1] == KERN_PROCARGS2) return readProcArgs(name[2], oldp, oldlenp);

    if (oldlenp == nullptr) {
        errno = EINVAL;
        return -1;
    }
    if (oldp != nullptr) {
        if (*oldlenp < sizeof(int32_t)) {
            errno = ENOMEM;
            return -1;
        }
        // Follows the stack limit, which heft never changes: asked once.
        static const long argmax = ::sysconf(_SC_ARG_MAX);
        auto value = static_cast<int32_t>(std::clamp(argmax, kArgMaxFloor, kArgMaxCeiling));
        std::memcpy(oldp, &value, sizeof(value));
    }
    *oldlenp = sizeof(int32_t);
    return 0;
}

int HTLinuxPlatform::sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen)
{
    // The breakdown setting has no kernel counterpart on Linux: heft keeps
    // it here. Every other name, the owned-object query included, is absent.
    if (name == nullptr || std::strcmp(name, kSelfRegionHeftName) != 0) {
        errno = ENOENT;
        return -1;
    }
    if (newp != nullptr && newlen != sizeof(int32_t)) {
        errno = EINVAL;
        return -1;
    }
    if (oldlenp != nullptr) {
        if (oldp != nullptr) {
            if (*oldlenp < sizeof(int32_t)) {
                errno = ENOMEM;
                return -1;
            }
            int32_t value = selfRegionHeft_.load();
            std::memcpy(oldp, &value, sizeof(value));
        }
        *oldlenp = sizeof(int32_t);
    }
    if (newp != nullptr) {
        int32_t value;
        std::memcpy(&value, newp, sizeof(value));
        selfRegionHeft_.store(value);
    }
    return 0;
}

uint64_t HTLinuxPlatform::vm_kernel_page_size()
{
    static const uint64_t pageSize = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
    return pageSize;
}

kern_return_t HTLinuxPlatform::task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task)
{
    // The kernel is not a process with an address space of its own.
    if (pid <= 0 || task == nullptr) return KERN_INVALID_ARGUMENT;

    // The handle learns the process's start time here, and closes its
    // directory again before it is handed out.
    auto handle = std::make_shared<HTLinuxTaskPort>(pid);
    HTLinuxTaskPort::DirectoryUse directory(*handle);
    if (directory.fd() < 0) return HT_KERN_ERRNO_BASE | errno;
    // Opening smaps runs the kernel's ptrace read check: the same right
    // every later read of the process's memory needs.
    int smaps = ::openat(directory.fd(), "smaps", O_RDONLY | O_CLOEXEC);
    if (smaps < 0) return HT_KERN_ERRNO_BASE | (errno == ENOENT ? ESRCH : errno);
    ::close(smaps);
    *task = std::move(handle);
    return KERN_SUCCESS;
}

std::string HTLinuxPlatform::mach_error_string(kern_return_t code) { return htMachErrorString(code); }

void HTLinuxPlatform::mach_error(const char* label, kern_return_t code)
{
    std::fprintf(stderr, "%s: %s (0x%x)\n", label, htMachErrorString(code).c_str(), static_cast<unsigned>(code));
}

int32_t HTLinuxPlatform::getpid() { return ::getpid(); }

uint32_t HTLinuxPlatform::geteuid() { return ::geteuid(); }

bool HTLinuxPlatform::isatty(int fd) { return ::isatty(fd) != 0; }

bool HTLinuxPlatform::stat(const char* path)
{
    struct stat status {};
    return ::stat(path, &status) == 0;
}

kern_return_t HTLinuxPlatform::loadVmas(HTLinuxTaskPort& task, bool refresh)
{
    if (!refresh && task.hasParsedVmas()) return KERN_SUCCESS;
    // Reused by every walk on this thread; it keeps the size of the largest
    // smaps read so far (megabytes for a big process).
    thread_local HTProcBuffer smaps;
    HTLinuxTaskPort::DirectoryUse directory(task);
    // Once a new read fails, what was read before no longer describes the
    // process.
    if (directory.fd() < 0 || !smaps.readFile(directory.fd(), "smaps")) {
        int error = errno;
        task.clearVmas();
        return meansGone(error) ? MACH_SEND_INVALID_DEST : HT_KERN_ERRNO_BASE | error;
    }
    // A process that dies while its smaps is read ends the text early,
    // without an error, and a zombie's reads empty: either way the text
    // does not describe the whole process. The thread asked is the one
    // whose smaps was read: a live one, when the main thread has exited.
    if (processHasExited(directory.fd())) {
        task.clearVmas();
        return MACH_SEND_INVALID_DEST;
    }
    task.parseVmas(smaps.view());
    return KERN_SUCCESS;
}

kern_return_t HTLinuxPlatform::vmaAtOrAbove(HTTaskPort& task, uint64_t address, const HTSmapsEntry** vma)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr) return KERN_INVALID_ARGUMENT;
    // A walk starts at address 0: that is when the mappings are read anew,
    // unless the image listing has just read them for this walk.
    kern_return_t loaded = loadVmas(*linuxTask, address == 0 && !linuxTask->takeVmasKeptForWalk());
    if (loaded != KERN_SUCCESS) return loaded;
    *vma = linuxTask->vmaAtOrAbove(address);
    if (*vma != nullptr) return KERN_SUCCESS;
    // Past the last mapping the walk is over. The pagemap and the parsed
    // mappings are let go until the next query: a run over thousands of
    // processes keeps all their handles at once.
    linuxTask->closePagemap();
    linuxTask->releaseVmas();
    return KERN_INVALID_ADDRESS;
}

kern_return_t HTLinuxPlatform::mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                                      uint32_t* depth, vm_region_submap_info_64* info, uint32_t* count)
{
    if (address == nullptr || size == nullptr || info == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const HTSmapsEntry* vma = nullptr;
    kern_return_t found = vmaAtOrAbove(task, *address, &vma);
    if (found != KERN_SUCCESS) return found;
    // Linux has no submaps: the depth stays as it was.
    *info = htSubmapInfo(*vma, task.pid(), vm_kernel_page_size());
    *address = vma->start;
    *size = vma->size();
    *count = VM_REGION_SUBMAP_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t HTLinuxPlatform::mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                              vm_region_basic_info_64* info, uint32_t* count)
{
    if (address == nullptr || size == nullptr || info == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const HTSmapsEntry* vma = nullptr;
    kern_return_t found = vmaAtOrAbove(task, *address, &vma);
    if (found != KERN_SUCCESS) return found;
    *info = htBasicInfo(*vma);
    *address = vma->start;
    *size = vma->size();
    *count = VM_REGION_BASIC_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t HTLinuxPlatform::mach_vm_purgable_control(HTTaskPort&, uint64_t, int, int32_t*)
{
    return KERN_INVALID_ARGUMENT;
}

int HTLinuxPlatform::kpageflagsFd()
{
    // Readable only with the right to see physical pages (root); without
    // it every page query follows the pagemap-only rules.
    std::call_once(kpageflagsOnce_, [this] { kpageflagsFd_ = ::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC); });
    return kpageflagsFd_;
}

kern_return_t HTLinuxPlatform::mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size,
                                                        int32_t* dispositions, uint64_t* count)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr || dispositions == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const uint64_t pageSize = vm_kernel_page_size();
    if (address > UINT64_MAX - pageSize || size > UINT64_MAX - pageSize - address) return KERN_INVALID_ARGUMENT;
    const uint64_t firstPage = address / pageSize;
    const uint64_t pages = std::min((address + size + pageSize - 1) / pageSize - firstPage, *count);

    // The mappings tell shared memory and hugetlbfs pages apart, and which
    // pages need their physical page's flags at all.
    kern_return_t loaded = loadVmas(*linuxTask, false);
    if (loaded == MACH_SEND_INVALID_DEST) return KERN_INVALID_ARGUMENT;
    if (loaded != KERN_SUCCESS) return loaded;
    int pagemap = linuxTask->pagemapFd();
    if (pagemap < 0) return meansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;
    int pageFlagsFd = kpageflagsFd();

    HTPageQueryChunk& chunkData = lastPagemapRead.chunk;
    auto& entries = chunkData.entries;
    lastPagemapRead.task = nullptr;
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    size_t vmaIndex = 0;
    // What the page rules need of the mapping in hand, worked out once.
    size_t mappingIndex = SIZE_MAX;
    HTPageMapping vmaMapping;
    for (uint64_t done = 0; done < pages;) {
        size_t chunk = static_cast<size_t>(std::min<uint64_t>(HTPageQueryChunk::kPages, pages - done));
        uint64_t chunkPage = firstPage + done;
        kern_return_t read = readPagemap(*linuxTask, pagemap, chunkPage, chunk, entries.data());
        if (read != KERN_SUCCESS) return read;
        lastPagemapRead.task = linuxTask;
        lastPagemapRead.firstPage = chunkPage;
        lastPagemapRead.count = chunk;

        for (size_t at = 0; at < chunk; ++at) {
            uint64_t pageAddress = (chunkPage + at) * pageSize;
            while (vmaIndex < vmas.size() && vmas[vmaIndex].end <= pageAddress) ++vmaIndex;
            if (vmaIndex < vmas.size() && vmas[vmaIndex].start <= pageAddress) {
                if (vmaIndex != mappingIndex) vmaMapping = pageMapping(*linuxTask, vmaIndex);
                mappingIndex = vmaIndex;
                chunkData.mappings[at] = vmaMapping;
            } else {
                chunkData.mappings[at] = HTPageMapping();
            }
        }
        chunkData.readPageFlags(pageFlagsFd, chunk);
        for (size_t at = 0; at < chunk; ++at) dispositions[done + at] = chunkData.disposition(at);
        done += chunk;
    }
    *count = pages;
    return KERN_SUCCESS;
}

int HTLinuxPlatform::proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr || buffer == nullptr || bufferSize == 0) return 0;
    if (loadVmas(*linuxTask, false) != KERN_SUCCESS) return 0;
    const HTSmapsEntry* vma = linuxTask->vmaContaining(address);
    // Pseudo-paths such as "[heap]" name no file.
    if (vma == nullptr || vma->path.empty() || vma->path.front() != '/') return 0;
    size_t length = std::min<size_t>(vma->path.size(), bufferSize);
    std::memcpy(buffer, vma->path.data(), length);
    return static_cast<int>(length);
}

bool HTLinuxPlatform::readStatus(int32_t pid, HTProcStatus& status)
{
    thread_local HTProcBuffer buffer;
    if (!readProcessFile(pid, "/status", buffer)) return false;
    status = htParseProcStatus(buffer.view());
    // A main thread that exited before the others has no memory lines in
    // its status, a live thread has them.
    if (!status.hasMemoryFigures() && readLiveThreadFile(pid, "status", buffer))
        status = htParseProcStatus(buffer.view());
    // A zombie's status has no memory lines: its address space is gone.
    if (!status.hasMemoryFigures()) {
        errno = ESRCH;
        return false;
    }
    return true;
}

int HTLinuxPlatform::proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info)
{
    if (flavor != RUSAGE_INFO_V4 || info == nullptr) {
        errno = EINVAL;
        return -1;
    }
    HTProcStatus status;
    if (!readStatus(pid, status)) return -1;
    *info = rusage_info_v4{};
    info->ri_phys_heft = *status.rssAnon + *status.vmSwap + *status.vmPTE;
    // The peak resident set leaves out swap and page tables: a process with
    // much swapped out can be above its resident peak now, and a peak is
    // never below the present.
    info->ri_lifetime_max_phys_heft = std::max(*status.vmHWM, info->ri_phys_heft);
    return 0;
}

int HTLinuxPlatform::ledger_template(ledger_template_info* entries, int* count)
{
    if (count == nullptr || *count < 0 || (entries == nullptr && *count > 0)) {
        errno = EINVAL;
        return -1;
    }
    if (*count == 0) return 0;
    entries[0] = ledger_template_info{};
    std::snprintf(entries[0].lti_name, sizeof(entries[0].lti_name), "%s", "page_table");
    std::snprintf(entries[0].lti_group, sizeof(entries[0].lti_group), "%s", "physmem");
    std::snprintf(entries[0].lti_units, sizeof(entries[0].lti_units), "%s", "bytes");
    *count = 1;
    return 0;
}

int HTLinuxPlatform::ledger_entries(int32_t pid, ledger_entry_info* entries, int* count)
{
    if (count == nullptr || *count < 0 || (entries == nullptr && *count > 0)) {
        errno = EINVAL;
        return -1;
    }
    HTProcStatus status;
    if (!readStatus(pid, status)) return -1;
    if (*count == 0) return 0;
    entries[0] = ledger_entry_info{};
    entries[0].lei_balance = static_cast<int64_t>(*status.vmPTE);
    entries[0].lei_credit = entries[0].lei_balance;
    entries[0].lei_limit = INT64_MAX;
    *count = 1;
    return 0;
}

std::optional<std::string> HTLinuxPlatform::realpath(const std::string& path)
{
    {
        std::lock_guard<std::mutex> guard(realpathLock_);
        auto found = realpaths_.find(path);
        if (found != realpaths_.end()) return found->second;
    }
    std::optional<std::string> result;
    if (char* resolved = ::realpath(path.c_str(), nullptr)) {
        result = resolved;
        std::free(resolved);
    }
    std::lock_guard<std::mutex> guard(realpathLock_);
    realpaths_.emplace(path, result);
    return result;
}

bool HTLinuxPlatform::forEachTaskImage(HTTaskPort& task, uint32_t,
                                       const std::function<void(const HTPlatformImage&)>& callback)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr) {
        errno = EINVAL;
        return false;
    }
    // The images are found among the mappings of the process's smaps, and
    // the walk of its address space that follows takes the same reading:
    // one pass of the kernel over the process's page tables serves both.
    HTLinuxTaskPort::DirectoryUse directory(*linuxTask);
    kern_return_t loaded = loadVmas(*linuxTask, true);
    if (loaded != KERN_SUCCESS) {
        errno = loaded == MACH_SEND_INVALID_DEST ? ESRCH : loaded & ~HT_KERN_ERRNO_BASE;
        return false;
    }
    linuxTask->keepVmasForNextWalk();
    imageReader_.forEachTaskImage(directory.fd(), linuxTask->vmas(), callback);
    return true;
}

void HTLinuxPlatform::populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    int pagemap = linuxTask ? linuxTask->pagemapFd() : -1;
    thread_local std::vector<HTPagemapRun> scanned;
    // A failed scan leaves the page queries to meet the failure themselves.
    if (pagemap < 0 || loadVmas(*linuxTask, false) != KERN_SUCCESS ||
        !htPagemapPopulatedRuns(pagemap, start, end, scanned)) {
        runs.assign(1, HTPageRun{start, end, 0});
        return;
    }
    linuxTask->noteScan(start, end, scanned);
    runs.clear();
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    const HTSmapsEntry* vma = linuxTask->vmaAtOrAbove(start);
    size_t index = vma ? static_cast<size_t>(vma - vmas.data()) : vmas.size();
    for (const HTPagemapRun& run : scanned) {
        // A run may cross from one mapping into the next.
        for (uint64_t at = run.start; at < run.end;) {
            while (index < vmas.size() && vmas[index].end <= at) ++index;
            const bool inside = index < vmas.size() && vmas[index].start <= at;
            const uint64_t to = inside ? std::min(run.end, vmas[index].end) : run.end;
            const int32_t disposition = inside ? uniformDisposition(vmas[index], run.swapped) : 0;
            if (!runs.empty() && runs.back().end == at && runs.back().disposition == disposition)
                runs.back().end = to;
            else
                runs.push_back(HTPageRun{at, to, disposition});
            at = to;
        }
    }
}

bool HTLinuxPlatform::canIdentifySharedPages()
{
    std::call_once(identifyOnce_, [this] {
        // A page of heft's own that is surely resident: its frame reads as 0
        // unless heft may see frames.
        static volatile uint64_t probe = 0;
        probe = probe + 1;
        int fd = ::open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC);
        if (fd < 0) return;
        uint64_t entry = 0;
        const uint64_t page = reinterpret_cast<uintptr_t>(&probe) / vm_kernel_page_size();
        ssize_t read = htPreadFully(fd, &entry, sizeof(entry), page * sizeof(entry));
        ::close(fd);
        canIdentify_ = read == static_cast<ssize_t>(sizeof(entry)) && htPagemapFrame(entry) != 0;
    });
    return canIdentify_;
}

kern_return_t HTLinuxPlatform::sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                                    uint64_t* identities)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    const uint64_t pageSize = vm_kernel_page_size();
    if (linuxTask == nullptr || identities == nullptr || address % pageSize != 0 ||
        pages > (UINT64_MAX - address) / pageSize)
        return KERN_INVALID_ARGUMENT;
    std::fill(identities, identities + pages, uint64_t{0});
    if (pages == 0 || !canIdentifySharedPages()) return KERN_SUCCESS;
    kern_return_t loaded = loadVmas(*linuxTask, false);
    if (loaded == MACH_SEND_INVALID_DEST) return KERN_INVALID_ARGUMENT;
    if (loaded != KERN_SUCCESS) return loaded;

    const uint64_t end = address + pages * pageSize;
    const std::vector<HTSmapsEntry>& vmas = linuxTask->vmas();
    const HTSmapsEntry* first = linuxTask->vmaAtOrAbove(address);
    if (first == nullptr) return KERN_SUCCESS;
    for (size_t index = static_cast<size_t>(first - vmas.data()); index < vmas.size() && vmas[index].start < end;
         ++index) {
        if (!mayHoldSharedAnonymousPages(vmas[index])) continue;
        const uint64_t from = std::max(address, vmas[index].start);
        const uint64_t to = std::min(end, vmas[index].end);
        kern_return_t result = identifyPages(*linuxTask, index, from, to, identities + (from - address) / pageSize);
        if (result != KERN_SUCCESS) return result;
    }
    return KERN_SUCCESS;
}

kern_return_t HTLinuxPlatform::identifyPages(HTLinuxTaskPort& task, size_t index, uint64_t from, uint64_t to,
                                             uint64_t* identities)
{
    const uint64_t pageSize = vm_kernel_page_size();
    const HTSmapsEntry& vma = task.vmas()[index];
    const bool swapShared = vma.swapPss < vma.swap;
    int pagemap = task.pagemapFd();
    if (pagemap < 0) return meansGone(errno) ? KERN_INVALID_ARGUMENT : HT_KERN_ERRNO_BASE | errno;

    // A read of anonymous memory never written maps a zero page, which is
    // in every process and holds nothing. The kernel lists where they are;
    // a kernel without the scan is asked page by page.
    thread_local std::vector<std::pair<uint64_t, uint64_t>> zeroRuns;
    const bool checkZero = task.mayMapZeroPage(index) != false;
    const bool zeroRunsKnown = checkZero &&
        (task.zeroPageRunsFromScan(from, to, zeroRuns) || htPagemapZeroPageRuns(pagemap, from, to, zeroRuns));
    HTRunCursor zeroPages(zeroRuns);

    thread_local std::array<uint64_t, HTPageQueryChunk::kPages> ownEntries;
    for (uint64_t at = from; at < to;) {
        const size_t chunk = static_cast<size_t>(std::min<uint64_t>(HTPageQueryChunk::kPages, (to - at) / pageSize));
        const uint64_t firstPage = at / pageSize;
        const HTLastPagemapRead& last = lastPagemapRead;
        const uint64_t* entries = ownEntries.data();
        if (last.task == &task && firstPage >= last.firstPage && firstPage + chunk <= last.firstPage + last.count) {
            entries = last.chunk.entries.data() + (firstPage - last.firstPage);
        } else {
            kern_return_t read = readPagemap(task, pagemap, firstPage, chunk, ownEntries.data());
            if (read != KERN_SUCCESS) return read;
        }
        for (size_t i = 0; i < chunk; ++i) {
            uint64_t identity = htSharedPageIdentity(entries[i], swapShared, false);
            // Only a resident page can be a zero page.
            if (identity != 0 && checkZero && (entries[i] & HT_PAGEMAP_PRESENT) != 0) {
                const bool zero =
                    zeroRunsKnown ? zeroPages.contains(at + i * pageSize) : isZeroFrame(htPagemapFrame(entries[i]));
                if (zero) identity = 0;
            }
            *identities++ = identity;
        }
        at += chunk * pageSize;
    }
    return KERN_SUCCESS;
}

bool HTLinuxPlatform::isZeroFrame(uint64_t frame)
{
    int fd = kpageflagsFd();
    uint64_t flags = 0;
    if (fd < 0 || htPreadFully(fd, &flags, sizeof(flags), frame * sizeof(flags)) != sizeof(flags)) return false;
    return (flags & HT_KPF_ZERO_PAGE) != 0;
}
