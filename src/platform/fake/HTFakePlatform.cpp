#include "platform/fake/HTFakePlatform.h"

#include "platform/HTMachErrorText.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <new>

namespace {

class HTFakeTaskPort : public HTTaskPort {
public:
    explicit HTFakeTaskPort(int32_t pid) : pid_(pid) {}
    int32_t pid() const override { return pid_; }

private:
    int32_t pid_;
};

class HTFakeSymbolResolver : public HTKernelSymbolResolver {
public:
    HTFakeSymbolResolver(std::map<uint64_t, std::string> symbols, std::map<uint64_t, HTSourceInfo> sources)
        : symbols_(std::move(symbols)), sources_(std::move(sources))
    {
    }
    std::optional<std::string> symbolName(uint64_t address) override { return find(symbols_, address); }
    std::optional<HTSourceInfo> sourceInfo(uint64_t address) override { return find(sources_, address); }

private:
    template<typename Value>
    static std::optional<Value> find(const std::map<uint64_t, Value>& map, uint64_t address)
    {
        auto found = map.find(address);
        return found == map.end() ? std::nullopt : std::optional<Value>(found->second);
    }

    std::map<uint64_t, std::string> symbols_;
    std::map<uint64_t, HTSourceInfo> sources_;
};

// Copies `text` into a fixed name field, NUL-padded, unterminated when it
// fills the field.
void copyName(char* field, const std::string& text)
{
    std::memset(field, 0, MACH_ZONE_NAME_MAX_LEN);
    std::memcpy(field, text.data(), std::min(text.size(), MACH_ZONE_NAME_MAX_LEN));
}

// The argument area: a 32-bit argument count, the executable path, NUL
// padding, then the arguments, each NUL-terminated.
std::string buildProcargs(const std::string& path, const std::vector<std::string>& arguments)
{
    int32_t argc = static_cast<int32_t>(arguments.size());
    std::string area(reinterpret_cast<const char*>(&argc), sizeof(argc));
    area += path;
    area.append(4, '\0');
    for (const auto& argument : arguments) {
        area += argument;
        area.push_back('\0');
    }
    return area;
}

}  // namespace

HTFakePlatform::Process& HTFakePlatform::addProcess(int32_t pid, int32_t ppid, const std::string& comm,
                                                    std::optional<std::string> executablePath, uint32_t flags)
{
    if (processes_.count(pid) == 0) order_.push_back(pid);
    Process& process = processes_[pid];
    process = Process{};
    process.info.pbi_pid = static_cast<uint32_t>(pid);
    process.info.pbi_ppid = static_cast<uint32_t>(ppid);
    process.info.pbi_flags = flags;
    process.info.pbi_status = SRUN;
    std::memcpy(process.info.pbi_comm, comm.data(), std::min(comm.size(), sizeof(process.info.pbi_comm)));
    std::memcpy(process.info.pbi_name, comm.data(), std::min(comm.size(), sizeof(process.info.pbi_name)));
    process.executablePath = std::move(executablePath);
    return process;
}

void HTFakePlatform::removeProcess(int32_t pid)
{
    processes_.erase(pid);
    order_.erase(std::remove(order_.begin(), order_.end(), pid), order_.end());
}

HTFakePlatform::Process* HTFakePlatform::process(int32_t pid)
{
    auto found = processes_.find(pid);
    return found == processes_.end() ? nullptr : &found->second;
}

int HTFakePlatform::proc_listallpids(int32_t* buffer, int bufferSize)
{
    if (listErrno != 0) {
        errno = listErrno;
        return -1;
    }
    if (buffer == nullptr) return static_cast<int>(order_.size());
    size_t capacity = static_cast<size_t>(bufferSize) / sizeof(int32_t);
    size_t count = std::min(capacity, order_.size());
    std::copy_n(order_.begin(), count, buffer);
    return static_cast<int>(count);
}

int HTFakePlatform::proc_pidinfo(int32_t pid, int flavor, uint64_t, void* buffer, int bufferSize)
{
    Process* found = process(pid);
    if (found == nullptr || found->exited) {
        errno = ESRCH;
        return 0;
    }
    if (flavor == PROC_PIDTBSDINFO && bufferSize >= static_cast<int>(sizeof(proc_bsdinfo))) {
        std::memcpy(buffer, &found->info, sizeof(proc_bsdinfo));
        return sizeof(proc_bsdinfo);
    }
    if (flavor == PROC_PIDT_SHORTBSDINFO && bufferSize >= static_cast<int>(sizeof(proc_bsdshortinfo))) {
        proc_bsdshortinfo shortInfo{};
        shortInfo.pbsi_pid = found->info.pbi_pid;
        shortInfo.pbsi_ppid = found->info.pbi_ppid;
        shortInfo.pbsi_status = found->info.pbi_status;
        std::memcpy(shortInfo.pbsi_comm, found->info.pbi_comm, sizeof(shortInfo.pbsi_comm));
        shortInfo.pbsi_flags = found->info.pbi_flags;
        std::memcpy(buffer, &shortInfo, sizeof(shortInfo));
        return sizeof(proc_bsdshortinfo);
    }
    errno = EINVAL;
    return 0;
}

int HTFakePlatform::proc_get_dirty(int32_t pid, uint32_t* flags)
{
    Process* found = process(pid);
    if (found == nullptr) return ESRCH;
    if (found->dirtyErrno != 0) return found->dirtyErrno;
    *flags = found->dirtyFlags;
    return 0;
}

int HTFakePlatform::sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void*, size_t)
{
    if (nameLength == 2 && name[0] == CTL_KERN && name[1] == KERN_ARGMAX) {
        if (oldp == nullptr || oldlenp == nullptr || *oldlenp < sizeof(int32_t)) {
            errno = EINVAL;
            return -1;
        }
        std::memcpy(oldp, &argmax, sizeof(int32_t));
        *oldlenp = sizeof(int32_t);
        return 0;
    }
    if (nameLength == 3 && name[0] == CTL_KERN && name[1] == KERN_PROCARGS2) {
        Process* found = process(name[2]);
        if (found == nullptr || !found->executablePath) {
            errno = found == nullptr ? ESRCH : EPERM;
            return -1;
        }
        std::string area = buildProcargs(*found->executablePath, found->arguments);
        if (oldp == nullptr || oldlenp == nullptr || *oldlenp < area.size()) {
            errno = ENOMEM;
            return -1;
        }
        std::memcpy(oldp, area.data(), area.size());
        *oldlenp = area.size();
        return 0;
    }
    errno = ENOENT;
    return -1;
}

int HTFakePlatform::sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen)
{
    // The owned-object query is the only setting heft asks for by name.
    if (std::strcmp(name, "vm.get_owned_vmobjects") == 0) return ownedVmObjects(oldp, oldlenp, newp, newlen);
    errno = ENOENT;
    return -1;
}

kern_return_t HTFakePlatform::task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task)
{
    Process* found = process(pid);
    if (found == nullptr) return HT_KERN_ERRNO_BASE | ESRCH;
    if (found->taskResult != KERN_SUCCESS) return found->taskResult;
    *task = std::make_shared<HTFakeTaskPort>(pid);
    return KERN_SUCCESS;
}

std::shared_ptr<HTTaskPort> HTFakePlatform::corpsePort(int32_t pid)
{
    if (process(pid) == nullptr) return nullptr;
    return std::make_shared<HTFakeTaskPort>(pid);
}

HTProgramEnd HTFakePlatform::runProgram(const std::vector<std::string>& arguments, bool followChildren,
                                        const std::function<void(const HTHeldExit&)>& atExit)
{
    programArguments = arguments;
    programFollowedChildren = followChildren;
    if (programEnd.startError != 0 || programEnd.traceError != 0) return programEnd;
    for (size_t i = 0; i < programExits.size() && (i == 0 || followChildren); ++i) {
        HTHeldExit held = programExits[i];
        if (!held.corpse) held.corpse = corpsePort(held.pid);
        atExit(held);
    }
    return programEnd;
}

std::string HTFakePlatform::mach_error_string(kern_return_t code) { return htMachErrorString(code); }

void HTFakePlatform::mach_error(const char* label, kern_return_t code)
{
    std::lock_guard<std::mutex> guard(recordLock);
    machErrors.push_back(std::string(label) + ": " + mach_error_string(code));
}

// --- address spaces ----------------------------------------------------------

size_t HTFakePlatform::regionIndexAtOrAfter(const Process& process, uint64_t address)
{
    size_t index = 0;
    while (index < process.regions.size() && process.regions[index].start + process.regions[index].size <= address)
        ++index;
    return index;
}

kern_return_t HTFakePlatform::regionFailure(const Process& process, size_t index)
{
    if (process.regionFailureIndex && index >= *process.regionFailureIndex) return process.regionFailureCode;
    return KERN_SUCCESS;
}

kern_return_t HTFakePlatform::mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                                     uint32_t* depth, vm_region_submap_info_64* info, uint32_t* count)
{
    if (outOfMemoryInWalk) throw std::bad_alloc();
    {
        std::lock_guard<std::mutex> guard(recordLock);
        ++regionLookups;
    }
    Process* found = process(task.pid());
    if (found == nullptr) return MACH_SEND_INVALID_DEST;
    size_t index = regionIndexAtOrAfter(*found, *address);
    if (kern_return_t failure = regionFailure(*found, index); failure != KERN_SUCCESS) return failure;
    if (index == found->regions.size()) return KERN_INVALID_ADDRESS;

    const Region& region = found->regions[index];
    *address = region.start;
    *size = region.size;
    *depth = 0;
    *info = region.info;
    *count = std::min(*count, region.infoCount);
    if (*count < VM_REGION_SUBMAP_INFO_COUNT_64) info->object_id_full = 0;
    return KERN_SUCCESS;
}

kern_return_t HTFakePlatform::mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                             vm_region_basic_info_64* info, uint32_t* count)
{
    {
        std::lock_guard<std::mutex> guard(recordLock);
        ++basicRegionLookups;
    }
    Process* found = process(task.pid());
    if (found == nullptr) return MACH_SEND_INVALID_DEST;
    size_t index = regionIndexAtOrAfter(*found, *address);
    if (kern_return_t failure = regionFailure(*found, index); failure != KERN_SUCCESS) return failure;
    if (index == found->regions.size()) return KERN_INVALID_ADDRESS;

    const Region& region = found->regions[index];
    *address = region.start;
    *size = region.size;
    *info = vm_region_basic_info_64{};
    info->protection = region.info.protection;
    info->max_protection = region.info.max_protection;
    info->inheritance = region.info.inheritance;
    info->shared = region.info.share_mode == SM_SHARED || region.info.share_mode == SM_TRUESHARED;
    info->offset = region.info.offset;
    info->behavior = region.info.behavior;
    info->user_wired_count = region.info.user_wired_count;
    *count = VM_REGION_BASIC_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t HTFakePlatform::mach_vm_purgable_control(HTTaskPort& task, uint64_t address, int control, int32_t* state)
{
    Process* found = process(task.pid());
    if (found == nullptr) return MACH_SEND_INVALID_DEST;
    if (control != VM_PURGABLE_GET_STATE) return KERN_INVALID_ARGUMENT;
    size_t index = regionIndexAtOrAfter(*found, address);
    if (index == found->regions.size() || found->regions[index].start > address) return KERN_INVALID_ADDRESS;
    const Region& region = found->regions[index];
    if (!region.purgeState) return KERN_INVALID_ARGUMENT;
    *state = *region.purgeState;
    return KERN_SUCCESS;
}

kern_return_t HTFakePlatform::mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size,
                                                       int32_t* dispositions, uint64_t* count)
{
    {
        std::lock_guard<std::mutex> guard(recordLock);
        pageQueries.emplace_back(address, size);
    }
    Process* found = process(task.pid());
    // The answer of a process that is gone, as on Linux.
    if (found == nullptr || found->exited) return KERN_INVALID_ARGUMENT;
    if (found->pageQueryFailureAddress && *found->pageQueryFailureAddress >= address &&
        *found->pageQueryFailureAddress - address < size)
        return found->pageQueryFailureCode;

    uint64_t pages = std::min(*count, (size + pageSize - 1) / pageSize);
    for (uint64_t i = 0; i < pages; ++i) {
        auto disposition = found->dispositions.find(address + i * pageSize);
        dispositions[i] = disposition == found->dispositions.end() ? 0 : disposition->second;
    }
    *count = pages;
    return KERN_SUCCESS;
}

kern_return_t HTFakePlatform::sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                                   uint64_t* identities)
{
    Process* found = process(task.pid());
    if (found == nullptr) return KERN_INVALID_ARGUMENT;
    for (uint64_t i = 0; i < pages; ++i) {
        auto identity = found->pageIdentities.find(address + i * pageSize);
        bool known = sharedPagesIdentifiable && identity != found->pageIdentities.end();
        identities[i] = known ? identity->second : 0;
    }
    return KERN_SUCCESS;
}

void HTFakePlatform::populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs)
{
    Process* found = process(task.pid());
    // A process that is gone, or whose page queries are to fail, cannot be
    // scanned either: nothing is skipped and the query meets the failure.
    if (found == nullptr || found->exited || found->pageQueryFailureAddress) {
        runs.assign(1, HTPageRun{start, end, 0});
        return;
    }
    runs.clear();
    for (auto page = found->dispositions.lower_bound(start); page != found->dispositions.end() && page->first < end;
         ++page) {
        if (page->second == 0) continue;
        const int32_t disposition = uniformRuns ? page->second : 0;
        if (!runs.empty() && runs.back().end == page->first && runs.back().disposition == disposition)
            runs.back().end += pageSize;
        else
            runs.push_back(HTPageRun{page->first, page->first + pageSize, disposition});
    }
}

int HTFakePlatform::proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize)
{
    Process* found = process(task.pid());
    if (found == nullptr) return 0;
    size_t index = regionIndexAtOrAfter(*found, address);
    if (index == found->regions.size() || found->regions[index].start > address) return 0;
    const std::optional<std::string>& path = found->regions[index].path;
    if (!path) return 0;
    size_t length = std::min<size_t>(path->size(), bufferSize);
    std::memcpy(buffer, path->data(), length);
    return static_cast<int>(length);
}

// --- per-process figures -----------------------------------------------------

int HTFakePlatform::proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info)
{
    Process* found = process(pid);
    if (found == nullptr || found->exited) {
        errno = ESRCH;
        return -1;
    }
    if (!found->rusage || flavor != RUSAGE_INFO_V4) {
        errno = ENOTSUP;
        return -1;
    }
    *info = *found->rusage;
    return 0;
}

int HTFakePlatform::ledger_template(ledger_template_info* entries, int* count)
{
    {
        std::lock_guard<std::mutex> guard(recordLock);
        ++ledgerTemplateReads;
    }
    if (!ledgerTemplate) {
        errno = ledgerTemplateErrno;
        return -1;
    }
    int filled = std::min(*count, static_cast<int>(ledgerTemplate->size()));
    for (int i = 0; i < filled; ++i) {
        entries[i] = ledger_template_info{};
        const std::string& name = (*ledgerTemplate)[static_cast<size_t>(i)];
        std::memcpy(entries[i].lti_name, name.data(), std::min(name.size(), sizeof(entries[i].lti_name)));
    }
    *count = filled;
    return 0;
}

int HTFakePlatform::ledger_entries(int32_t pid, ledger_entry_info* entries, int* count)
{
    Process* found = process(pid);
    if (found == nullptr || found->exited) {
        errno = ESRCH;
        return -1;
    }
    if (!found->ledgerBalances) {
        errno = found->ledgerErrno;
        return -1;
    }
    int filled = std::min(*count, static_cast<int>(found->ledgerBalances->size()));
    for (int i = 0; i < filled; ++i) {
        entries[i] = ledger_entry_info{};
        entries[i].lei_balance = (*found->ledgerBalances)[static_cast<size_t>(i)];
    }
    *count = filled;
    return 0;
}

// The kernel answers an unsigned 64-bit count, then that many records of
// seven unsigned 64-bit words. A buffer too small for all of them is filled
// with as many whole records as fit and reported full, so that the caller
// asks again with more room.
int HTFakePlatform::ownedVmObjects(void* oldp, size_t* oldlenp, const void* newp, size_t newlen)
{
    ++ownedVmObjectQueries;
    if (newp == nullptr || newlen != sizeof(int32_t) || oldlenp == nullptr) {
        errno = EINVAL;
        return -1;
    }
    int32_t pid = 0;
    std::memcpy(&pid, newp, sizeof(pid));
    Process* found = process(pid);
    if (found == nullptr) {
        errno = ESRCH;
        return -1;
    }
    if (found->ownedVmObjectsErrno != 0) {
        errno = found->ownedVmObjectsErrno;
        return -1;
    }
    if (!found->ownedVmObjects) {
        errno = ENOENT;
        return -1;
    }

    const std::vector<OwnedVmObject>& objects = *found->ownedVmObjects;
    const size_t needed = sizeof(uint64_t) + objects.size() * sizeof(OwnedVmObject);
    if (oldp == nullptr) {
        *oldlenp = found->ownedVmObjectsLengthHint.value_or(needed);
        return 0;
    }
    if (*oldlenp < sizeof(uint64_t)) {
        errno = ENOMEM;
        return -1;
    }
    size_t fitting = std::min(objects.size(), (*oldlenp - sizeof(uint64_t)) / sizeof(OwnedVmObject));
    uint64_t count = fitting;
    auto* bytes = static_cast<unsigned char*>(oldp);
    std::memcpy(bytes, &count, sizeof(count));
    if (fitting != 0) std::memcpy(bytes + sizeof(count), objects.data(), fitting * sizeof(OwnedVmObject));
    if (fitting == objects.size()) *oldlenp = needed;
    return 0;
}

// --- images ------------------------------------------------------------------

bool HTFakePlatform::forEachTaskImage(HTTaskPort& task, uint32_t,
                                      const std::function<void(const HTPlatformImage&)>& callback)
{
    Process* found = process(task.pid());
    if (found == nullptr || found->imageListFails) return false;
    for (const auto& image : found->images) callback(image);
    return true;
}

std::optional<std::string> HTFakePlatform::realpath(const std::string& path)
{
    auto found = realpaths.find(path);
    return found == realpaths.end() ? path : found->second;
}

// --- the kernel's memory -----------------------------------------------------

void HTFakePlatform::addZone(const std::string& name, const mach_zone_info_t& info)
{
    copyName(zoneNames.emplace_back().mzn_name, name);
    zoneInfos.push_back(info);
}

mach_memory_info_t& HTFakePlatform::addMemoryInfo(uint64_t flags, uint64_t site, uint64_t size, const std::string& name)
{
    mach_memory_info_t& record = memoryInfos.emplace_back();
    record.flags = flags;
    record.site = site;
    record.size = size;
    copyName(record.name, name);
    return record;
}

kern_return_t HTFakePlatform::mach_memory_info(std::vector<mach_zone_name_t>& names,
                                               std::vector<mach_zone_info_t>& zones,
                                               std::vector<mach_memory_info_t>& sites)
{
    if (memoryInfoResult != KERN_SUCCESS) return memoryInfoResult;
    names = zoneNames;
    zones = zoneInfos;
    sites = memoryInfos;
    return KERN_SUCCESS;
}

std::vector<HTLoadedModule> HTFakePlatform::OSKextCopyLoadedKextInfo()
{
    ++loadedModuleReads;
    return loadedModules;
}

std::unique_ptr<HTKernelSymbolResolver> HTFakePlatform::openKernelImageList()
{
    ++kernelImageListOpens;
    if (!hasKernelSymbols) return nullptr;
    return std::make_unique<HTFakeSymbolResolver>(kernelSymbols, kernelSourceInfos);
}
