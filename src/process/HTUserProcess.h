#pragma once

#include "process/HTProcess.h"

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

class HTImage;
class HTImageEnumerator;
class HTMemoryRegion;

// One VM object the process owns, with what it charges to its owner.
struct HTOwnedVmObject : vm_owned_object {
    // The dirty and swapped bytes the object charges to its owner.
    uint64_t ownedDirtySize() const;
    uint64_t ownedSwappedSize() const;
};
static_assert(sizeof(HTOwnedVmObject) == sizeof(vm_owned_object), "read straight from the kernel's records");

// The owned VM objects under their ids. Entries iterate in the order the
// kernel listed them; taking one out leaves the others in place.
class HTOwnedVmObjectMap {
public:
    // Stores the record; a repeated id replaces the earlier record in place.
    void set(const HTOwnedVmObject& object);
    // Removes the record under the id and returns it, if there is one.
    std::optional<HTOwnedVmObject> take(uint64_t objectId);
    size_t size() const { return index_.size(); }
    // Calls `visit` with every record left, in listing order.
    void forEach(const std::function<void(const HTOwnedVmObject&)>& visit) const;

private:
    struct KeyHash {
        size_t operator()(uint64_t key) const { return static_cast<size_t>(key >> 8); }
    };
    std::vector<std::optional<HTOwnedVmObject>> entries_;
    std::unordered_map<uint64_t, size_t, KeyHash> index_;
};

// A live user-space process, read through its task port. Creation opens the
// port and reads the first figures (physical heft, page-table ledger,
// idle-exit state); gatherData lists the images and owned objects, walks the
// address space and turns every mapping into regions.
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
    // Receives the dispositions of one stretch of pages: one per page, or
    // null when every page has the disposition `uniform`; how many pages
    // there are, and the index of the first in the pages asked for.
    using DispositionChunkCallback =
        std::function<void(const int32_t* dispositions, int32_t uniform, uint64_t count, uint64_t firstPage)>;

    // Page dispositions are queried in chunks of at most this many pages.
    static constexpr uint64_t kDispositionChunkPages = 4096;

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
    uint64_t sharedRegionBase() const { return sharedRegionBase_; }
    uint64_t sharedRegionSize() const { return sharedRegionSize_; }
    uint32_t sharedRegionAlignmentSize() const { return sharedRegionAlignmentSize_; }
    void setSharedRegionAlignmentSize(uint32_t value) { sharedRegionAlignmentSize_ = value; }
    uint64_t phys_heft() const { return phys_heft_; }
    void setPhys_heft(uint64_t value) { phys_heft_ = value; }
    uint64_t phys_heft_peak() const { return phys_heft_peak_; }
    void setPhys_heft_peak(uint64_t value) { phys_heft_peak_ = value; }
    // Set while gathering when some memory may be shared with other
    // processes after a fork but the platform cannot name its pages.
    bool sharedPagesUnidentified() const { return sharedPagesUnidentified_; }
    // The balance of the "page_table" ledger entry, in bytes.
    const std::array<uint64_t, 1>& ledgers() const { return ledgers_; }

protected:
    // The ledger template is read once per run; this makes the next process
    // read it again (for a kernel scripted anew).
    static void _forgetLedgerTemplate();
    // Running out of descriptors is said once per run; this lets the next
    // run say it again.
    static void _forgetOutOfDescriptors();

    // The platform code whose shared region the process maps.
    virtual int _platformCode();
    // Sets the shared region from the platform code; false, with a message
    // on standard error, for a code it does not know.
    bool _setSharedRegionFromPlatform(int platformCode);
    // The start of a region below the shared region, near the last one; 0
    // when none was found or the shared region is empty.
    uint64_t _lastNonSharedCacheRegion();
    // Cuts one mapping of the shared region into image pieces and unused
    // pieces and appends them; false when a page query failed.
    bool _addRegionsToArray(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t start, uint64_t size,
                            const vm_region_submap_info_64& info, HTImageEnumerator& enumerator);

    // Queries the dispositions of `pages` pages from `start`, in chunks;
    // false (with the error recorded) when a query failed. With
    // `populatedOnly`, stretches the kernel knows to hold nothing are
    // stepped over (their pages, all of disposition 0, are in no chunk), and
    // runs whose disposition the kernel knows come whole, as uniform.
    bool _enumerateDispositionChunksWithStartAddr(uint64_t start, uint64_t pages, bool populatedOnly,
                                                  const DispositionChunkCallback& block);
    // Measures a shared-cache piece page by page; false when a query failed.
    virtual bool _populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                                      const vm_region_submap_info_64& info);
    // Breaks the region into runs of pages of one kind.
    virtual void _addSubrangesForRegion(HTMemoryRegion& region, int32_t purgeState);

    // Where a walk over a mapping's pages puts them.
    struct PageTargets {
        // Takes the pages (only the copied ones when the file's pages are
        // kept apart): as sub-ranges, or, with `identify`, as a page list
        // with the identities of pages other processes may map too. Null to
        // leave them out.
        HTMemoryRegion* pages = nullptr;
        // Takes the file's own pages of a private file mapping as
        // sub-ranges; null to leave them out.
        HTMemoryRegion* filePages = nullptr;
        bool identify = false;
        // Keeps the file's pages out of `pages` even when `filePages` is null.
        bool copiesOnly = false;
    };
    // Queries the dispositions of every page of the region and hands each
    // populated page to its target.
    void _walkPagesOfRegion(const HTMemoryRegion& region, const PageTargets& targets, int32_t purgeState);
    // Measures the region's pages where the kernel's counts do not say
    // enough: runs of one kind, the file's pages apart from the copies of a
    // private file mapping, and the identities of pages shared after a fork.
    void _measurePages(HTMemoryRegion& region, HTMemoryRegion* copies, const vm_region_submap_info_64& info,
                       int32_t purgeState);
    // Splits the copied pages of a private file mapping into a region of
    // their own, which it returns; null when the mapping holds no copies.
    std::shared_ptr<HTMemoryRegion> _splitCopiedPages(HTMemoryRegion& region, const vm_region_submap_info_64& info);

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

    // The images of the process, sorted by start; filled while gathering.
    std::vector<std::shared_ptr<HTImage>>& images() { return images_; }

private:
    // Reports a failed region look-up and ends the walk's data there.
    void _bailOutOfWalk(kern_return_t code);

    std::shared_ptr<HTTaskPort> task_;
    uint64_t sharedRegionBase_ = 0;
    uint64_t sharedRegionSize_ = 0;
    uint32_t sharedRegionAlignmentSize_ = 0;
    uint64_t phys_heft_ = 0;
    uint64_t phys_heft_peak_ = 0;
    std::array<uint64_t, 1> ledgers_{};
    std::vector<std::shared_ptr<HTImage>> images_;
    std::optional<HTOwnedVmObjectMap> ownedVmObjects_;
    uint64_t cachedDispositionAddress_ = 0;
    int32_t cachedDisposition_ = 0;
    std::shared_ptr<HTMemoryRegion> pendingUnusedSharedRegion_;
    bool sharedPagesUnidentified_ = false;
};
