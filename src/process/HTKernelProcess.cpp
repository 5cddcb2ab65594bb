#include "process/HTKernelProcess.h"

#include "base/HTNoticeLog.h"
#include "base/HTStringFormat.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string_view>

namespace {

// A record is a counter when its type is the counter type and it is
// neither wired nor inside a zone; such records carry a figure, not memory.
constexpr uint64_t kCounterMask = VM_KERN_SITE_TYPE | VM_KERN_SITE_WIRED | VM_KERN_SITE_ZONE;

// High bits that keep the memory-object identities of the kinds of kernel
// regions apart, so that a zone never merges with a site of equal number.
constexpr uint64_t kCodeObject = 0x100000000;
constexpr uint64_t kZoneObject = 0x200000000;
constexpr uint64_t kTagObject = 0x300000000;
constexpr uint64_t kCounterObject = 0x400000000;
constexpr uint64_t kModuleObject = 0x500000000;

// Names of the kernel's memory tags; null where a tag has none.
using TagNameTable = std::array<const char*, 256>;

constexpr TagNameTable makeTagNameTable()
{
    TagNameTable table{};
    const char* const named[] = {
        "VM_KERN_MEMORY_NONE",          "VM_KERN_MEMORY_OSFMK",
        "VM_KERN_MEMORY_BSD",           "VM_KERN_MEMORY_IOKIT",
        "VM_KERN_MEMORY_LIBKERN",       "VM_KERN_MEMORY_OSKEXT",
        "VM_KERN_MEMORY_KEXT",          "VM_KERN_MEMORY_IPC",
        "VM_KERN_MEMORY_STACK",         "VM_KERN_MEMORY_CPU",
        "VM_KERN_MEMORY_PMAP",          "VM_KERN_MEMORY_PTE",
        "VM_KERN_MEMORY_ZONE",          "VM_KERN_MEMORY_KALLOC",
        "VM_KERN_MEMORY_COMPRESSOR",    "VM_KERN_MEMORY_COMPRESSED_DATA",
        "VM_KERN_MEMORY_PHANTOM_CACHE", "VM_KERN_MEMORY_WAITQ",
        "VM_KERN_MEMORY_DIAG",          "VM_KERN_MEMORY_LOG",
        "VM_KERN_MEMORY_FILE",          "VM_KERN_MEMORY_MBUF",
        "VM_KERN_MEMORY_UBC",           "VM_KERN_MEMORY_SECURITY",
        "VM_KERN_MEMORY_MLOCK",         "VM_KERN_MEMORY_REASON",
        "VM_KERN_MEMORY_SKYWALK",       "VM_KERN_MEMORY_LTABLE",
        "VM_KERN_MEMORY_FIRST_DYNAMIC",
    };
    for (size_t tag = 0; tag < std::size(named); ++tag) table[tag] = named[tag];
    table[255] = "VM_KERN_MEMORY_ANY";
    return table;
}

constexpr TagNameTable kTagNames = makeTagNameTable();

// Names of the kernel's page counters, by index.
constexpr std::array<const char*, 11> kCounterNames = {
    "VM_KERN_COUNT_MANAGED",    "VM_KERN_COUNT_RESERVED",   "VM_KERN_COUNT_WIRED",       "VM_KERN_COUNT_WIRED_MANAGED",
    "VM_KERN_COUNT_STOLEN",     "VM_KERN_COUNT_LOPAGE",     "VM_KERN_COUNT_MAP_KERNEL",  "VM_KERN_COUNT_MAP_ZONE",
    "VM_KERN_COUNT_MAP_KALLOC", "VM_KERN_COUNT_WIRED_BOOT", "VM_KERN_COUNT_BOOT_STOLEN",
};

// The text of a fixed 80-byte name field, which need not be terminated.
std::string_view nameField(const char* field) { return {field, strnlen(field, MACH_ZONE_NAME_MAX_LEN)}; }

uint64_t siteType(const mach_memory_info_t& info) { return info.flags & VM_KERN_SITE_TYPE; }

// The name a site has by itself, before a zone's name is added. Every site
// has one: a table's, the module's or symbol's, or its numbers.
std::string ownSiteName(const mach_memory_info_t& info, const HTKernelProcess::KextTags& kexts,
                        HTKernelSymbolResolver* symbolicator)
{
    if (info.flags & VM_KERN_SITE_NAMED) {
        const std::string_view own = nameField(info.name);
        if (!own.empty()) return std::string(own);
    }
    const uint64_t site = info.site;
    switch (siteType(info)) {
    case VM_KERN_SITE_TAG:
        if (site < kTagNames.size() && kTagNames[site] != nullptr) return kTagNames[site];
        return htStringWithFormat("VM_KERN_MEMORY_%llu", static_cast<unsigned long long>(site));
    case VM_KERN_SITE_KMOD: {
        auto module = kexts.find(site);
        if (module != kexts.end() && !module->second.empty()) return module->second;
        return htStringWithFormat("unloaded kmod %llu", static_cast<unsigned long long>(site));
    }
    case VM_KERN_SITE_KERNEL:
        if (site != 0 && symbolicator != nullptr)
            if (auto symbol = symbolicator->symbolName(site); symbol && !symbol->empty()) return *symbol;
        return htStringWithFormat("site 0x%llx", static_cast<unsigned long long>(site));
    case VM_KERN_SITE_COUNTER:
        if (site < kCounterNames.size()) return kCounterNames[site];
        return htStringWithFormat("VM_KERN_COUNT_%llu", static_cast<unsigned long long>(site));
    default:
        return htStringWithFormat("unknown site (0x%x, 0x%llx)", static_cast<unsigned>(siteType(info)),
                                  static_cast<unsigned long long>(site));
    }
}

uint64_t objectIdForSite(const mach_memory_info_t& info)
{
    switch (siteType(info)) {
    case VM_KERN_SITE_TAG:
        return info.site ^ kTagObject;
    case VM_KERN_SITE_KMOD:
        return info.site ^ kModuleObject;
    case VM_KERN_SITE_COUNTER:  // one that holds memory: wired or in a zone
        return info.site ^ kCounterObject;
    default:
        return info.site ^ kCodeObject;
    }
}

// The region of the site record at `index`, which holds `value` bytes.
std::shared_ptr<HTMemoryRegion> siteRegion(const mach_memory_info_t& info, size_t index, uint64_t value)
{
    auto region = std::make_shared<HTMemoryRegion>();
    const bool wired = info.flags & VM_KERN_SITE_WIRED;
    const bool hidden = info.flags & VM_KERN_SITE_HIDE;
    const bool userWired = siteType(info) == VM_KERN_SITE_TAG && info.site == VM_KERN_MEMORY_MLOCK;
    // Only wired memory that is the kernel's own counts dirty. Memory in a
    // zone is the zone's, which its own region counts; hidden sites are
    // counted elsewhere (as the processes' own page tables); memory that
    // user processes wired is theirs; and what is not wired can be paged
    // out.
    if ((info.flags & HT_KERN_SITE_SWAPPABLE) && !hidden) {
        // Written memory with nowhere else to go: dirty, or in swap.
        const uint64_t swapped = std::min(info.mapped, value);
        region->setDirtySize(value - swapped);
        region->setSwappedSize(swapped);
    } else if ((info.flags & VM_KERN_SITE_ZONE) || !wired || hidden || userWired) {
        region->setCleanNonSpecSize(value);
        if (hidden)
            region->setDetailedName("(hidden)");
        else if (userWired)
            region->setDetailedName("(user wired)");
    } else {
        region->setDirtySize(value);
    }
    region->setWired(wired);
    region->setSize(value);
    region->setUser_tag(static_cast<uint32_t>(index));
    region->setObject_id(objectIdForSite(info));
    return region;
}

}  // namespace

HTKernelProcess::HTKernelProcess(std::shared_ptr<HTPlatform> platform)
    : HTProcess(std::move(platform)), counters_(std::make_shared<HTAuxDataMap>())
{
}

HTKernelProcess::~HTKernelProcess() = default;

bool HTKernelProcess::initWithBsdInfo(const proc_bsdinfo& info)
{
    if (!HTProcess::initWithBsdInfo(info)) return false;
    setIdleExitStatus(HTIdleExitStatusNotControlled);
    return true;
}

bool HTKernelProcess::_populateTask() { return true; }

bool HTKernelProcess::_isAlive() { return true; }

void HTKernelProcess::gatherData()
{
    std::vector<mach_zone_name_t> zoneNames;
    std::vector<mach_zone_info_t> zones;
    std::vector<mach_memory_info_t> infos;
    const kern_return_t result = platform().mach_memory_info(zoneNames, zones, infos);
    if (result != KERN_SUCCESS) {
        _addMemoryInfoError(result);
        return;
    }
    std::vector<std::shared_ptr<HTMemoryRegion>> regions;
    _addZones(zoneNames, zones, regions);
    _addWiredData(infos, zoneNames, regions);
    setMemoryRegions(std::move(regions));
}

std::shared_ptr<HTAuxDataMap> HTKernelProcess::auxData()
{
    auto data = std::make_shared<HTAuxDataMap>();
    data->set("Maps", counters_);
    return data;
}

void HTKernelProcess::_addMemoryInfoError(kern_return_t code)
{
    const std::string text = platform().mach_error_string(code);
    HTNoticeLog::standardError().add("%s: mach_memory_info: " + text, pid(), displayString());
    // Refused permission is what a run without root meets: the error says
    // what would help.
    const int error = (code & ~0xffff) == HT_KERN_ERRNO_BASE ? code & 0xffff : 0;
    const bool needsRoot = error == EACCES || error == EPERM;
    char message[1024];
    std::snprintf(message, sizeof(message), "%s: %s%s", displayString().c_str(), text.c_str(),
                  needsRoot ? " (reading the kernel's memory needs root)" : "");
    addError(message);
}

void HTKernelProcess::_addZones(const std::vector<mach_zone_name_t>& names, const std::vector<mach_zone_info_t>& zones,
                                std::vector<std::shared_ptr<HTMemoryRegion>>& regions)
{
    // The kernel gives as many figures as names; should it ever not, only
    // zones with both can be told.
    const size_t count = std::min(names.size(), zones.size());
    for (size_t i = 0; i < count; ++i) {
        const mach_zone_info_t& zone = zones[i];
        auto region = std::make_shared<HTMemoryRegion>();
        const std::string_view name = nameField(names[i].mzn_name);
        region->setName(name.empty() ? "unknown" : std::string(name));
        // The free elements of a collectable zone can be given back; those
        // of any other zone stay with it.
        const uint64_t dirty = zone.mzi_collectable ? zone.mzi_count * zone.mzi_elem_size : zone.mzi_cur_size;
        region->setDirtySize(dirty);
        // Counts read while the zone changes may disagree; never wrap.
        region->setReclaimableSize(zone.mzi_cur_size > dirty ? zone.mzi_cur_size - dirty : 0);
        region->setSize(zone.mzi_cur_size);
        region->setDetailedName("zone");
        region->setObject_id(i | kZoneObject);
        regions.push_back(std::move(region));
    }
}

void HTKernelProcess::_addWiredData(const std::vector<mach_memory_info_t>& infos,
                                    const std::vector<mach_zone_name_t>& zoneNames,
                                    std::vector<std::shared_ptr<HTMemoryRegion>>& regions)
{
    const KextTags kexts = kextTags(platform());
    const std::unique_ptr<HTKernelSymbolResolver> symbolicator = _createSymbolicator(platform());
    for (size_t n = 0; n < infos.size(); ++n) {
        const mach_memory_info_t& info = infos[n];
        const bool counter = (info.flags & kCounterMask) == VM_KERN_SITE_COUNTER;
        const uint64_t value = counter ? info.mapped : info.size;
        if (info.site == 0 && value == 0) continue;
        if (counter) {
            counters_->set(_nameForWiredInfo(info, kexts, symbolicator.get(), nullptr),
                           std::make_shared<HTAuxData>(static_cast<int64_t>(value), false));
            continue;
        }
        auto region = siteRegion(info, n, value);
        _setNameForRegion(*region, info, kexts, symbolicator.get(), &zoneNames);
        regions.push_back(std::move(region));
    }
}

HTKernelProcess::KextTags HTKernelProcess::kextTags(HTPlatform& platform)
{
    return _kextTagsWithKextInfo(platform.OSKextCopyLoadedKextInfo());
}

HTKernelProcess::KextTags HTKernelProcess::_kextTagsWithKextInfo(const std::vector<HTLoadedModule>& modules)
{
    KextTags tags;
    tags.reserve(modules.size());
    for (const HTLoadedModule& module : modules) tags.insert_or_assign(module.loadTag, module.bundleIdentifier);
    return tags;
}

std::unique_ptr<HTKernelSymbolResolver> HTKernelProcess::_createSymbolicator(HTPlatform& platform)
{
    return platform.openKernelImageList();
}

std::string HTKernelProcess::_nameForWiredInfo(const mach_memory_info_t& info, const KextTags& kexts,
                                               HTKernelSymbolResolver* symbolicator,
                                               const std::vector<mach_zone_name_t>* zoneNames)
{
    std::string name = ownSiteName(info, kexts, symbolicator);
    // A site inside a zone reads like VM_KERN_MEMORY_KALLOC[zone name].
    if (zoneNames != nullptr && (info.flags & VM_KERN_SITE_ZONE) && info.zone < zoneNames->size())
        name.append("[").append(nameField((*zoneNames)[info.zone].mzn_name)).append("]");
    return name;
}

void HTKernelProcess::_setNameForRegion(HTMemoryRegion& region, const mach_memory_info_t& info, const KextTags& kexts,
                                        HTKernelSymbolResolver* symbolicator,
                                        const std::vector<mach_zone_name_t>* zoneNames)
{
    region.setName(_nameForWiredInfo(info, kexts, symbolicator, zoneNames));
    if (siteType(info) != VM_KERN_SITE_KERNEL || symbolicator == nullptr) return;
    auto source = symbolicator->sourceInfo(info.site);
    if (source && !source->path.empty())
        region.setDetailedName("(" + source->path + ":" + std::to_string(source->line) + ")");
}
