#pragma once

#include "process/HTOwnedMemory.h"
#include "process/HTPageRunWalker.h"
#include "process/HTProcess.h"
#include "process/HTSharedCacheSlicer.h"

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

class HTImage;
class HTImageEnumerator;
class HTMemoryRegion;
class HTSnapshotRecorder;

// A live user-space process, read through its task port. Creation opens the
// port and reads the first figures (physical heft, page-table ledger,
// idle-exit state); gatherData lists the images and owned objects, walks the
// address space and turns every mapping into regions. The pages of a
// region are walked by HTPageRunWalker, the shared library cache is cut by
// HTSharedCacheSlicer and owned memory is accounted by HTOwnedMemory; this
// class keeps the gathering sequence and says what a failed call means.
//
// Subclasses that read a process some other way (a snapfile, a corpse)
// replace the small hook operations: the walk, _isAlive and the _gather...
// steps.
class HTUserProcess : public HTProcess {
public:
    // Receives one region of the walk: start, size, the kernel's record,
    // the purgeable state and the mapped file's path. Returns true to stop.
    using RegionCallback = std::function<bool(uint64_t start, uint64_t size, const vm_region_submap_info_64& info,
                                              int32_t purgeState, const std::optional<std::string>& path)>;
    explicit HTUserProcess(std::shared_ptr<HTPlatform> platform);
    ~HTUserProcess() override;

    // The base steps, then the shared region, the physical heft, the
    // page-table ledger and the idle-exit status.
    bool initWithBsdInfo(const proc_bsdinfo& info) override;

    // Opens the task port; on failure reports it on standard error and in
    // the global error list, and the process is not created.
    bool _populateTask() override;
    bool _isAlive() override;
    // Images, physical heft and owned objects (unless hidden), then the
    // regions.
    void gatherData() override;
    // "phys_heft" and "phys_heft_peak", or null when the physical heft is 0.
    std::shared_ptr<HTAuxDataMap> auxData() override;

    // Calls `callback` once per region of the address space, in ascending
    // address order.
    virtual void enumerateRegions(const RegionCallback& callback);

    // --- fields ----------------------------------------------------------
    // Null until _populateTask succeeded.
    const std::shared_ptr<HTTaskPort>& task() const { return task_; }
    // Set while gathering when some memory may be shared with other
    // processes after a fork but the platform cannot name its pages.
    bool sharedPagesUnidentified() const { return sharedPagesUnidentified_; }

protected:
    // The ledger template is read once per run; this makes the next process
    // read it again (for a kernel scripted anew).
    static void _forgetLedgerTemplate();
    // Running out of descriptors is said once per run; this lets the next
    // run say it again.
    static void _forgetOutOfDescriptors();

    // The platform code whose shared region the process maps.
    virtual int _platformCode();
    // Whether `address` lies in the shared region.
    bool _isInSharedRegion(uint64_t address) const
    {
        return address >= sharedRegionBase_ && address - sharedRegionBase_ < sharedRegionSize_;
    }
    // Whether the pages of the region being walked can be read.
    virtual bool _canWalkPages() { return true; }
    // Sets the shared region from the platform code; false, with a message
    // on standard error, for a code it does not know.
    bool _setSharedRegionFromPlatform(int platformCode);
    // The start of a region below the shared region, near the last one; 0
    // when none was found or the shared region is empty.
    uint64_t _lastNonSharedCacheRegion();
    // Measures a shared-cache piece page by page; false when a query failed.
    virtual bool _populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                                      const vm_region_submap_info_64& info);
    // Breaks the region into runs of pages of one kind.
    virtual void _addSubrangesForRegion(HTMemoryRegion& region, int32_t purgeState);
    // Reads the dispositions of `pages` pages from `start` (see
    // HTPageRunWalker::PageReader); a live process asks its task port.
    virtual kern_return_t _readPages(uint64_t start, uint64_t pages, bool identify,
                                     const HTPageRunWalker::PageChunkCallback& chunk);
    // Whether the pages that processes share after a fork can be named.
    virtual bool _canIdentifySharedPages();
    // Measures the region's pages where the kernel's counts do not say
    // enough: runs of one kind, the file's pages apart from the copies of a
    // private file mapping, and the identities of pages shared after a fork.
    void _measurePages(HTMemoryRegion& region, HTMemoryRegion* copies, const vm_region_submap_info_64& info,
                       int32_t purgeState);

    // What a failed kernel call says of the process.
    enum class HTCallFailure { Failed, Exited, Zombie };
    // Records a failed kernel call as an error, or as a warning when the
    // process has exited or is a zombie and `expectedOnExit` was returned;
    // a text the process already carries is not added again.
    HTCallFailure _processMachVMError(kern_return_t code, kern_return_t expectedOnExit);
    // Exited or Zombie when the kernel says now that the process is gone,
    // Failed while it is still there.
    HTCallFailure _failureIfGone();
    // Tells standard error of a failed kernel call: the one shared notice of
    // processes that went away, or `failedText` (with "%s" for the process)
    // for one that is still there.
    void _addFailureNotice(HTCallFailure failure, const std::string& failedText);
    // Records a warning built from errno, with a notice for standard error.
    void _addErrnoWarningWithDescription(const std::string& description);
    // Whether `error` means heft ran out of file descriptors, which is then
    // said (the first time in a run) with the cure, on standard error and
    // among the run's errors: the callers leave out their own lines there.
    static bool _saidOutOfDescriptors(int error);

    // --- hooks -------------------------------------------------------------
    virtual void _gatherImageData();
    virtual void _gatherPhysHeft();
    virtual void _gatherLedgers();
    virtual std::optional<HTOwnedVmObjectMap> _gatherOwnedVmObjects();
    virtual void _gatherIdleExitStatus();
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

    // Builds memoryRegions from the walk, the owned objects and the ledger.
    void _gatherMemoryData();

    // For subclasses that read the figures elsewhere.
    void _setPhysHeft(uint64_t heft, uint64_t peak)
    {
        phys_heft_ = heft;
        phys_heft_peak_ = peak;
    }
    void _setPageTableSize(uint64_t bytes) { ledgers_[0] = bytes; }
    // For subclasses handed a task port rather than opening one.
    void _setTask(std::shared_ptr<HTTaskPort> task) { task_ = std::move(task); }
    std::vector<std::shared_ptr<HTImage>>& _images() { return images_; }

private:
    // Reports a failed region look-up and ends the walk's data there.
    void _bailOutOfWalk(kern_return_t code);
    // Walks the region's pages into their targets; a failed page query is
    // recorded on the process, and the runs found before it stay.
    void _walkPagesOfRegion(const HTMemoryRegion& region, const HTPageRunWalker::PageTargets& targets,
                            int32_t purgeState);
    // Records a failed page query; returns false for one, true for success.
    bool _checkPageQuery(kern_return_t result);
    // Writes the snapfile of what was gathered, unless the gathering failed.
    void _saveSnapshot();

    std::shared_ptr<HTTaskPort> task_;
    uint64_t sharedRegionBase_ = 0;
    uint64_t sharedRegionSize_ = 0;
    uint64_t phys_heft_ = 0;
    uint64_t phys_heft_peak_ = 0;
    // The balance of the "page_table" ledger entry, in bytes.
    std::array<uint64_t, 1> ledgers_{};
    std::vector<std::shared_ptr<HTImage>> images_;
    std::optional<HTOwnedVmObjectMap> ownedVmObjects_;
    // Made when the page size is known, at the start of a gathering.
    std::optional<HTSharedCacheSlicer> sharedCache_;
    bool sharedPagesUnidentified_ = false;
    // Set while a gathering is being saved as a snapfile.
    std::unique_ptr<HTSnapshotRecorder> recorder_;
};
