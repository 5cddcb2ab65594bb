#pragma once

// The address space of a process as its smaps shows it: the region walk,
// the file behind a region, and the images mapped. /proc/PID/smaps is read
// once per walk (when the walk starts at address 0, or the handle has no
// mappings yet) and the calls answer from the parsed mappings, which the
// handle keeps. A process that is gone or a zombie answers
// MACH_SEND_INVALID_DEST; no mapping at or above the address
// KERN_INVALID_ADDRESS; other failures HT_KERN_ERRNO_BASE | errno.

#include "platform/HTPlatform.h"
#include "platform/linux/HTElfImageReader.h"

#include <cstdint>
#include <functional>
#include <memory>

class HTLinuxTaskPort;
struct HTSmapsEntry;

// The kernel's page size, asked once.
uint64_t htKernelPageSize();

class HTLinuxMappings {
public:
    // An HTLinuxTaskPort, once the process's memory maps can be opened (the
    // kernel's ptrace read check); else HT_KERN_ERRNO_BASE | errno. The
    // handle holds no descriptor until it is used.
    kern_return_t openTask(int32_t pid, std::shared_ptr<HTTaskPort>* task);
    kern_return_t regionRecurse(HTTaskPort& task, uint64_t* address, uint64_t* size, vm_region_submap_info_64* info,
                                uint32_t* count);
    kern_return_t region(HTTaskPort& task, uint64_t* address, uint64_t* size, vm_region_basic_info_64* info,
                         uint32_t* count);
    // The path of the mapping that holds the address, as smaps shows it: a
    // file that was deleted or replaced keeps its " (deleted)" mark.
    int regionFileName(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize);
    // The ELF objects mapped by the task, with their segments.
    bool forEachImage(HTTaskPort& task, const std::function<void(const HTPlatformImage&)>& callback);

    // Parses the task's smaps when `refresh` is set or nothing was parsed
    // yet. KERN_SUCCESS, MACH_SEND_INVALID_DEST for a process that is gone
    // or a zombie, else HT_KERN_ERRNO_BASE | errno.
    static kern_return_t loadVmas(HTLinuxTaskPort& task, bool refresh);

private:
    // The task's first mapping that ends above the address, read anew when
    // the address is 0 (a walk begins); KERN_INVALID_ADDRESS when none.
    static kern_return_t vmaAtOrAbove(HTTaskPort& task, uint64_t address, const HTSmapsEntry** vma);

    // Parsed program headers are cached per file for the whole run.
    HTElfImageReader imageReader_;
};
