#include "platform/linux/HTLinuxKernelMemory.h"

#include "platform/linux/HTAllocinfoParser.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTMeminfoParser.h"
#include "platform/linux/HTModulesParser.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcText.h"
#include "platform/linux/HTShmemParsers.h"
#include "platform/linux/HTSlabinfoParser.h"
#include "platform/linux/HTVmallocinfoParser.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <string_view>
#include <unordered_map>

namespace {

// Tags of the kernel's accounting for what meminfo reports.
constexpr uint64_t kTagStack = 8;
constexpr uint64_t kTagCpu = 9;
constexpr uint64_t kTagGuestPageTables = 10;
constexpr uint64_t kTagPageTables = 11;
// A tag beyond the kernel's own, for shared memory whose holders are gone.
constexpr uint64_t kTagOrphanedSegments = 0x1001;
constexpr std::string_view kOrphanedSegmentsName = "System V shared memory of exited processes";

struct TagSite {
    std::string_view field;
    uint64_t tag;
    uint64_t flags;
};
// Processes count their own page tables already, hence hidden. What
// processes locked is theirs too; its tag makes it user wired.
constexpr TagSite kTagSites[] = {
    {"KernelStack", kTagStack, VM_KERN_SITE_WIRED},
    {"Percpu", kTagCpu, VM_KERN_SITE_WIRED},
    {"SecPageTables", kTagGuestPageTables, VM_KERN_SITE_WIRED},
    {"PageTables", kTagPageTables, VM_KERN_SITE_WIRED | VM_KERN_SITE_HIDE},
    {"Mlocked", VM_KERN_MEMORY_MLOCK, VM_KERN_SITE_WIRED},
};

// A function the kernel has only when it allocates its stacks with vmalloc
// (it empties the per-CPU caches of such stacks).
constexpr std::string_view kVmallocStackSymbol = "free_vm_stack_cache";
// The slab cache of stacks smaller than a page.
constexpr std::string_view kStackCache = "thread_stack";

class Resolver : public HTKernelSymbolResolver {
public:
    explicit Resolver(std::shared_ptr<HTLinuxKernelSymbols> symbols) : symbols_(std::move(symbols)) {}

    std::optional<std::string> symbolName(uint64_t address) override
    {
        const HTKernelSymbolTable* table = address == 0 ? nullptr : symbols_->table();
        return table ? table->symbolName(address) : std::nullopt;
    }
    std::optional<HTSourceInfo> sourceInfo(uint64_t address) override { return symbols_->sourceInfo(address); }

private:
    std::shared_ptr<HTLinuxKernelSymbols> symbols_;
};

kern_return_t errnoCode() { return HT_KERN_ERRNO_BASE | errno; }

mach_memory_info_t siteRecord(uint64_t flags, uint64_t site, uint64_t size, std::string_view name)
{
    mach_memory_info_t record{};
    record.flags = flags | VM_KERN_SITE_NAMED;
    record.site = site;
    record.size = size;
    std::memcpy(record.name, name.data(), std::min(name.size(), sizeof(record.name) - 1));
    return record;
}

// The site number of code whose address is not known (hidden, or no symbol
// of that name): one a record, below every kernel address, so that each
// site stays a memory object of its own.
uint64_t standInSite(const std::vector<mach_memory_info_t>& sites) { return sites.size() + 1; }

uint64_t addressOf(const HTSymbolAddresses& addresses, std::string_view function)
{
    auto found = addresses.find(function);
    return found == addresses.end() ? 0 : found->second.value_or(0);
}

std::string allocationFunction(const HTAllocinfoSite& allocation)
{
    std::string function(allocation.function);
    if (!allocation.module.empty()) function.append(" [").append(allocation.module).append("]");
    return function;
}

bool isCollectable(int slabDirectory, std::string_view cache, HTProcBuffer& buffer)
{
    std::string file = std::string(cache) + "/reclaim_account";
    return buffer.readFile(slabDirectory, file.c_str(), HTProcBuffer::End::ShortRead) && buffer.view().starts_with('1');
}

}  // namespace

HTLinuxKernelMemory::HTLinuxKernelMemory(std::string root, uint64_t pageSize)
    : root_(std::move(root)),
      pageSize_(pageSize),
      symbols_(std::make_shared<HTLinuxKernelSymbols>(root_ + "proc/kallsyms"))
{
}

kern_return_t HTLinuxKernelMemory::memoryInfo(std::vector<mach_zone_name_t>& names,
                                              std::vector<mach_zone_info_t>& zones,
                                              std::vector<mach_memory_info_t>& sites)
{
    names.clear();
    zones.clear();
    sites.clear();
    HTProcBuffer slabinfo, vmallocinfo, allocinfo, meminfo, modules;
    if (!slabinfo.readFile(AT_FDCWD, path("proc/slabinfo").c_str()) ||
        !vmallocinfo.readFile(AT_FDCWD, path("proc/vmallocinfo").c_str()))
        return errnoCode();
    // Only kernels built with allocation profiling have allocinfo.
    if (!allocinfo.readFile(AT_FDCWD, path("proc/allocinfo").c_str()) && errno != ENOENT) return errnoCode();
    if (!meminfo.readFile(AT_FDCWD, path("proc/meminfo").c_str())) return errnoCode();
    // A kernel without loadable modules has no modules file.
    modules.readFile(AT_FDCWD, path("proc/modules").c_str());

    std::vector<HTSlabCache> caches;
    if (!htParseSlabinfo(slabinfo.view(), caches)) return HT_KERN_ERRNO_BASE | ENOTSUP;
    const std::vector<HTVmallocCaller> callers = htParseVmallocinfo(vmallocinfo.view());
    const std::vector<HTAllocinfoSite> allocations = htParseAllocinfo(allocinfo.view());
    const std::vector<HTMeminfoField> fields = htParseMeminfo(meminfo.view());

    const HTSymbolAddresses addresses = findAddresses(callers, allocations);
    // The kernel's stacks are slab objects when smaller than a page, vmalloc
    // memory when the kernel has the symbol: the zones or the code sites
    // count them then.
    const bool stacksCountedElsewhere =
        std::any_of(caches.begin(), caches.end(), [](const HTSlabCache& cache) { return cache.name == kStackCache; }) ||
        addresses.find(kVmallocStackSymbol)->second.has_value();
    addZones(caches, names, zones);
    addCodeSites(callers, addresses, sites);
    addAllocationSites(allocations, addresses, sites);
    addModuleSites(htParseModules(modules.view()), sites);
    addTagSites(fields, stacksCountedElsewhere, sites);
    addOrphanedSegments(sites);
    addCounters(fields, sites);
    return KERN_SUCCESS;
}

void HTLinuxKernelMemory::addOrphanedSegments(std::vector<mach_memory_info_t>& sites) const
{
    // A kernel without System V IPC has no such file.
    HTProcBuffer text;
    if (!text.readFile(AT_FDCWD, path("proc/sysvipc/shm").c_str())) return;
    uint64_t resident = 0;
    uint64_t swapped = 0;
    for (const HTSysvSegment& segment : htParseSysvShm(text.view())) {
        // Mapped, the segment is its mappers'; with its creator alive, the
        // creator's own.
        const std::string creator = path("proc/") + std::to_string(segment.cpid);
        if (segment.nattch != 0 || access(creator.c_str(), F_OK) == 0) continue;
        resident += segment.rss;
        swapped += segment.swap;
    }
    if (resident + swapped == 0) return;
    mach_memory_info_t site = siteRecord(VM_KERN_SITE_TAG | VM_KERN_SITE_NAMED | HT_KERN_SITE_SWAPPABLE,
                                         kTagOrphanedSegments, resident + swapped, kOrphanedSegmentsName);
    site.mapped = swapped;
    sites.push_back(site);
}

HTSymbolAddresses HTLinuxKernelMemory::findAddresses(const std::vector<HTVmallocCaller>& callers,
                                                     const std::vector<HTAllocinfoSite>& allocations) const
{
    HTSymbolAddresses wanted{{std::string(kVmallocStackSymbol), std::nullopt}};
    // A caller the kernel printed as a bare address is its own address.
    for (const HTVmallocCaller& caller : callers) {
        std::optional<uint64_t> address;
        if (caller.function.starts_with("0x")) address = htNumber<uint64_t>(caller.function.substr(2), 16);
        wanted.emplace(caller.function, address);
    }
    for (const HTAllocinfoSite& allocation : allocations)
        if (allocation.bytes > 0) wanted.emplace(allocationFunction(allocation), std::nullopt);
    if (const HTKernelSymbolTable* table = symbols_->table()) table->findAddresses(wanted);
    return wanted;
}

void HTLinuxKernelMemory::addZones(const std::vector<HTSlabCache>& caches, std::vector<mach_zone_name_t>& names,
                                   std::vector<mach_zone_info_t>& zones) const
{
    // SLUB's caches, merged ones as links to the cache they share; other
    // allocators have none, and no cache is collectable then.
    HTFileDescriptor slabDirectory(::open(path("sys/kernel/slab").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    HTProcBuffer buffer;
    for (const HTSlabCache& cache : caches) {
        mach_zone_name_t name{};
        std::memcpy(name.mzn_name, cache.name.data(), std::min(cache.name.size(), sizeof(name.mzn_name)));
        names.push_back(name);

        const uint64_t slabBytes = cache.pagesPerSlab * pageSize_;
        mach_zone_info_t zone{};
        zone.mzi_count = cache.activeObjects;
        zone.mzi_cur_size = cache.slabs * slabBytes;
        zone.mzi_elem_size = cache.objectSize;
        // A cache grows by a slab at a time. It has no limit (max size 0),
        // keeps no running total (sum size 0) and never runs out before the
        // machine's memory does (not exhaustible).
        zone.mzi_alloc_size = slabBytes;
        // Objects of a cache with reclaim accounting can be freed when
        // memory is short (dentries, inodes).
        zone.mzi_collectable = isCollectable(slabDirectory.get(), cache.name, buffer);
        zones.push_back(zone);
    }
}

void HTLinuxKernelMemory::addCodeSites(const std::vector<HTVmallocCaller>& callers, const HTSymbolAddresses& addresses,
                                       std::vector<mach_memory_info_t>& sites) const
{
    for (const HTVmallocCaller& caller : callers) {
        uint64_t site = addressOf(addresses, caller.function);
        std::string_view name = caller.function.empty() ? std::string_view("vmalloc") : caller.function;
        sites.push_back(siteRecord(VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED, site != 0 ? site : standInSite(sites),
                                   caller.pages * pageSize_, name));
    }
}

void HTLinuxKernelMemory::addAllocationSites(const std::vector<HTAllocinfoSite>& allocations,
                                             const HTSymbolAddresses& addresses, std::vector<mach_memory_info_t>& sites)
{
    std::unordered_map<uint64_t, HTSourceInfo> sourceInfos;
    // The call sites taken so far in each function. A function's own
    // address is its vmalloc site; its call sites take the addresses after
    // it, inside its code, so that the resolver still names the function.
    std::unordered_map<std::string, uint64_t> taken;
    for (const HTAllocinfoSite& allocation : allocations) {
        if (allocation.bytes <= 0) continue;
        std::string function = allocationFunction(allocation);
        uint64_t address = addressOf(addresses, function);
        uint64_t site = address != 0 ? address + ++taken[function] : standInSite(sites);
        sourceInfos[site] = HTSourceInfo{std::string(allocation.path), allocation.line};
        // The profile counts every allocation: slab objects, vmalloc and
        // plain pages alike, the processes' pages among them. All of it is
        // counted elsewhere, so the sites are hidden, and not wired.
        sites.push_back(siteRecord(VM_KERN_SITE_KERNEL | VM_KERN_SITE_HIDE, site,
                                   static_cast<uint64_t>(allocation.bytes), function));
    }
    symbols_->setSourceInfos(std::move(sourceInfos));
}

void HTLinuxKernelMemory::addModuleSites(const std::vector<HTModuleLine>& modules,
                                         std::vector<mach_memory_info_t>& sites)
{
    // Modules live in vmalloc memory, which the code sites count.
    for (size_t tag = 0; tag < modules.size(); ++tag)
        sites.push_back(siteRecord(VM_KERN_SITE_KMOD | VM_KERN_SITE_WIRED | VM_KERN_SITE_HIDE, tag, modules[tag].size,
                                   modules[tag].name));
}

void HTLinuxKernelMemory::addTagSites(const std::vector<HTMeminfoField>& fields, bool stacksCountedElsewhere,
                                      std::vector<mach_memory_info_t>& sites)
{
    for (const TagSite& tagSite : kTagSites) {
        const HTMeminfoField* field = htFindMeminfoField(fields, tagSite.field);
        if (field == nullptr || field->value == 0) continue;
        uint64_t flags = tagSite.flags;
        if (tagSite.tag == kTagStack && stacksCountedElsewhere) flags |= VM_KERN_SITE_HIDE;
        sites.push_back(siteRecord(flags, tagSite.tag, field->value, field->name));
    }
}

void HTLinuxKernelMemory::addCounters(const std::vector<HTMeminfoField>& fields, std::vector<mach_memory_info_t>& sites)
{
    for (size_t index = 0; index < fields.size(); ++index) {
        mach_memory_info_t counter = siteRecord(VM_KERN_SITE_COUNTER, index, 0, fields[index].name);
        counter.mapped = fields[index].value;
        sites.push_back(counter);
    }
}

std::vector<HTLoadedModule> HTLinuxKernelMemory::loadedModules() const
{
    HTProcBuffer buffer;
    if (!buffer.readFile(AT_FDCWD, path("proc/modules").c_str())) return {};
    std::vector<HTLoadedModule> modules;
    for (const HTModuleLine& line : htParseModules(buffer.view()))
        modules.push_back({std::string(line.name), static_cast<uint64_t>(modules.size())});
    return modules;
}

std::unique_ptr<HTKernelSymbolResolver> HTLinuxKernelMemory::openSymbolResolver()
{
    return std::make_unique<Resolver>(symbols_);
}
