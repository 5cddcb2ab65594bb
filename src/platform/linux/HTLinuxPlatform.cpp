#include "platform/linux/HTLinuxPlatform.h"

#include "platform/HTMachErrorText.h"
#include "platform/linux/HTLinuxProgramRunner.h"
#include "platform/linux/HTLinuxUnheldTmpfs.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <unistd.h>

int HTLinuxPlatform::proc_listallpids(int32_t* buffer, int bufferSize)
{
    return processes_.listAllPids(buffer, bufferSize);
}

int HTLinuxPlatform::proc_pidinfo(int32_t pid, int flavor, uint64_t, void* buffer, int bufferSize)
{
    size_t needed = flavor == PROC_PIDTBSDINFO ? sizeof(proc_bsdinfo)
        : flavor == PROC_PIDT_SHORTBSDINFO     ? sizeof(proc_bsdshortinfo)
                                               : 0;
    if (needed == 0) {
        errno = EINVAL;
        return 0;
    }
    if (buffer == nullptr || bufferSize < static_cast<int>(needed)) {
        errno = ENOMEM;
        return 0;
    }
    proc_bsdinfo info;
    if (!processes_.readBsdInfo(pid, info)) return 0;
    if (flavor == PROC_PIDTBSDINFO) {
        std::memcpy(buffer, &info, sizeof(info));
        return sizeof(info);
    }
    proc_bsdshortinfo shortInfo{};
    shortInfo.pbsi_pid = info.pbi_pid;
    shortInfo.pbsi_ppid = info.pbi_ppid;
    shortInfo.pbsi_pgid = info.pbi_pgid;
    shortInfo.pbsi_status = info.pbi_status;
    std::memcpy(shortInfo.pbsi_comm, info.pbi_comm, sizeof(shortInfo.pbsi_comm));
    shortInfo.pbsi_flags = info.pbi_flags;
    shortInfo.pbsi_uid = info.pbi_uid;
    shortInfo.pbsi_gid = info.pbi_gid;
    shortInfo.pbsi_ruid = info.pbi_ruid;
    shortInfo.pbsi_rgid = info.pbi_rgid;
    shortInfo.pbsi_svuid = info.pbi_svuid;
    shortInfo.pbsi_svgid = info.pbi_svgid;
    std::memcpy(buffer, &shortInfo, sizeof(shortInfo));
    return sizeof(shortInfo);
}

int HTLinuxPlatform::proc_get_dirty(int32_t, uint32_t*) { return ENOTSUP; }

int HTLinuxPlatform::sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp, size_t)
{
    if (name == nullptr || nameLength < 2 || name[0] != CTL_KERN) {
        errno = ENOENT;
        return -1;
    }
    bool known = (nameLength == 2 && name[1] == KERN_ARGMAX) || (nameLength == 3 && name[1] == KERN_PROCARGS2);
    if (!known) {
        errno = ENOENT;
        return -1;
    }
    if (newp != nullptr) {
        errno = EPERM;
        return -1;
    }
    if (name[1] == KERN_PROCARGS2) return processes_.readProcArgs(name[2], oldp, oldlenp);
    return HTLinuxProcessTable::readArgMax(oldp, oldlenp);
}

int HTLinuxPlatform::sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen)
{
    int32_t pid = 0;
    if (std::strcmp(name, "vm.get_owned_vmobjects") != 0 || newp == nullptr || newlen != sizeof(pid)) {
        errno = ENOENT;
        return -1;
    }
    std::memcpy(&pid, newp, sizeof(pid));
    return owned_.ownedObjects(pid, oldp, oldlenp);
}

uint64_t HTLinuxPlatform::vm_kernel_page_size() { return htKernelPageSize(); }

kern_return_t HTLinuxPlatform::task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task)
{
    return mappings_.openTask(pid, task);
}

std::string HTLinuxPlatform::mach_error_string(kern_return_t code) { return htMachErrorString(code); }

void HTLinuxPlatform::mach_error(const char* label, kern_return_t code)
{
    std::fprintf(stderr, "%s: %s (0x%x)\n", label, htMachErrorString(code).c_str(), static_cast<unsigned>(code));
}

kern_return_t HTLinuxPlatform::mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                                      uint32_t* depth, vm_region_submap_info_64* info, uint32_t* count)
{
    return mappings_.regionRecurse(task, address, size, info, count);
}

kern_return_t HTLinuxPlatform::mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                              vm_region_basic_info_64* info, uint32_t* count)
{
    return mappings_.region(task, address, size, info, count);
}

kern_return_t HTLinuxPlatform::mach_vm_purgable_control(HTTaskPort&, uint64_t, int, int32_t*)
{
    return KERN_INVALID_ARGUMENT;
}

kern_return_t HTLinuxPlatform::mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size,
                                                        int32_t* dispositions, uint64_t* count)
{
    return pages_.pageRangeQuery(task, address, size, dispositions, count);
}

bool HTLinuxPlatform::canIdentifySharedPages() { return pages_.canIdentifySharedPages(); }

std::string HTLinuxPlatform::systemDescription()
{
    struct utsname names {};
    if (::uname(&names) != 0) return "Linux";
    return std::string(names.sysname) + " " + names.release + " " + names.machine;
}

kern_return_t HTLinuxPlatform::sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                                    uint64_t* identities)
{
    return pages_.sharedPageIdentities(task, address, pages, identities);
}

int HTLinuxPlatform::proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize)
{
    return mappings_.regionFileName(task, address, buffer, bufferSize);
}

int HTLinuxPlatform::proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info)
{
    return status_.rusage(pid, flavor, info);
}

int HTLinuxPlatform::ledger_template(ledger_template_info* entries, int* count)
{
    return HTLinuxStatusReader::ledgerTemplate(entries, count);
}

int HTLinuxPlatform::ledger_entries(int32_t pid, ledger_entry_info* entries, int* count)
{
    return status_.ledgerEntries(pid, entries, count);
}

HTProgramEnd HTLinuxPlatform::runProgram(const std::vector<std::string>& arguments, bool followChildren,
                                         const std::function<void(const HTHeldExit&)>& atExit)
{
    HTLinuxProgramRunner runner;
    return runner.run(arguments, followChildren, [&](pid_t pid, bool didExec) { atExit(heldExit(pid, didExec)); });
}

HTHeldExit HTLinuxPlatform::heldExit(int32_t pid, bool didExec)
{
    HTHeldExit held;
    held.pid = pid;
    if (task_for_pid(pid, &held.corpse) != KERN_SUCCESS) held.corpse.reset();
    // The flags Linux can tell: whether it is 64-bit, has a terminal and
    // ran a program. It keeps no record of changed ids or of threads'
    // own working directories.
    proc_bsdinfo info{};
    if (processes_.readBsdInfo(pid, info) && (info.pbi_flags & PROC_FLAG_LP64)) held.procFlags |= P_LP64;
    thread_local HTProcBuffer buffer;
    if (processes_.readProcessFile(pid, "/stat", buffer)) {
        std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
        if (stat && stat->tty_nr != 0) held.procFlags |= P_CONTROLT;
    }
    if (didExec) held.procFlags |= P_EXEC;
    ledger_entry_info pageTable{};
    int count = 1;
    if (status_.ledgerEntries(pid, &pageTable, &count) == 0 && count == 1)
        held.pageTableBytes = static_cast<uint64_t>(pageTable.lei_balance);
    return held;
}

std::optional<std::string> HTLinuxPlatform::realpath(const std::string& path) { return paths_.realpath(path); }

kern_return_t HTLinuxPlatform::mach_memory_info(std::vector<mach_zone_name_t>& names,
                                                std::vector<mach_zone_info_t>& zones,
                                                std::vector<mach_memory_info_t>& sites)
{
    kern_return_t result = kernel_.memoryInfo(names, zones, sites);
    if (result == KERN_SUCCESS) HTLinuxUnheldTmpfs::addSites(owned_, sites);
    return result;
}

std::vector<HTLoadedModule> HTLinuxPlatform::OSKextCopyLoadedKextInfo() { return kernel_.loadedModules(); }

std::unique_ptr<HTKernelSymbolResolver> HTLinuxPlatform::openKernelImageList() { return kernel_.openSymbolResolver(); }

void HTLinuxPlatform::populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs)
{
    pages_.populatedRuns(task, start, end, runs);
}

bool HTLinuxPlatform::forEachTaskImage(HTTaskPort& task, uint32_t,
                                       const std::function<void(const HTPlatformImage&)>& callback)
{
    return mappings_.forEachImage(task, callback);
}

int32_t HTLinuxPlatform::getpid() { return ::getpid(); }

uint32_t HTLinuxPlatform::geteuid() { return ::geteuid(); }

bool HTLinuxPlatform::isatty(int fd) { return ::isatty(fd) != 0; }

bool HTLinuxPlatform::stat(const char* path)
{
    struct stat status {};
    return ::stat(path, &status) == 0;
}
