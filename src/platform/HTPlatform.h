#pragma once

// The kernel and system calls heft makes, as one interface. The Linux
// backend (platform/linux) answers them from /proc and /sys; the fake
// backend (platform/fake) answers what a test scripted. Nothing above this
// folder reads the kernel in any other way.
//
// Calls keep the names and the conventions of the interface the program is
// written against: counts and byte lengths as results, -1 or 0 with errno
// set on failure, kernel return codes from the task calls.

#include "platform/HTPlatformTypes.h"
#include "platform/HTTaskPort.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

class HTPlatform {
public:
    virtual ~HTPlatform() = default;

    // --- process information -------------------------------------------
    // With a null buffer: the number of processes. Otherwise fills at most
    // bufferSize bytes of pids and returns how many it wrote. -1 and errno
    // on failure.
    virtual int proc_listallpids(int32_t* buffer, int bufferSize) = 0;
    // Fills `buffer` with the record of `flavor` (PROC_PIDTBSDINFO,
    // PROC_PIDT_SHORTBSDINFO); returns the bytes filled, 0 and errno on
    // failure (ESRCH: no such process).
    virtual int proc_pidinfo(int32_t pid, int flavor, uint64_t arg, void* buffer, int bufferSize) = 0;
    // The idle-exit dirty flags; 0 or an errno.
    virtual int proc_get_dirty(int32_t pid, uint32_t* flags) = 0;

    // --- sysctl ----------------------------------------------------------
    // sysctl by name vector: {CTL_KERN, KERN_ARGMAX} and
    // {CTL_KERN, KERN_PROCARGS2, pid}. 0, or -1 and errno.
    virtual int sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
                       size_t newlen) = 0;
    // sysctl by name ("vm.self_region_heft", "vm.get_owned_vmobjects").
    // 0, or -1 and errno (ENOENT: no such setting).
    virtual int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) = 0;

    // --- tasks -----------------------------------------------------------
    virtual uint64_t vm_kernel_page_size() = 0;
    virtual kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) = 0;
    // A short text for a kernel return code.
    virtual std::string mach_error_string(kern_return_t code) = 0;
    // Writes "label: text (0xcode)" and a line feed to standard error.
    virtual void mach_error(const char* label, kern_return_t code) = 0;

    // --- the calling program -------------------------------------------
    virtual int32_t getpid() = 0;
    virtual uint32_t geteuid() = 0;
    virtual bool isatty(int fd) = 0;
    // Whether stat() succeeds on the path.
    virtual bool stat(const char* path) = 0;
};
