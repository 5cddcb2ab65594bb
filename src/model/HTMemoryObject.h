#pragma once

#include "base/HTPidMap.h"
#include "model/HTIdentitySet.h"
#include "model/HTRangeList.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

class HTMemoryRegion;

// One kernel VM object, or one process's private copy-on-write instance of
// it, with every region of every analysed process that maps it. Finalising
// turns the regions' page counts into totals in which each page counts once;
// the regions each process maps are remembered so that a per-process view
// can be derived; the name comes from one representative region.
//
// Objects are created, filled, finalised and viewed on one thread and take
// no locks. They are always held by std::shared_ptr.
class HTMemoryObject : public std::enable_shared_from_this<HTMemoryObject> {
public:
    using RegionSet = HTIdentitySet<HTMemoryRegion>;
    using RegionList = std::vector<std::shared_ptr<HTMemoryRegion>>;
    using ProcessRegionMap = HTPidMap<RegionList>;

    HTMemoryObject();
    ~HTMemoryObject();
    // Copies are made with copy(), which shares the region set.
    HTMemoryObject(const HTMemoryObject&) = delete;
    HTMemoryObject& operator=(const HTMemoryObject&) = delete;

    // --- totals: valid once accurateSizes() is true --------------------------
    uint64_t totalDirtySize() const { return totalDirtySize_; }
    uint64_t totalCleanSize() const { return totalCleanSize_; }
    uint64_t totalSwappedSize() const { return totalSwappedSize_; }
    uint64_t totalReclaimableSize() const { return totalReclaimableSize_; }
    uint64_t totalWiredSize() const { return totalWiredSize_; }
    bool accurateSizes() const { return accurateSizes_; }

    // The pid of the process that owns the object exclusively, -1 if none.
    int32_t ownerPid() const { return ownerPid_; }
    void setOwnerPid(int32_t pid) { ownerPid_ = pid; }
    // Every region ever added, of all processes, in the order added.
    const RegionSet& memoryRegions() const { return *memoryRegions_; }
    void setMemoryRegions(std::shared_ptr<RegionSet> regions)
    {
        memoryRegions_ = regions ? std::move(regions) : std::make_shared<RegionSet>();
    }
    // For each process, the regions through which it maps the object; absent
    // when every process sees the object whole.
    const std::optional<ProcessRegionMap>& processMemoryRegions() const { return processMemoryRegions_; }
    // Null before the first counted region and after finalisation.
    const HTRangeList* rangeList() const { return rangeList_.get(); }

    // Adds a region mapped by the process `pid`, whose pages are `pageSize`
    // bytes, recording it per process. Each region is added once: its pages
    // would otherwise count twice.
    void addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize, int32_t pid);
    // Adds a region without recording a process.
    void addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize);

    // Computes the totals from the range list. `breakDownPhysHeft` is the
    // analysis-wide switch: when on, no process's own regions may report more
    // dirty or swapped memory than the totals.
    void finalize(bool breakDownPhysHeft);
    // As finalize, but with `useRegionDirtySize` the dirty and swapped totals
    // are the regions' own figures summed, without page de-duplication.
    void finalizeUsingRegionDirtySize(bool useRegionDirtySize, bool breakDownPhysHeft);

    // The object as the process `pid` sees it: a finalised view built from
    // that process's own regions (of `pageSize` bytes a page, counted after
    // the process's own mode `processBreakDown`) when the object kept them
    // apart, shown as clean when another process owns it, else this object
    // itself.
    std::shared_ptr<HTMemoryObject> viewForProcess(int32_t pid, uint64_t pageSize, bool processBreakDown,
                                                   bool breakDownPhysHeft);
    // Whether viewForProcess gives every process this object itself.
    bool looksTheSameToEveryProcess() const
    {
        return (!processMemoryRegions_ || processMemoryRegions_->empty()) && ownerPid_ == -1;
    }
    // A finalised copy sharing the region set, without reclaimable total,
    // per-process map or range list. The object must be finalised.
    std::shared_ptr<HTMemoryObject> copy() const;

    bool containsFakeRegion() const;
    // The names of the representative region; nullopt when there is none.
    // The references stay valid as long as the object's regions.
    const std::optional<std::string>& name() const;
    const std::optional<std::string>& detailedName() const;
    std::optional<std::string> fullName() const;

protected:
    void _addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize, std::optional<int32_t> pid);
    // The region that names the object; null when the set is empty.
    HTMemoryRegion* _canonicalRegion() const;

private:
    void recordRegionForProcess(const std::shared_ptr<HTMemoryRegion>& region, int32_t pid);
    void raiseTotalsToProcessSums();
    void raiseTotalsToProcessViews();
    void pruneProcessMemoryRegions();
    void nameFakeRegions();

    uint64_t totalDirtySize_ = 0;
    uint64_t totalCleanSize_ = 0;
    uint64_t totalSwappedSize_ = 0;
    uint64_t totalReclaimableSize_ = 0;
    bool accurateSizes_ = false;
    int32_t ownerPid_ = -1;
    uint64_t totalWiredSize_ = 0;
    // Shared with copies, which are made only of finalised objects.
    std::shared_ptr<RegionSet> memoryRegions_;
    std::optional<ProcessRegionMap> processMemoryRegions_;
    std::unique_ptr<HTRangeList> rangeList_;
    // The page size the range list aligns to, as the regions were added.
    uint64_t pageSize_ = 0;
};
