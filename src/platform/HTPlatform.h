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
#include "platform/HTProgramRun.h"
#include "platform/HTTaskPort.h"

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

// One loaded image (executable or library) of a task, with its segments,
// as the image-inventory service lists it.
struct HTPlatformImageSegment {
    std::string name;
    uint64_t start = 0;
    uint64_t size = 0;
};
struct HTPlatformImage {
    std::string path;
    uint64_t baseAddress = 0;
    std::vector<HTPlatformImageSegment> segments;
};

// A loaded kernel module: its bundle identifier and its load tag.
struct HTLoadedModule {
    std::string bundleIdentifier;
    uint64_t loadTag = 0;
};

// A source location of kernel code.
struct HTSourceInfo {
    std::string path;
    int32_t line = 0;
};

// Names the running kernel's code addresses.
class HTKernelSymbolResolver {
public:
    virtual ~HTKernelSymbolResolver() = default;
    // The name of the symbol at the address; nullopt when none is known.
    virtual std::optional<std::string> symbolName(uint64_t address) = 0;
    // Where in the kernel's sources the code at the address comes from.
    virtual std::optional<HTSourceInfo> sourceInfo(uint64_t address) = 0;
};

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
    // sysctl by name ("vm.get_owned_vmobjects").
    // 0, or -1 and errno (ENOENT: no such setting).
    virtual int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) = 0;

    // --- tasks -----------------------------------------------------------
    virtual uint64_t vm_kernel_page_size() = 0;
    virtual kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) = 0;
    // A short text for a kernel return code.
    virtual std::string mach_error_string(kern_return_t code) = 0;
    // Writes "label: text (0xcode)" and a line feed to standard error.
    virtual void mach_error(const char* label, kern_return_t code) = 0;

    // --- a task's address space ----------------------------------------
    // The calls below answer "not supported" unless a backend overrides
    // them, the way a kernel without the facility would.
    // The region at or after *address, descending into submaps; *count is
    // VM_REGION_SUBMAP_INFO_COUNT_64 in and the words filled out.
    // KERN_INVALID_ADDRESS: no region at or above the address;
    // MACH_SEND_INVALID_DEST: the process has gone away.
    virtual kern_return_t mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size, uint32_t* depth,
                                                 vm_region_submap_info_64* info, uint32_t* count)
    {
        return KERN_FAILURE;
    }
    // The top-level region at or after *address (flavor
    // VM_REGION_BASIC_INFO_64).
    virtual kern_return_t mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                         vm_region_basic_info_64* info, uint32_t* count)
    {
        return KERN_FAILURE;
    }
    // VM_PURGABLE_GET_STATE of the object at the address.
    virtual kern_return_t mach_vm_purgable_control(HTTaskPort& task, uint64_t address, int control, int32_t* state)
    {
        return KERN_FAILURE;
    }
    // One disposition per page of [address, address + size); *count is the
    // room in and the entries filled out. KERN_INVALID_ARGUMENT when the
    // process has gone away.
    virtual kern_return_t mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size,
                                                   int32_t* dispositions, uint64_t* count)
    {
        return KERN_FAILURE;
    }
    // The runs of pages in [start, end) that may be resident or swapped out,
    // in address order, into `runs`; page-aligned bounds. A backend that
    // cannot tell answers the whole range. Page walks use it to step over
    // the unpopulated stretches of sparse mappings, whose pages would all
    // answer no disposition, and to take whole runs whose disposition the
    // backend knows without a page query.
    virtual void populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs)
    {
        runs.assign(1, HTPageRun{start, end, 0});
    }
    // Whether sharedPageIdentities can tell pages apart. It needs the
    // physical page numbers, which a kernel may show only to a privileged
    // reader.
    virtual bool canIdentifySharedPages() { return false; }
    // For each of `pages` pages from the page-aligned `address`: a non-zero
    // identity when the page is private anonymous memory (or a copied page
    // of a private file mapping) that other processes may map as well, as
    // after a fork; 0 for every other page. The identity names the physical
    // page, or the swap slot of a page that is swapped out, so equal
    // identities in two processes are one page. Identities are below
    // HTMaxPageIdentity. KERN_INVALID_ARGUMENT when the process has gone
    // away.
    virtual kern_return_t sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages, uint64_t* identities)
    {
        return KERN_FAILURE;
    }
    // The path of the file mapped at the address: the bytes written (not
    // terminated), 0 when none.
    virtual int proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize) { return 0; }

    // --- per-process figures -------------------------------------------
    // 0, or -1 and errno.
    virtual int proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info) { return unsupported(); }
    // LEDGER_TEMPLATE_INFO: fills at most *count template entries and sets
    // *count to the number of entries the template has (capped at the room
    // given). LEDGER_ENTRY_INFO: the same for the entries of a pid. -1 and
    // errno on failure.
    virtual int ledger_template(ledger_template_info* entries, int* count) { return unsupported(); }
    virtual int ledger_entries(int32_t pid, ledger_entry_info* entries, int* count) { return unsupported(); }

    // --- images ----------------------------------------------------------
    // Calls `callback` once per image of the task; false when the task's
    // image list cannot be opened.
    virtual bool forEachTaskImage(HTTaskPort& task, uint32_t flags,
                                  const std::function<void(const HTPlatformImage&)>& callback)
    {
        return false;
    }
    // The path with symbolic links resolved; nullopt when it cannot be.
    virtual std::optional<std::string> realpath(const std::string& path) { return std::nullopt; }

    // --- the kernel's memory ----------------------------------------------
    // The kernel's zones (names and figures, one each) and the sites of its
    // memory accounting. The vectors are filled afresh.
    virtual kern_return_t mach_memory_info(std::vector<mach_zone_name_t>& names, std::vector<mach_zone_info_t>& zones,
                                           std::vector<mach_memory_info_t>& sites)
    {
        return KERN_FAILURE;
    }
    // The loaded kernel modules; an empty list when there are none or the
    // kernel does not say.
    virtual std::vector<HTLoadedModule> OSKextCopyLoadedKextInfo() { return {}; }
    // A symbol resolver for the running kernel; null when there is none.
    virtual std::unique_ptr<HTKernelSymbolResolver> openKernelImageList() { return nullptr; }

    // --- a program run to its exit ----------------------------------------
    // Starts `arguments` (a program, looked up in PATH, and its arguments)
    // as a child with the caller's standard streams, holds it at its exit
    // and calls `atExit` while it is held; with `followChildren`, the same
    // for every process it starts, each at its own exit. Returns when the
    // program has ended. While it runs, the keyboard's interrupt and quit
    // reach the program alone.
    virtual HTProgramEnd runProgram(const std::vector<std::string>& arguments, bool followChildren,
                                    const std::function<void(const HTHeldExit&)>& atExit)
    {
        HTProgramEnd end;
        end.startError = ENOSYS;
        return end;
    }

    // --- the calling program -------------------------------------------
    // The system and its architecture, as a snapfile names them ("Linux
    // 6.1.0-26-amd64 x86_64").
    virtual std::string systemDescription() { return "unknown"; }

    virtual int32_t getpid() = 0;
    virtual uint32_t geteuid() = 0;
    virtual bool isatty(int fd) = 0;
    // Whether stat() succeeds on the path.
    virtual bool stat(const char* path) = 0;

protected:
    // -1 with errno ENOSYS.
    static int unsupported()
    {
        errno = ENOSYS;
        return -1;
    }
};
