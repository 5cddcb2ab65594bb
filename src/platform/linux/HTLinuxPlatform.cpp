#include "platform/linux/HTLinuxPlatform.h"

#include "platform/HTMachErrorText.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <elf.h>
#include <fcntl.h>
#include <string_view>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#ifndef SYS_pidfd_open
#define SYS_pidfd_open 434
#endif

namespace {

constexpr bool kHeftIs64bit = sizeof(void*) == 8;
constexpr const char* kSelfRegionHeftName = "vm.self_region_heft";
// Bounds of the argument-area size heft announces: the caller allocates
// that much for every process it names.
constexpr long kArgMaxFloor = 4096;
constexpr long kArgMaxCeiling = 1024 * 1024;

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
bool executableIs64bit(int dirfd)
{
    int fd = ::openat(dirfd, "exe", O_RDONLY | O_CLOEXEC);
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
}

int HTLinuxPlatform::openProcessDirectory(int32_t pid) const
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
    formatPidPath(name, pid, "");
    int fd = ::openat(procFd_, name, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0 && errno == ENOENT) errno = ESRCH;
    return fd;
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
    int dirfd = openProcessDirectory(pid);
    if (dirfd < 0) return false;

    // Reused by every call on this thread: a listing reads thousands.
    thread_local HTProcBuffer buffer;
    if (!buffer.readFile(dirfd, "stat")) {
        if (errno == ENOENT) errno = ESRCH;
        closeKeepingErrno(dirfd);
        return false;
    }
    std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
    if (!stat || stat->isKernelThread()) {
        ::close(dirfd);
        errno = ESRCH;
        return false;
    }

    info = proc_bsdinfo{};
    // /proc/PID belongs to the process's effective user and group (to root
    // when the process is not dumpable).
    struct stat owner {};
    if (::fstat(dirfd, &owner) == 0) {
        info.pbi_uid = info.pbi_ruid = info.pbi_svuid = owner.st_uid;
        info.pbi_gid = info.pbi_rgid = info.pbi_svgid = owner.st_gid;
    }
    bool is64bit = executableIs64bit(dirfd);
    ::close(dirfd);

    info.pbi_flags = is64bit ? PROC_FLAG_LP64 : 0;
    info.pbi_status = htProcStatusForState(stat->state);
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
        if (!statBuffer.readFile(procFd_, path)) continue;
        std::optional<HTProcStat> stat = htParseProcStat(statBuffer.view());
        if (!stat || stat->isKernelThread()) continue;
        buffer[count++] = pid;
    }
    ::closedir(dir);
    return static_cast<int>(count);
}

int HTLinuxPlatform::proc_pidinfo(int32_t pid, int flavor, uint64_t, void* buffer, int bufferSize)
{
    size_t needed = flavor == PROC_PIDTBSDINFO         ? sizeof(proc_bsdinfo)
                    : flavor == PROC_PIDT_SHORTBSDINFO ? sizeof(proc_bsdshortinfo)
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

int HTLinuxPlatform::proc_get_dirty(int32_t, uint32_t*)
{
    return ENOTSUP;
}

int HTLinuxPlatform::readProcArgs(int32_t pid, void* oldp, size_t* oldlenp)
{
    if (pid <= 0 || oldlenp == nullptr) {
        errno = EINVAL;
        return -1;
    }
    int dirfd = openProcessDirectory(pid);
    if (dirfd < 0) return -1;
    char link[PATH_MAX + 1];
    ssize_t linkLength = ::readlinkat(dirfd, "exe", link, sizeof(link));
    if (linkLength < 0) {
        closeKeepingErrno(dirfd);
        return -1;
    }
    if (static_cast<size_t>(linkLength) == sizeof(link)) {
        ::close(dirfd);
        errno = ENAMETOOLONG;
        return -1;
    }
    thread_local HTProcBuffer cmdline;
    if (!cmdline.readFile(dirfd, "cmdline")) {
        if (errno == ENOENT) errno = ESRCH;
        closeKeepingErrno(dirfd);
        return -1;
    }
    ::close(dirfd);

    std::string_view path = htExecutablePathFromLink(std::string_view(link, static_cast<size_t>(linkLength)));
    size_t total = htBuildProcArgs(path, cmdline.view(), nullptr, 0);
    if (oldp == nullptr) {
        *oldlenp = total;
        return 0;
    }
    if (*oldlenp < htProcArgsHeaderSize(path)) {
        errno = ENOMEM;
        return -1;
    }
    htBuildProcArgs(path, cmdline.view(), static_cast<char*>(oldp), *oldlenp);
    *oldlenp = std::min(total, *oldlenp);
    return 0;
}

int HTLinuxPlatform::sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
                            size_t)
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
        long argmax = ::sysconf(_SC_ARG_MAX);
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

    // The pidfd names this process for as long as the handle lives,
    // whatever later becomes of its pid number.
    int pidFd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
    if (pidFd < 0 && errno != ENOSYS) return HT_KERN_ERRNO_BASE | errno;
    int dirfd = openProcessDirectory(pid);
    if (dirfd < 0) {
        int error = errno;
        if (pidFd >= 0) ::close(pidFd);
        return HT_KERN_ERRNO_BASE | error;
    }
    // Opening smaps runs the kernel's ptrace read check: the same right
    // every later read of the process's memory needs.
    int smaps = ::openat(dirfd, "smaps", O_RDONLY | O_CLOEXEC);
    if (smaps < 0) {
        int error = errno == ENOENT ? ESRCH : errno;
        ::close(dirfd);
        if (pidFd >= 0) ::close(pidFd);
        return HT_KERN_ERRNO_BASE | error;
    }
    ::close(smaps);
    *task = std::make_shared<HTLinuxTaskPort>(pid, dirfd, pidFd);
    return KERN_SUCCESS;
}

std::string HTLinuxPlatform::mach_error_string(kern_return_t code)
{
    return htMachErrorString(code);
}

void HTLinuxPlatform::mach_error(const char* label, kern_return_t code)
{
    std::fprintf(stderr, "%s: %s (0x%x)\n", label, htMachErrorString(code).c_str(), static_cast<unsigned>(code));
}

int32_t HTLinuxPlatform::getpid()
{
    return ::getpid();
}

uint32_t HTLinuxPlatform::geteuid()
{
    return ::geteuid();
}

bool HTLinuxPlatform::isatty(int fd)
{
    return ::isatty(fd) != 0;
}

bool HTLinuxPlatform::stat(const char* path)
{
    struct stat status {};
    return ::stat(path, &status) == 0;
}
