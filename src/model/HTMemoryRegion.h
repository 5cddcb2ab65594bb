#pragma once

#include "model/HTMemoryTotals.h"
#include "model/HTRangeList.h"
#include "model/HTSharedPageList.h"
#include "platform/HTPlatformTypes.h"  // share modes

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

class HTMemoryObject;

// Segment codes, shared by regions, images and categories.
inline constexpr uint8_t HTSegmentNotSet = 0;
inline constexpr uint8_t HTSegmentNoImage = 1;   // a region that no image covers
inline constexpr uint8_t HTSegmentText = 2;      // "__TEXT..."
inline constexpr uint8_t HTSegmentOther = 3;     // any other "__" segment
inline constexpr uint8_t HTSegmentLinkEdit = 4;  // "__LINKEDIT..."

// The VM tag of a fake region: memory the process owns without mapping it.
inline constexpr uint32_t HTFakeRegionTag = 0xFFFFFFFF;
// The start of a region that has no address (fake regions, page tables).
inline constexpr uint64_t HTNoAddress = 0xFFFFFFFFFFFFFFFF;

// One span of one process's address space as the analysis sees it: a kernel
// region, a piece of one, or a fake region for owned memory that is not
// mapped. It carries the VM object it maps and its offset there, the sizes
// the process source measured, flags and two names.
//
// A region is written only by the thread that gathers its process; its
// memory object is set later on the main thread.
class HTMemoryRegion {
public:
    HTMemoryRegion();
    ~HTMemoryRegion();
    HTMemoryRegion(const HTMemoryRegion&) = delete;
    HTMemoryRegion& operator=(const HTMemoryRegion&) = delete;

    // --- flags -------------------------------------------------------------
    bool wired() const { return flags_ & WiredFlag; }
    void setWired(bool value) { setFlag(WiredFlag, value); }
    bool inSharedCache() const { return flags_ & InSharedCacheFlag; }
    void setInSharedCache(bool value) { setFlag(InSharedCacheFlag, value); }
    bool unusedSharedCacheRegion() const { return flags_ & UnusedSharedCacheFlag; }
    void setUnusedSharedCacheRegion(bool value) { setFlag(UnusedSharedCacheFlag, value); }
    bool ownedExclusivelyByParentProcess() const { return flags_ & OwnedExclusivelyFlag; }
    void setOwnedExclusivelyByParentProcess(bool value) { setFlag(OwnedExclusivelyFlag, value); }

    // --- fields ------------------------------------------------------------
    uint8_t segment() const { return segment_; }
    void setSegment(uint8_t value) { segment_ = value; }
    uint8_t share_mode() const { return share_mode_; }
    void setShare_mode(uint8_t value) { share_mode_ = value; }
    uint32_t user_tag() const { return user_tag_; }
    void setUser_tag(uint32_t value) { user_tag_ = value; }
    // The object this region was routed to; null before routing and once
    // the object is gone. Routing sets it; adding the region to an object
    // does not, because per-process views add regions to objects of their own.
    std::shared_ptr<HTMemoryObject> memoryObject() const { return memoryObject_.lock(); }
    void setMemoryObject(const std::shared_ptr<HTMemoryObject>& object) { memoryObject_ = object; }
    const std::optional<std::string>& name() const { return name_; }
    void setName(std::optional<std::string> value) { name_ = std::move(value); }
    const std::optional<std::string>& detailedName() const { return detailedName_; }
    void setDetailedName(std::optional<std::string> value) { detailedName_ = std::move(value); }
    uint64_t offset() const { return offset_; }
    void setOffset(uint64_t value) { offset_ = value; }
    uint64_t start() const { return start_; }
    void setStart(uint64_t value) { start_ = value; }
    uint64_t size() const { return size_; }
    void setSize(uint64_t value) { size_ = value; }
    uint64_t dirtySize() const { return dirtySize_; }
    void setDirtySize(uint64_t value) { dirtySize_ = value; }
    uint64_t reclaimableSize() const { return reclaimableSize_; }
    void setReclaimableSize(uint64_t value) { reclaimableSize_ = value; }
    uint64_t swappedSize() const { return swappedSize_; }
    void setSwappedSize(uint64_t value) { swappedSize_ = value; }
    uint64_t cleanNonSpecSize() const { return cleanNonSpecSize_; }
    void setCleanNonSpecSize(uint64_t value) { cleanNonSpecSize_ = value; }
    uint64_t object_id() const { return object_id_; }
    void setObject_id(uint64_t value) { object_id_ = value; }
    // Null unless sub-ranges were added.
    const HTRangeList* subrangeList() const { return subrangeList_.get(); }

    // --- derived -----------------------------------------------------------
    // start + size; a region without an address has no end either.
    uint64_t end() const { return start_ == HTNoAddress ? HTNoAddress : start_ + size_; }
    uint64_t wiredSize() const { return wired() ? size_ : 0; }
    bool isFake() const { return user_tag_ == HTFakeRegionTag; }
    // "name detailedName", or the name alone when there is no detail.
    std::optional<std::string> fullName() const;

    // -1, 0 or 1: lower start first; at equal start the larger region first.
    int compare(const HTMemoryRegion& other) const;

    // Adds a run of pages of one kind, at `location` in the object, to the
    // region's sub-range list, creating the list on first use.
    void addSubrange(uint64_t location, uint64_t length, const HTMemoryTotals& memoryTotal, uint64_t pageSize);
    // Drops the sub-range list once a memory object has absorbed it.
    void freeSubrangeList() { subrangeList_.reset(); }

    // The region's pages page by page, for pages other processes may map
    // too; null unless gathering recorded them. The analysis turns them
    // into sub-ranges and takes the list away.
    HTSharedPageList* sharedPageList() const { return sharedPageList_.get(); }
    HTSharedPageList& makeSharedPageList();
    std::unique_ptr<HTSharedPageList> takeSharedPageList() { return std::move(sharedPageList_); }

    // Whether the region may give its process a view of the object of its
    // own: memory that is private to the process by nature (private share
    // modes, image segments, shared cache, fake regions) never does.
    bool eligibleForProcessView() const;
    // Whether the region is worth breaking into runs of pages of one kind:
    // not when its pages are all of one kind or it holds nothing.
    bool eligibleForSubrangesUsingPageSize(uint64_t pageSize) const;

    // The display name of a VM tag.
    static std::string categoryNameForTag(uint32_t tag);
    // The system's own description of a region type, for tags the name table
    // leaves empty; nullopt when it has none.
    static std::optional<std::string> describeRegionType(uint32_t tag);

private:
    enum : uint8_t {
        WiredFlag = 1 << 0,
        InSharedCacheFlag = 1 << 1,
        UnusedSharedCacheFlag = 1 << 2,
        OwnedExclusivelyFlag = 1 << 3,
    };
    void setFlag(uint8_t flag, bool value)
    {
        flags_ = static_cast<uint8_t>(value ? (flags_ | flag) : (flags_ & ~flag));
    }

    uint8_t flags_ = 0;
    uint8_t segment_ = HTSegmentNotSet;
    uint8_t share_mode_ = 0;
    uint32_t user_tag_ = 0;
    std::weak_ptr<HTMemoryObject> memoryObject_;
    std::optional<std::string> name_;
    std::optional<std::string> detailedName_;
    uint64_t offset_ = 0;
    uint64_t start_ = 0;
    uint64_t size_ = 0;
    uint64_t dirtySize_ = 0;
    uint64_t reclaimableSize_ = 0;
    uint64_t swappedSize_ = 0;
    uint64_t cleanNonSpecSize_ = 0;
    uint64_t object_id_ = 0;
    std::unique_ptr<HTRangeList> subrangeList_;
    std::unique_ptr<HTSharedPageList> sharedPageList_;
};
