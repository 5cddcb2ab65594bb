#pragma once

// A platform whose every answer a test scripts: processes with their
// records, paths and flags, their address spaces (regions, page
// dispositions, injected failures), their per-process figures, sysctl
// values, files that exist, and who the caller is. Calls that were not
// scripted fail the way the real kernel fails for something that is not
// there.

#include "platform/HTPlatform.h"

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

class HTFakePlatform : public HTPlatform {
public:
    // One region of a scripted address space. Regions are listed in
    // ascending address order and do not overlap.
    struct Region {
        uint64_t start = 0;
        uint64_t size = 0;
        vm_region_submap_info_64 info{};
        // proc_regionfilename's answer; none answers 0 bytes.
        std::optional<std::string> path;
        // mach_vm_purgable_control's answer; none makes the call fail.
        std::optional<int32_t> purgeState;
        // The words mach_vm_region_recurse reports filled; fewer than the
        // full count leaves object_id_full out.
        uint32_t infoCount = VM_REGION_SUBMAP_INFO_COUNT_64;
    };

    // One owned VM object as "vm.get_owned_vmobjects" reports it.
    using OwnedVmObject = vm_owned_object;

    struct Process {
        proc_bsdinfo info{};
        // The executable path of the process's argument area; nullopt makes
        // the argument-area read fail.
        std::optional<std::string> executablePath;
        std::vector<std::string> arguments;
        // proc_get_dirty: the flags, or the errno it fails with.
        uint32_t dirtyFlags = 0;
        int dirtyErrno = ENOTSUP;
        // task_for_pid's answer.
        kern_return_t taskResult = KERN_SUCCESS;
        // Once set, every proc_pidinfo flavor answers ESRCH: the process
        // has exited, though its task port is still held.
        bool exited = false;

        // --- address space --------------------------------------------
        std::vector<Region> regions;
        // Page dispositions by page address; pages not listed answer 0.
        std::map<uint64_t, int32_t> dispositions;
        // Identities of pages shared with other processes, by page address;
        // pages not listed answer 0.
        std::map<uint64_t, uint64_t> pageIdentities;
        // Region look-ups (recursive and basic) whose answer would be the
        // region at this index or a later one, or no region at all, fail
        // with regionFailureCode instead.
        std::optional<size_t> regionFailureIndex;
        kern_return_t regionFailureCode = MACH_SEND_INVALID_DEST;
        // A page query whose range holds this address fails with
        // pageQueryFailureCode.
        std::optional<uint64_t> pageQueryFailureAddress;
        kern_return_t pageQueryFailureCode = KERN_INVALID_ARGUMENT;

        // --- per-process figures ----------------------------------------
        // proc_pid_rusage's answer; none fails with ENOTSUP.
        std::optional<rusage_info_v4> rusage;
        // The balances of the ledger entries, in template order; none
        // fails with ledgerErrno.
        std::optional<std::vector<int64_t>> ledgerBalances;
        int ledgerErrno = ENOTSUP;
        // "vm.get_owned_vmobjects"; none fails with ENOENT, as on a kernel
        // without the facility. A non-zero errno fails every ask with it.
        std::optional<std::vector<OwnedVmObject>> ownedVmObjects;
        int ownedVmObjectsErrno = 0;
        // The length the first ask (without a buffer) answers, when it is
        // to differ from the true one (objects appearing in between).
        std::optional<size_t> ownedVmObjectsLengthHint;
        std::vector<HTPlatformImage> images;
        bool imageListFails = false;
    };

    // Adds a process with the given identity; returns it for further
    // scripting. `comm` fills both pbi_comm and pbi_name (truncated to fit).
    Process& addProcess(int32_t pid, int32_t ppid, const std::string& comm,
                        std::optional<std::string> executablePath = std::nullopt, uint32_t flags = PROC_FLAG_LP64);
    void removeProcess(int32_t pid);
    Process* process(int32_t pid);

    // A task port on the scripted process as a corpse: given whatever
    // task_for_pid would answer; null for a pid not scripted.
    std::shared_ptr<HTTaskPort> corpsePort(int32_t pid);

    // --- a program run to its exit ------------------------------------------
    // The exits runProgram reports, in order, each with the corpse port of
    // its pid unless one is scripted: the program's, then those of the
    // processes it started, which only a run that follows children sees.
    // Then it ends as programEnd says.
    std::vector<HTHeldExit> programExits;
    HTProgramEnd programEnd;
    // What the last runProgram was asked to run.
    std::vector<std::string> programArguments;
    bool programFollowedChildren = false;

    // Scripted state, public for tests to set.
    int listErrno = 0;            // non-zero: proc_listallpids fails with it
    int32_t argmax = 256 * 1024;  // KERN_ARGMAX
    uint64_t pageSize = 4096;
    int32_t ownPid = 99999;
    // Whether shared pages can be told apart (page frames are visible).
    bool sharedPagesIdentifiable = true;
    // Whether populatedRuns answers the disposition of runs of pages of one
    // disposition itself, as a backend that knows them without page queries.
    bool uniformRuns = false;
    // Whether walking an address space runs out of memory.
    bool outOfMemoryInWalk = false;
    uint32_t euid = 0;
    std::set<int> terminals;  // descriptors that are terminals
    std::set<std::string> existingFiles;
    std::vector<std::string> machErrors;  // what mach_error wrote
    // The ledger template's entry names; none fails with ledgerTemplateErrno.
    // Unscripted, the template has no entries, so no ledger is read.
    std::optional<std::vector<std::string>> ledgerTemplate = std::vector<std::string>{};
    int ledgerTemplateErrno = ENOTSUP;
    int ledgerTemplateReads = 0;
    // How often the owned-object query was made, from any thread.
    std::atomic<int> ownedVmObjectQueries{0};
    // realpath: the mapped paths; any other path resolves to itself.
    std::map<std::string, std::string> realpaths;

    // --- the kernel's memory ---------------------------------------------
    // What mach_memory_info answers, or the code it fails with.
    std::vector<mach_zone_name_t> zoneNames;
    std::vector<mach_zone_info_t> zoneInfos;
    std::vector<mach_memory_info_t> memoryInfos;
    kern_return_t memoryInfoResult = KERN_SUCCESS;
    std::vector<HTLoadedModule> loadedModules;
    // The kernel's symbols and source locations by exact address; without
    // symbols openKernelImageList answers null.
    bool hasKernelSymbols = true;
    std::map<uint64_t, std::string> kernelSymbols;
    std::map<uint64_t, HTSourceInfo> kernelSourceInfos;
    // How often the modules were listed and a symbol resolver opened.
    int loadedModuleReads = 0;
    int kernelImageListOpens = 0;
    // Adds a zone, its name cut to 80 bytes (unterminated when it fills them).
    void addZone(const std::string& name, const mach_zone_info_t& info);
    // Adds a memory-info record; `name` is cut to 80 bytes as above.
    mach_memory_info_t& addMemoryInfo(uint64_t flags, uint64_t site, uint64_t size, const std::string& name = "");

    // Every page query made, as (address, bytes), in call order. The
    // records below are written from the gathering threads, under
    // recordLock.
    std::vector<std::pair<uint64_t, uint64_t>> pageQueries;
    int regionLookups = 0;       // mach_vm_region_recurse calls
    int basicRegionLookups = 0;  // mach_vm_region calls
    std::mutex recordLock;

    int proc_listallpids(int32_t* buffer, int bufferSize) override;
    int proc_pidinfo(int32_t pid, int flavor, uint64_t arg, void* buffer, int bufferSize) override;
    int proc_get_dirty(int32_t pid, uint32_t* flags) override;
    int sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
               size_t newlen) override;
    int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) override;
    uint64_t vm_kernel_page_size() override { return pageSize; }
    kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) override;
    std::string mach_error_string(kern_return_t code) override;
    void mach_error(const char* label, kern_return_t code) override;
    kern_return_t mach_vm_region_recurse(HTTaskPort& task, uint64_t* address, uint64_t* size, uint32_t* depth,
                                         vm_region_submap_info_64* info, uint32_t* count) override;
    kern_return_t mach_vm_region(HTTaskPort& task, uint64_t* address, uint64_t* size, vm_region_basic_info_64* info,
                                 uint32_t* count) override;
    kern_return_t mach_vm_purgable_control(HTTaskPort& task, uint64_t address, int control, int32_t* state) override;
    void populatedRuns(HTTaskPort& task, uint64_t start, uint64_t end, std::vector<HTPageRun>& runs) override;
    kern_return_t mach_vm_page_range_query(HTTaskPort& task, uint64_t address, uint64_t size, int32_t* dispositions,
                                           uint64_t* count) override;
    bool canIdentifySharedPages() override { return sharedPagesIdentifiable; }
    kern_return_t sharedPageIdentities(HTTaskPort& task, uint64_t address, uint64_t pages,
                                       uint64_t* identities) override;
    int proc_regionfilename(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize) override;
    int proc_pid_rusage(int32_t pid, int flavor, rusage_info_v4* info) override;
    int ledger_template(ledger_template_info* entries, int* count) override;
    int ledger_entries(int32_t pid, ledger_entry_info* entries, int* count) override;
    bool forEachTaskImage(HTTaskPort& task, uint32_t flags,
                          const std::function<void(const HTPlatformImage&)>& callback) override;
    std::optional<std::string> realpath(const std::string& path) override;
    int32_t getpid() override { return ownPid; }
    uint32_t geteuid() override { return euid; }
    bool isatty(int fd) override { return terminals.count(fd) != 0; }
    bool stat(const char* path) override { return existingFiles.count(path) != 0; }
    kern_return_t mach_memory_info(std::vector<mach_zone_name_t>& names, std::vector<mach_zone_info_t>& zones,
                                   std::vector<mach_memory_info_t>& sites) override;
    std::vector<HTLoadedModule> OSKextCopyLoadedKextInfo() override;
    std::unique_ptr<HTKernelSymbolResolver> openKernelImageList() override;
    HTProgramEnd runProgram(const std::vector<std::string>& arguments, bool followChildren,
                            const std::function<void(const HTHeldExit&)>& atExit) override;

private:
    // The scripted region at or after the address: its index, or the
    // number of regions when there is none.
    static size_t regionIndexAtOrAfter(const Process& process, uint64_t address);
    // The region look-up's failure for the answer at `index`, if one is
    // scripted; KERN_SUCCESS otherwise.
    static kern_return_t regionFailure(const Process& process, size_t index);
    int ownedVmObjects(void* oldp, size_t* oldlenp, const void* newp, size_t newlen);

    // In the order added: the listing order.
    std::vector<int32_t> order_;
    std::map<int32_t, Process> processes_;
};
