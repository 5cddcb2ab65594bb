#pragma once

#include "process/HTProcess.h"

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

class HTAuxDataMap;
class HTMemoryRegion;

// The kernel, presented as a process so that its own memory shows up
// beside the user processes. It has no address space to walk: one
// mach_memory_info call gives its zones and its wired memory by site, and
// each zone and each site becomes a region of its own. The kernel's page
// counters become auxiliary data.
class HTKernelProcess : public HTProcess {
public:
    // Bundle identifiers by load tag. Load tags are small consecutive
    // numbers, so they are hashed whole rather than by their high bits.
    using KextTags = std::unordered_map<uint64_t, std::string>;

    explicit HTKernelProcess(std::shared_ptr<HTPlatform> platform);
    ~HTKernelProcess() override;

    // The base steps; the kernel is never under idle-exit control.
    bool initWithBsdInfo(const proc_bsdinfo& info) override;
    bool _populateTask() override;
    bool _isAlive() override;
    // Zones first, then the wired sites; a failed call leaves an error and
    // no regions.
    void gatherData() override;
    // {"Maps": the counters}.
    std::shared_ptr<HTAuxDataMap> auxData() override;

    // The loaded modules, by load tag.
    static KextTags kextTags(HTPlatform& platform);
    static KextTags _kextTagsWithKextInfo(const std::vector<HTLoadedModule>& modules);
    static std::unique_ptr<HTKernelSymbolResolver> _createSymbolicator(HTPlatform& platform);
    // The display name of a site. With `zoneNames`, a site inside a zone
    // gets the zone's name in brackets; `symbolicator` may be null.
    static std::string _nameForWiredInfo(const mach_memory_info_t& info, const KextTags& kexts,
                                         HTKernelSymbolResolver* symbolicator,
                                         const std::vector<mach_zone_name_t>* zoneNames);
    // Names the region after its site, with the code's source location as
    // its detail when the site is kernel code the resolver knows.
    static void _setNameForRegion(HTMemoryRegion& region, const mach_memory_info_t& info, const KextTags& kexts,
                                  HTKernelSymbolResolver* symbolicator, const std::vector<mach_zone_name_t>* zoneNames);

protected:
    // Counters go to the auxiliary data; every other site with memory
    // becomes a region appended to `regions`.
    void _addWiredData(const std::vector<mach_memory_info_t>& infos, const std::vector<mach_zone_name_t>& zoneNames,
                       std::vector<std::shared_ptr<HTMemoryRegion>>& regions);

private:
    // One region a zone.
    static void _addZones(const std::vector<mach_zone_name_t>& names, const std::vector<mach_zone_info_t>& zones,
                          std::vector<std::shared_ptr<HTMemoryRegion>>& regions);
    // The error of a failed mach_memory_info.
    void _addMemoryInfoError(kern_return_t code);

    std::shared_ptr<HTAuxDataMap> counters_;
};
