#pragma once

#include "base/HTPointerIndex.h"
#include "model/HTIdentitySet.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

class HTMemoryObject;
class HTMemoryRegion;

// One line of a report: memory objects filed under one name, with the sums
// of their totals and the union of their regions. A summary category groups
// objects by short name only and so has no detailed name of its own.
//
// Built and read on the driver's thread only.
class HTMemoryCategory {
public:
    using ObjectSet = HTIdentitySet<HTMemoryObject>;
    using RegionSet = HTIdentitySet<HTMemoryRegion>;

    explicit HTMemoryCategory(uint8_t segment, bool summary = false);

    uint8_t segment() const { return segment_; }
    const ObjectSet& memoryObjects() const { return memoryObjects_; }
    // The union of the members' regions, built when first asked for.
    const RegionSet& memoryRegions() const;

    uint64_t totalDirtySize() const { return totalDirtySize_; }
    uint64_t totalSwappedSize() const { return totalSwappedSize_; }
    uint64_t totalCleanSize() const { return totalCleanSize_; }
    uint64_t totalReclaimableSize() const { return totalReclaimableSize_; }
    uint64_t totalWiredSize() const { return totalWiredSize_; }
    // Regions shared by several members count once.
    int32_t totalRegions() const { return static_cast<int32_t>(regionCount_); }

    // Adds an object and its totals and regions; an object that is already
    // a member (the same instance) is not counted again.
    void addMemoryObject(const std::shared_ptr<HTMemoryObject>& object);

    // All members are filed under one key, so any member names the category.
    // nullopt when there is no member. The references stay valid as long as
    // the members' regions.
    const std::optional<std::string>& name() const;
    // nullopt for a summary category, whatever its members say.
    const std::optional<std::string>& detailedName() const;
    // A summary category's full name is its name.
    std::optional<std::string> fullName() const;

private:
    static constexpr std::ptrdiff_t kLinearSize = 16;

    // Whether no earlier member holds the newest member's region set.
    bool isNewRegionSet(const RegionSet& regions);

    bool isSummary_;
    ObjectSet memoryObjects_;
    uint8_t segment_;
    uint64_t totalDirtySize_ = 0;
    uint64_t totalSwappedSize_ = 0;
    uint64_t totalCleanSize_ = 0;
    uint64_t totalReclaimableSize_ = 0;
    uint64_t totalWiredSize_ = 0;
    // Region sets of the members already counted, by identity, once there
    // are more than kLinearSize members.
    HTPointerIndex memberRegionSets_;
    uint64_t regionCount_ = 0;
    mutable RegionSet memoryRegions_;
    mutable bool memoryRegionsBuilt_ = true;
};
