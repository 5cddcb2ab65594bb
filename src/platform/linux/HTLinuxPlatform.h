#pragma once

// The platform calls answered from Linux's /proc. The work lives in rooms of
// its own, which this class owns and forwards to: the process table, the
// status figures, the address space and its page queries, the path cache
// and the kernel's memory. Every call may run on any thread: reads go through per-thread
// buffers and the only shared state is the /proc and /proc/kpageflags
// descriptors and the caches. A task handle is used by one thread at a
// time.

#include "platform/HTPlatform.h"
#include "platform/linux/HTLinuxKernelMemory.h"
#include "platform/linux/HTLinuxMappings.h"
#include "platform/linux/HTLinuxOwnedObjects.h"
#include "platform/linux/HTLinuxPageQueries.h"
#include "platform/linux/HTLinuxPathCache.h"
#include "platform/linux/HTLinuxProcessTable.h"
#include "platform/linux/HTLinuxStatusReader.h"

#include <cstdint>
#include <optional>
#include <string>

class HTLinuxPlatform : public HTPlatform {
public:
    HTLinuxPlatform() = default;
    HTLinuxPlatform(const HTLinuxPlatform&) = delete;
    HTLinuxPlatform& operator=(const HTLinuxPlatform&) = delete;

    // The process table (HTLinuxProcessTable.h).
    int proc_listallpids(int32_t* buffer, int bufferSize) override;
    int proc_pidinfo(int32_t pid, int flavor, uint64_t arg, void* buffer, int bufferSize) override;
    // Linux has no idle-exit control: always ENOTSUP.
    int proc_get_dirty(int32_t pid, uint32_t* flags) override;
    // KERN_ARGMAX and KERN_PROCARGS2, from the process table.
    int sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
               size_t newlen) override;
    // "vm.get_owned_vmobjects" alone, from the owned objects
    // (HTLinuxOwnedObjects.h); any other name is ENOENT.
    int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) override;

    // The address space (HTLinuxMappings.h, HTLinuxPageQueries.h).
    uint64_t vm_kernel_page_size() override;
    kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) override;
    // Linux has no submaps: the depth stays as it was.
    kern_return_t mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size, uint32_t* depth,
                                         vm_region_submap_info_64* info, uint32_t* count) override;
    kern_return_t mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size, vm_region_basic_info_64* info,
                                 uint32_t* count) override;
    // Linux has no purgeable memory: always KERN_INVALID_ARGUMENT.
    kern_return_t mach_vm_purgable_control(HTTaskPort& task, uint64_t address, int control, int32_t* state) override;
    kern_return_t mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size, int32_t* dispositions,
                                           uint64_t* count) override;
    bool canIdentifySharedPages() override;
    std::string systemDescription() override;
    kern_return_t sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                       uint64_t* identities) override;
    int proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize) override;
    void populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs) override;
    bool forEachTaskImage(HTTaskPort& task, uint32_t flags,
                          const std::function<void(const HTPlatformImage&)>& callback) override;

    // The status figures (HTLinuxStatusReader.h).
    int proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info) override;
    int ledger_template(ledger_template_info* entries, int* count) override;
    int ledger_entries(int32_t pid, ledger_entry_info* entries, int* count) override;

    // A program held at each exit (HTLinuxProgramRunner.h).
    HTProgramEnd runProgram(const std::vector<std::string>& arguments, bool followChildren,
                            const std::function<void(const HTHeldExit&)>& atExit) override;

    // The path cache (HTLinuxPathCache.h).
    std::optional<std::string> realpath(const std::string& path) override;

    // The kernel's memory (HTLinuxKernelMemory.h).
    kern_return_t mach_memory_info(std::vector<mach_zone_name_t>& names, std::vector<mach_zone_info_t>& zones,
                                   std::vector<mach_memory_info_t>& sites) override;
    std::vector<HTLoadedModule> OSKextCopyLoadedKextInfo() override;
    std::unique_ptr<HTKernelSymbolResolver> openKernelImageList() override;

    std::string mach_error_string(kern_return_t code) override;
    void mach_error(const char* label, kern_return_t code) override;
    int32_t getpid() override;
    uint32_t geteuid() override;
    bool isatty(int fd) override;
    bool stat(const char* path) override;

private:
    // What heft learns of a process held at its exit.
    HTHeldExit heldExit(int32_t pid, bool didExec);

    HTLinuxProcessTable processes_;
    HTLinuxStatusReader status_{processes_};
    HTLinuxOwnedObjects owned_{processes_};
    HTLinuxMappings mappings_;
    HTLinuxPageQueries pages_;
    HTLinuxPathCache paths_;
    HTLinuxKernelMemory kernel_{"/", htKernelPageSize()};
};
