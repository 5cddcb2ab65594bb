#pragma once

// The platform calls answered from Linux's /proc. Every call may run on
// any thread: reads go through per-thread buffers and the only shared
// state is the /proc descriptor and the breakdown setting.

#include "platform/HTPlatform.h"

#include <atomic>
#include <cstdint>
#include <mutex>

class HTLinuxPlatform : public HTPlatform {
public:
    HTLinuxPlatform();
    ~HTLinuxPlatform() override;
    HTLinuxPlatform(const HTLinuxPlatform&) = delete;
    HTLinuxPlatform& operator=(const HTLinuxPlatform&) = delete;

    // Pid 0 first (the kernel), then the processes with an address space of
    // their own; kernel threads are left out. With a null buffer: an upper
    // bound of that number.
    int proc_listallpids(int32_t* buffer, int bufferSize) override;
    int proc_pidinfo(int32_t pid, int flavor, uint64_t arg, void* buffer, int bufferSize) override;
    // Linux has no idle-exit control: always ENOTSUP.
    int proc_get_dirty(int32_t pid, uint32_t* flags) override;
    int sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
               size_t newlen) override;
    int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) override;
    uint64_t vm_kernel_page_size() override;
    // An HTLinuxTaskPort, once the process's memory maps can be opened (the
    // kernel's ptrace read check); else HT_KERN_ERRNO_BASE | errno.
    kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) override;
    std::string mach_error_string(kern_return_t code) override;
    void mach_error(const char* label, kern_return_t code) override;
    int32_t getpid() override;
    uint32_t geteuid() override;
    bool isatty(int fd) override;
    bool stat(const char* path) override;

private:
    // Opens /proc/PID as a directory; -1 with errno (ESRCH when it is gone).
    int openProcessDirectory(int32_t pid) const;
    // The record of a process (or of the kernel for pid 0); false with
    // errno, ESRCH for a process that is gone or a kernel thread.
    bool readBsdInfo(int32_t pid, proc_bsdinfo& info);
    void fillKernelInfo(proc_bsdinfo& info);
    int readProcArgs(int32_t pid, void* oldp, size_t* oldlenp);
    // Seconds since the epoch at boot, read once.
    uint64_t bootTime();

    int procFd_ = -1;
    int procErrno_ = 0;
    long clockTicks_ = 100;
    std::once_flag bootTimeOnce_;
    uint64_t bootTime_ = 0;
    std::atomic<int32_t> selfRegionHeft_{0};
};
