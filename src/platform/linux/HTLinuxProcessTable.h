#pragma once

// The processes of /proc: which pids there are, the record of each from its
// stat line, its arguments, and the boot time the start times count from.
// Every call may run on any thread: reads go through per-thread buffers,
// and the only shared state is the /proc descriptor and the boot time.

#include "platform/HTPlatformTypes.h"
#include "platform/linux/HTFileDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string_view>

class HTProcBuffer;

class HTLinuxProcessTable {
public:
    HTLinuxProcessTable();

    // Pid 0 first (the kernel), then the processes with an address space of
    // their own; kernel threads are left out. With a null buffer: an upper
    // bound of that number.
    int listAllPids(int32_t* buffer, int bufferSize);
    // Calls `callback` with the pid of every entry of /proc, kernel threads
    // (whose files are empty) among them.
    static void forEachPid(const std::function<void(int32_t pid)>& callback);
    // The record of a process (or of the kernel for pid 0); false with
    // errno, ESRCH for a process that is gone or a kernel thread.
    bool readBsdInfo(int32_t pid, proc_bsdinfo& info);
    // The argument area of a process (see HTProcArgs.h), sysctl-style: its
    // size alone with a null `oldp`. 0, or -1 and errno.
    int readProcArgs(int32_t pid, void* oldp, size_t* oldlenp);
    // The size of argument area heft announces, sysctl-style. 0, or -1 and
    // errno.
    static int readArgMax(void* oldp, size_t* oldlenp);

    // Reads one of the small files of /proc/PID whole (stat, status,
    // cmdline); false with errno, ESRCH when the process is gone.
    bool readProcessFile(int32_t pid, std::string_view suffix, HTProcBuffer& buffer) const;
    // Reads the small file `name` of a live thread of the process, for one
    // whose main thread has exited; false with errno, ESRCH when no thread
    // lives.
    bool readLiveThreadFile(int32_t pid, const char* name, HTProcBuffer& buffer) const;

private:
    // Opens /proc/PID followed by `suffix` ("" for the directory itself,
    // with O_DIRECTORY in `flags`); closed with errno set, ESRCH when it is
    // gone.
    HTFileDescriptor openProcessFile(int32_t pid, std::string_view suffix, int flags = 0) const;
    void fillKernelInfo(proc_bsdinfo& info);
    // Seconds since the epoch at boot, read once.
    uint64_t bootTime();

    HTFileDescriptor procFd_;
    int procErrno_ = 0;
    long clockTicks_ = 100;
    std::once_flag bootTimeOnce_;
    uint64_t bootTime_ = 0;
};
