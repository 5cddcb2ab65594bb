#include "platform/linux/HTLinuxProcessTable.h"

#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTLiveThread.h"
#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstring>
#include <elf.h>
#include <fcntl.h>
#include <optional>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr bool kHeftIs64bit = sizeof(void*) == 8;
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
    HTFileDescriptor fd(::openat(procFd, path, O_RDONLY | O_CLOEXEC));
    if (!fd.isOpen()) return kHeftIs64bit;
    unsigned char ident[EI_NIDENT];
    ssize_t count = ::pread(fd.get(), ident, sizeof(ident), 0);
    if (count <= EI_CLASS || std::memcmp(ident, ELFMAG, SELFMAG) != 0) return kHeftIs64bit;
    return ident[EI_CLASS] == ELFCLASS64;
}

void copyName(char* field, size_t fieldSize, std::string_view name)
{
    std::memcpy(field, name.data(), std::min(fieldSize, name.size()));
}

}  // namespace

HTLinuxProcessTable::HTLinuxProcessTable() : procFd_(::open("/proc", O_RDONLY | O_DIRECTORY | O_CLOEXEC))
{
    if (!procFd_.isOpen()) procErrno_ = errno;
    long ticks = ::sysconf(_SC_CLK_TCK);
    if (ticks > 0) clockTicks_ = ticks;
}

HTFileDescriptor HTLinuxProcessTable::openProcessFile(int32_t pid, std::string_view suffix, int flags) const
{
    if (!procFd_.isOpen()) {
        errno = procErrno_;
        return HTFileDescriptor();
    }
    if (pid <= 0) {
        errno = ESRCH;
        return HTFileDescriptor();
    }
    char name[48];
    formatPidPath(name, pid, suffix);
    HTFileDescriptor fd(::openat(procFd_.get(), name, O_RDONLY | O_CLOEXEC | flags));
    if (!fd.isOpen() && errno == ENOENT) errno = ESRCH;
    return fd;
}

bool HTLinuxProcessTable::readProcessFile(int32_t pid, std::string_view suffix, HTProcBuffer& buffer) const
{
    HTFileDescriptor fd = openProcessFile(pid, suffix);
    if (!fd.isOpen()) return false;
    bool read = buffer.readDescriptor(fd.get(), HTProcBuffer::End::ShortRead);
    if (!read && errno == ENOENT) errno = ESRCH;
    return read;
}

bool HTLinuxProcessTable::readLiveThreadFile(int32_t pid, const char* name, HTProcBuffer& buffer) const
{
    HTFileDescriptor thread;
    {
        HTFileDescriptor process = openProcessFile(pid, "", O_DIRECTORY);
        if (!process.isOpen()) return false;
        thread = htOpenLiveThreadDirectory(process.get());
    }
    if (!thread.isOpen()) return false;
    bool read = buffer.readFile(thread.get(), name, HTProcBuffer::End::ShortRead);
    if (!read && errno == ENOENT) errno = ESRCH;
    return read;
}

uint64_t HTLinuxProcessTable::bootTime()
{
    std::call_once(bootTimeOnce_, [this] {
        HTProcBuffer buffer;
        if (!procFd_.isOpen() || !buffer.readFile(procFd_.get(), "stat")) return;
        std::string_view text = buffer.view();
        constexpr std::string_view key = "\nbtime ";
        size_t at = text.find(key);
        if (at == std::string_view::npos) return;
        text.remove_prefix(at + key.size());
        std::from_chars(text.data(), text.data() + text.size(), bootTime_);
    });
    return bootTime_;
}

void HTLinuxProcessTable::fillKernelInfo(proc_bsdinfo& info)
{
    info = proc_bsdinfo{};
    info.pbi_flags = PROC_FLAG_SYSTEM | (kHeftIs64bit ? PROC_FLAG_LP64 : 0);
    info.pbi_status = SRUN;
    copyName(info.pbi_comm, sizeof(info.pbi_comm), "kernel");
    copyName(info.pbi_name, sizeof(info.pbi_name), "kernel");
    info.pbi_start_tvsec = bootTime();
}
bool HTLinuxProcessTable::readBsdInfo(int32_t pid, proc_bsdinfo& info)
{
    if (pid == 0) {
        fillKernelInfo(info);
        return true;
    }
    // Reused by every call on this thread: a listing reads thousands.
    thread_local HTProcBuffer buffer;
    struct stat owner {};
    bool ownerKnown = false;
    bool read = false;
    {
        HTFileDescriptor fd = openProcessFile(pid, "/stat");
        if (!fd.isOpen()) return false;
        // Every file of /proc/PID belongs to the process's effective user
        // and group (to root when the process is not dumpable).
        ownerKnown = ::fstat(fd.get(), &owner) == 0;
        read = buffer.readDescriptor(fd.get(), HTProcBuffer::End::ShortRead);
    }
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
    bool is64bit = startstack != 0 ? startstack > UINT32_MAX : executableIs64bit(procFd_.get(), pid);

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

void HTLinuxProcessTable::forEachPid(const std::function<void(int32_t pid)>& callback)
{
    HTDirectoryListing dir = htListDirectory(HTFileDescriptor(::open("/proc", O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
    if (!dir) return;
    int32_t pid = 0;
    while (dirent* entry = ::readdir(dir.get()))
        if (pidFromName(entry->d_name, pid)) callback(pid);
}

int HTLinuxProcessTable::listAllPids(int32_t* buffer, int bufferSize)
{
    if (!procFd_.isOpen()) {
        errno = procErrno_;
        return -1;
    }
    // A descriptor of its own, so that concurrent listings do not share a
    // directory position.
    HTDirectoryListing dir =
        htListDirectory(HTFileDescriptor(::openat(procFd_.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
    if (!dir) return -1;

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
        dirent* entry = ::readdir(dir.get());
        if (entry == nullptr) {
            if (errno != 0) return -1;
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
        if (::readlinkat(procFd_.get(), path, target, sizeof(target)) >= 0) {
            buffer[count++] = pid;
            continue;
        }
        formatPidPath(path, pid, "/stat");
        if (!statBuffer.readFile(procFd_.get(), path, HTProcBuffer::End::ShortRead)) continue;
        std::optional<HTProcStat> stat = htParseProcStat(statBuffer.view());
        if (!stat || stat->isKernelThread()) continue;
        buffer[count++] = pid;
    }
    return static_cast<int>(count);
}

int HTLinuxProcessTable::readProcArgs(int32_t pid, void* oldp, size_t* oldlenp)
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
    ssize_t linkLength = ::readlinkat(procFd_.get(), path, link, sizeof(link));
    if (linkLength < 0) {
        // A zombie has lost its executable (ENOENT); a process that is
        // gone has lost its directory as well.
        formatPidPath(path, pid, "");
        struct stat directory {};
        if (errno == ENOENT && ::fstatat(procFd_.get(), path, &directory, 0) != 0) errno = ESRCH;
        return -1;
    }
    if (static_cast<size_t>(linkLength) == sizeof(link)) {
        errno = ENAMETOOLONG;
        return -1;
    }
    thread_local HTProcBuffer cmdline;
    if (!readProcessFile(pid, "/cmdline", cmdline)) return -1;

    std::string_view executable = htPathWithoutDeletedMark(std::string_view(link, static_cast<size_t>(linkLength)));
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

int HTLinuxProcessTable::readArgMax(void* oldp, size_t* oldlenp)
{
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
