#pragma once

// The kernel's memory as the memory-info call reports it, assembled from
// what Linux shows (most of it to root alone):
// - a zone a slab cache of /proc/slabinfo;
// - a kernel-code site a function that owns vmalloc pages
//   (/proc/vmallocinfo), at the function's address;
// - with allocation profiling (/proc/allocinfo), a hidden kernel-code site
//   a call site that allocates, with its file and line;
// - a hidden module site a module of /proc/modules;
// - tag sites for the kernel's stacks, per-CPU memory, page tables and the
//   memory that processes locked, from /proc/meminfo;
// - a counter every /proc/meminfo figure;
// - a tag site of its own for the System V segments that belong to nobody
//   (/proc/sysvipc/shm), in memory or in swap.
// Every record carries its own name. Each byte the kernel holds counts once
// among the sites that are neither hidden nor user wired: slab memory in
// the zones, vmalloc memory in its code sites. Sites whose memory is
// counted elsewhere are hidden.

#include "platform/HTPlatform.h"
#include "platform/linux/HTLinuxKernelSymbols.h"

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

struct HTAllocinfoSite;
struct HTMeminfoField;
struct HTModuleLine;
struct HTSlabCache;
struct HTVmallocCaller;

class HTLinuxKernelMemory {
public:
    // `root` holds proc/ and sys/: "/" for the running kernel, a folder of
    // captured files in tests.
    HTLinuxKernelMemory(std::string root, uint64_t pageSize);

    // The zones and sites; HT_KERN_ERRNO_BASE | errno when a file the answer
    // needs cannot be read (EACCES without root).
    kern_return_t memoryInfo(std::vector<mach_zone_name_t>& names, std::vector<mach_zone_info_t>& zones,
                             std::vector<mach_memory_info_t>& sites);
    // One a line of /proc/modules, the line's index as load tag; none when
    // the kernel has no modules.
    std::vector<HTLoadedModule> loadedModules() const;
    // Names code addresses from kallsyms (the table memoryInfo read, or read
    // on the first name asked for), and the allocation sites of the last
    // memoryInfo answer with their file and line.
    std::unique_ptr<HTKernelSymbolResolver> openSymbolResolver();

private:
    std::string path(const char* relative) const { return root_ + relative; }
    void addZones(const std::vector<HTSlabCache>& caches, std::vector<mach_zone_name_t>& names,
                  std::vector<mach_zone_info_t>& zones) const;
    void addCodeSites(const std::vector<HTVmallocCaller>& callers, const HTSymbolAddresses& addresses,
                      std::vector<mach_memory_info_t>& sites) const;
    void addAllocationSites(const std::vector<HTAllocinfoSite>& allocations, const HTSymbolAddresses& addresses,
                            std::vector<mach_memory_info_t>& sites);
    static void addModuleSites(const std::vector<HTModuleLine>& modules, std::vector<mach_memory_info_t>& sites);
    static void addTagSites(const std::vector<HTMeminfoField>& fields, bool stacksCountedElsewhere,
                            std::vector<mach_memory_info_t>& sites);
    // System V segments that nobody maps and whose creator has exited:
    // shared memory that no process shows.
    void addOrphanedSegments(std::vector<mach_memory_info_t>& sites) const;
    static void addCounters(const std::vector<HTMeminfoField>& fields, std::vector<mach_memory_info_t>& sites);
    // The addresses of the functions the sites name, and of the symbol that
    // tells vmalloc stacks.
    HTSymbolAddresses findAddresses(const std::vector<HTVmallocCaller>& callers,
                                    const std::vector<HTAllocinfoSite>& allocations) const;

    const std::string root_;
    const uint64_t pageSize_;
    std::shared_ptr<HTLinuxKernelSymbols> symbols_;
};
