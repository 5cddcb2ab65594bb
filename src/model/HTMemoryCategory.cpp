#include "model/HTMemoryCategory.h"

#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"

#include <algorithm>

HTMemoryCategory::HTMemoryCategory(uint8_t segment, bool summary) : isSummary_(summary), segment_(segment) {}

void HTMemoryCategory::addMemoryObject(const std::shared_ptr<HTMemoryObject>& object)
{
    if (!memoryObjects_.insert(object)) return;
    totalDirtySize_ += object->totalDirtySize();
    totalSwappedSize_ += object->totalSwappedSize();
    totalCleanSize_ += object->totalCleanSize();
    totalReclaimableSize_ += object->totalReclaimableSize();
    totalWiredSize_ += object->totalWiredSize();
    // Every region is routed to one memory object; objects that hold the
    // same regions (an object's copies) share one region set. Counting each
    // distinct set once therefore counts each region once, without merging
    // thousands of regions per shared library for every process's table.
    const RegionSet& regions = object->memoryRegions();
    if (isNewRegionSet(regions)) regionCount_ += regions.size();
    memoryRegionsBuilt_ = false;
}

bool HTMemoryCategory::isNewRegionSet(const RegionSet& regions)
{
    // The members before the one just added. Tables have a few; only the
    // summary's categories grow large enough to need an index.
    const auto earlier = static_cast<std::ptrdiff_t>(memoryObjects_.size() - 1);
    if (earlier <= kLinearSize) {
        return std::none_of(memoryObjects_.begin(), memoryObjects_.begin() + earlier,
                            [&regions](const auto& member) { return &member->memoryRegions() == &regions; });
    }
    if (memberRegionSets_.size() == 0) {
        for (auto member = memoryObjects_.begin(); member != memoryObjects_.begin() + earlier; ++member)
            memberRegionSets_.insert(&(*member)->memoryRegions());
    }
    return memberRegionSets_.insert(&regions).second;
}

const HTMemoryCategory::RegionSet& HTMemoryCategory::memoryRegions() const
{
    if (!memoryRegionsBuilt_) {
        memoryRegions_ = RegionSet();
        for (const auto& object : memoryObjects_) memoryRegions_.unite(object->memoryRegions());
        memoryRegionsBuilt_ = true;
    }
    return memoryRegions_;
}

namespace {

const std::optional<std::string> kNoName;

}  // namespace

const std::optional<std::string>& HTMemoryCategory::name() const
{
    if (memoryObjects_.empty()) return kNoName;
    return memoryObjects_.front()->name();
}

const std::optional<std::string>& HTMemoryCategory::detailedName() const
{
    if (isSummary_ || memoryObjects_.empty()) return kNoName;
    return memoryObjects_.front()->detailedName();
}

std::optional<std::string> HTMemoryCategory::fullName() const
{
    if (isSummary_) return name();
    if (memoryObjects_.empty()) return std::nullopt;
    return memoryObjects_.front()->fullName();
}
