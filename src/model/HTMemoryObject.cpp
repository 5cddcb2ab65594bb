#include "model/HTMemoryObject.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"

#include <algorithm>

namespace {

const std::optional<std::string> kNoName;

}  // namespace

HTMemoryObject::HTMemoryObject() : memoryRegions_(std::make_shared<RegionSet>()) {}
HTMemoryObject::~HTMemoryObject() = default;

void HTMemoryObject::addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize, int32_t pid)
{
    _addRegion(region, pageSize, pid);
}

void HTMemoryObject::addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize)
{
    _addRegion(region, pageSize, std::nullopt);
}

void HTMemoryObject::_addRegion(const std::shared_ptr<HTMemoryRegion>& region, uint64_t pageSize,
                                std::optional<int32_t> pid)
{
    if (accurateSizes_) HT_FATAL("HTMemoryObject", "region added to a finalised object");
    HT_ASSERT("HTMemoryObject", region != nullptr, "region != nullptr");
    memoryRegions_->append(region);
    // A region without an object id names and lists the object but counts
    // for nothing.
    if (region->object_id() == 0) return;

    // Once one region has made the object worth viewing per process, every
    // later region is recorded so that each process's list is complete.
    if (pid && (processMemoryRegions_ || region->eligibleForProcessView())) recordRegionForProcess(region, *pid);

    if (!rangeList_) rangeList_ = std::make_unique<HTRangeList>();
    rangeList_->addRegion(*region, pageSize);
    pageSize_ = pageSize;
    // The range list now holds the region's sub-ranges.
    region->freeSubrangeList();
}

void HTMemoryObject::recordRegionForProcess(const std::shared_ptr<HTMemoryRegion>& region, int32_t pid)
{
    if (!processMemoryRegions_) processMemoryRegions_.emplace();
    if (RegionList* list = processMemoryRegions_->find(pid))
        list->push_back(region);
    else
        processMemoryRegions_->set(pid, RegionList{region});
}

void HTMemoryObject::finalize(bool breakDownPhysHeft) { finalizeUsingRegionDirtySize(false, breakDownPhysHeft); }

void HTMemoryObject::finalizeUsingRegionDirtySize(bool useRegionDirtySize, bool breakDownPhysHeft)
{
    if (accurateSizes_) HT_FATAL("HTMemoryObject", "object finalised twice");
    HTMemoryTotals pages = rangeList_ ? rangeList_->sum() : HTMemoryTotals{};

    if (useRegionDirtySize) {
        totalDirtySize_ = 0;
        totalSwappedSize_ = 0;
        for (const auto& region : *memoryRegions_) {
            totalDirtySize_ += region->dirtySize();
            totalSwappedSize_ += region->swappedSize();
        }
    } else {
        totalDirtySize_ = pages.dirty;
        totalSwappedSize_ = pages.swapped;
        if (processMemoryRegions_ && breakDownPhysHeft) raiseTotalsToProcessSums();
    }
    totalCleanSize_ = pages.clean;
    totalReclaimableSize_ = pages.reclaimable;
    totalWiredSize_ = pages.wired;
    // A process alone sees the object whole: only where several map it can
    // one of them be shown a view of its own.
    if (rangeList_ && processMemoryRegions_ && processMemoryRegions_->size() > 1) raiseTotalsToProcessViews();

    rangeList_.reset();
    pruneProcessMemoryRegions();
    if (containsFakeRegion()) nameFakeRegions();
    accurateSizes_ = true;
}

// With per-region heft figures from the kernel, a process is charged what
// its own regions report; the object must not show less than that.
void HTMemoryObject::raiseTotalsToProcessSums()
{
    for (const auto& [pid, regions] : *processMemoryRegions_) {
        uint64_t dirty = 0;
        uint64_t swapped = 0;
        for (const auto& region : regions) {
            dirty += region->dirtySize();
            swapped += region->swappedSize();
        }
        if (dirty > totalDirtySize_) totalDirtySize_ = dirty;
        if (swapped > totalSwappedSize_) totalSwappedSize_ = swapped;
    }
}

// The object must never show less than one process is shown of it. Where
// the range list had to settle for a lower bound of the union, the order in
// which regions came can leave it below what one process's regions count;
// and where it counted page by page, the pages' kinds can differ from the
// kernel's per-mapping counts that a view is built from (smaps counts a
// shared-memory page read but never written as clean). Either way that
// process's view (viewForProcess) would hold more than the whole. So each
// total is raised to what each process's regions, added whole as its view
// adds them, count.
void HTMemoryObject::raiseTotalsToProcessViews()
{
    for (const auto& [pid, regions] : *processMemoryRegions_) {
        HTRangeList view;
        for (const auto& region : regions) view.addRegion(*region, pageSize_);
        const HTMemoryTotals seen = view.sum();
        totalDirtySize_ = std::max(totalDirtySize_, seen.dirty);
        totalSwappedSize_ = std::max(totalSwappedSize_, seen.swapped);
        totalCleanSize_ = std::max(totalCleanSize_, seen.clean);
        totalReclaimableSize_ = std::max(totalReclaimableSize_, seen.reclaimable);
        totalWiredSize_ = std::max(totalWiredSize_, seen.wired);
    }
}

// Keeps the per-process map only when some process would see the object
// differently from the totals: through several regions, or through one
// whose figures differ from them.
void HTMemoryObject::pruneProcessMemoryRegions()
{
    if (!processMemoryRegions_) return;
    if (processMemoryRegions_->size() >= 2) {
        for (const auto& entry : *processMemoryRegions_) {
            const RegionList& regions = entry.second;
            if (regions.size() > 1) return;
            const HTMemoryRegion& region = *regions.front();
            if (region.dirtySize() != totalDirtySize_ || region.swappedSize() != totalSwappedSize_ ||
                region.cleanNonSpecSize() != totalCleanSize_ || region.reclaimableSize() != totalReclaimableSize_ ||
                region.wiredSize() != totalWiredSize_)
                return;
        }
    }
    processMemoryRegions_.reset();
}

// Fake regions stand for owned memory that is not mapped; where the object
// is also mapped they take the name of the mapping.
void HTMemoryObject::nameFakeRegions()
{
    HTMemoryRegion* canonical = _canonicalRegion();
    if (!canonical || canonical->isFake()) return;
    for (const auto& region : *memoryRegions_) {
        if (!region->isFake()) continue;
        region->setName(canonical->name());
        region->setDetailedName(canonical->detailedName());
    }
}

HTMemoryRegion* HTMemoryObject::_canonicalRegion() const
{
    if (memoryRegions_->empty()) return nullptr;
    HTMemoryRegion* first = memoryRegions_->front().get();
    if (!first->inSharedCache() && ownerPid_ == -1) return first;

    for (const auto& region : *memoryRegions_) {
        bool qualifies = first->inSharedCache() ? !region->unusedSharedCacheRegion() : !region->isFake();
        if (qualifies) return region.get();
    }
    return first;
}

std::shared_ptr<HTMemoryObject> HTMemoryObject::viewForProcess(int32_t pid, uint64_t pageSize, bool processBreakDown,
                                                               bool breakDownPhysHeft)
{
    std::shared_ptr<HTMemoryObject> view = shared_from_this();
    if (processMemoryRegions_ && !processMemoryRegions_->empty()) {
        const RegionList* regions = processMemoryRegions_->find(pid);
        // The process maps the object through none of the regions kept apart:
        // it sees the object whole, whoever owns it.
        if (!regions) return view;
        view = std::make_shared<HTMemoryObject>();
        view->setOwnerPid(ownerPid_);
        for (const auto& region : *regions) view->addRegion(region, pageSize);
        view->finalizeUsingRegionDirtySize(processBreakDown, breakDownPhysHeft);
    }

    // Memory another process owns is shown as clean to everyone else.
    if (ownerPid_ != -1 && ownerPid_ != pid) {
        std::shared_ptr<HTMemoryObject> shown = view->copy();
        shown->totalDirtySize_ = 0;
        shown->totalSwappedSize_ = 0;
        shown->totalCleanSize_ = view->totalCleanSize_ + totalDirtySize_ + totalSwappedSize_;
        view = std::move(shown);
    }
    return view;
}

std::shared_ptr<HTMemoryObject> HTMemoryObject::copy() const
{
    if (!accurateSizes_ || rangeList_) HT_FATAL("HTMemoryObject", "copy of an object that is not finalised");
    auto copied = std::make_shared<HTMemoryObject>();
    copied->totalDirtySize_ = totalDirtySize_;
    copied->totalSwappedSize_ = totalSwappedSize_;
    copied->totalCleanSize_ = totalCleanSize_;
    copied->totalWiredSize_ = totalWiredSize_;
    copied->accurateSizes_ = accurateSizes_;
    copied->ownerPid_ = ownerPid_;
    copied->memoryRegions_ = memoryRegions_;
    return copied;
}

bool HTMemoryObject::containsFakeRegion() const
{
    for (const auto& region : *memoryRegions_)
        if (region->isFake()) return true;
    return false;
}

const std::optional<std::string>& HTMemoryObject::name() const
{
    const HTMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->name() : kNoName;
}

const std::optional<std::string>& HTMemoryObject::detailedName() const
{
    const HTMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->detailedName() : kNoName;
}

std::optional<std::string> HTMemoryObject::fullName() const
{
    const HTMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->fullName() : std::nullopt;
}
