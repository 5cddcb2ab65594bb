#include "model/HTMemoryCategory.h"

#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"

HTMemoryCategory::HTMemoryCategory(uint8_t segment, bool summary) : isSummary_(summary), segment_(segment) {}

void HTMemoryCategory::addMemoryObject(const std::shared_ptr<HTMemoryObject>& object)
{
    if (!memoryObjects_.insert(object)) return;
    totalDirtySize_ += object->totalDirtySize();
    totalSwappedSize_ += object->totalSwappedSize();
    totalCleanSize_ += object->totalCleanSize();
    totalReclaimableSize_ += object->totalReclaimableSize();
    totalWiredSize_ += object->totalWiredSize();
    memoryRegions_.unite(object->memoryRegions());
}

std::optional<std::string> HTMemoryCategory::name() const
{
    if (memoryObjects_.empty()) return std::nullopt;
    return memoryObjects_.front()->name();
}

std::optional<std::string> HTMemoryCategory::detailedName() const
{
    if (isSummary_ || memoryObjects_.empty()) return std::nullopt;
    return memoryObjects_.front()->detailedName();
}

std::optional<std::string> HTMemoryCategory::fullName() const
{
    if (isSummary_) return name();
    if (memoryObjects_.empty()) return std::nullopt;
    return memoryObjects_.front()->fullName();
}
