#include "platform/linux/HTLinuxRegionInfo.h"

#include "base/HTMix.h"
#include <algorithm>
#include <limits>

namespace {

constexpr uint64_t kTopBit = uint64_t{1} << 63;
constexpr uint64_t kTopTwoBits = uint64_t{3} << 62;
constexpr uint64_t kAnonymousMark = uint64_t{1} << 62;

uint32_t pages(uint64_t bytes, uint64_t pageSize)
{
    return static_cast<uint32_t>(std::min<uint64_t>(bytes / pageSize, std::numeric_limits<uint32_t>::max()));
}

uint32_t maxProtection(const HTSmapsEntry& entry)
{
    return (entry.hasFlag(HTVmFlagMayRead) ? VM_PROT_READ : 0) | (entry.hasFlag(HTVmFlagMayWrite) ? VM_PROT_WRITE : 0) |
        (entry.hasFlag(HTVmFlagMayExec) ? VM_PROT_EXECUTE : 0);
}

uint32_t inheritance(const HTSmapsEntry& entry)
{
    if (entry.shared) return VM_INHERIT_SHARE;
    if (entry.hasFlag(HTVmFlagDontCopy)) return VM_INHERIT_NONE;
    return VM_INHERIT_COPY;
}

// Private anonymous memory has no object offset: the maps line shows the
// page number of its start address there.
uint64_t objectOffset(const HTSmapsEntry& entry) { return entry.hasBackingObject() ? entry.offset : 0; }

}  // namespace

uint32_t htRegionTag(const HTSmapsEntry& entry)
{
    switch (entry.kind) {
    case HTSmapsKind::Heap:
        return HT_VM_TAG_HEAP;
    case HTSmapsKind::Stack:
        return HT_VM_TAG_STACK;
    case HTSmapsKind::SharedMemory:
        return HT_VM_TAG_SHARED_MEMORY;
    case HTSmapsKind::KernelProvided:
        return HT_VM_TAG_KERNEL_PROVIDED;
    case HTSmapsKind::NamedAnonymous:
    case HTSmapsKind::NamedSharedMemory:
        return HT_VM_TAG_NAMED_ANONYMOUS;
    case HTSmapsKind::File:
        return HT_VM_TAG_UNTAGGED;
    case HTSmapsKind::Anonymous:
        return entry.protection == 0 ? HT_VM_TAG_GUARD : HT_VM_TAG_UNTAGGED;
    }
    return HT_VM_TAG_UNTAGGED;
}

uint64_t htFileObjectId(uint32_t devMajor, uint32_t devMinor, uint64_t inode)
{
    // The inode may be 0 (the first System V segment has id 0): the device
    // and the top bit still keep the identity apart from 0.
    uint64_t device = (uint64_t{devMajor} << 32) | devMinor;
    uint64_t id = htMix(htMix(device) ^ inode) | kTopBit;
    return id == ~uint64_t{0} ? id ^ 1 : id;
}

uint64_t htRegionObjectId(const HTSmapsEntry& entry, int32_t pid)
{
    if (entry.hasBackingObject()) return htFileObjectId(entry.devMajor, entry.devMinor, entry.inode);
    uint64_t id = htMix(htMix(static_cast<uint32_t>(pid)) ^ entry.start);
    return (id & ~kTopTwoBits) | kAnonymousMark;
}

vm_region_submap_info_64 htSubmapInfo(const HTSmapsEntry& entry, int32_t pid, uint64_t pageSize)
{
    // hugetlbfs pages are outside Rss and the dirty counts; they have no
    // backing store, so every resident one is dirty.
    uint64_t hugetlb = entry.sharedHugetlb + entry.privateHugetlb;
    uint64_t resident = entry.rss + hugetlb;
    const bool sharedWithOthers = entry.mayShareWithOtherProcesses();

    vm_region_submap_info_64 info{};
    info.protection = entry.protection;
    info.max_protection = maxProtection(entry);
    info.inheritance = inheritance(entry);
    info.offset = objectOffset(entry);
    info.user_tag = htRegionTag(entry);
    info.pages_resident = pages(resident, pageSize);
    info.pages_dirtied = pages(entry.privateDirty + entry.sharedDirty + hugetlb, pageSize);
    info.pages_swapped_out = pages(entry.swap, pageSize);
    info.pages_reusable = pages(entry.lazyFree, pageSize);
    // The copied-on-write pages of a private file mapping are anonymous.
    info.pages_shared_now_private = !entry.shared && entry.hasBackingObject() ? pages(entry.anonymous, pageSize) : 0;
    info.ref_count = sharedWithOthers ? 2 : 1;
    info.external_pager = entry.kind == HTSmapsKind::File ? 1 : 0;
    if (resident == 0 && entry.swap == 0)
        info.share_mode = SM_EMPTY;
    else if (entry.shared)
        info.share_mode = SM_SHARED;
    else if (entry.hasBackingObject())
        info.share_mode = SM_COW;
    else
        // Private anonymous pages (or swap slots) still shared after a fork
        // are copy-on-write.
        info.share_mode = sharedWithOthers ? SM_COW : SM_PRIVATE;
    info.user_wired_count = entry.hasFlag(HTVmFlagLocked) ? 1 : 0;
    info.object_id_full = htRegionObjectId(entry, pid);
    info.object_id = static_cast<uint32_t>(info.object_id_full);
    return info;
}

vm_region_basic_info_64 htBasicInfo(const HTSmapsEntry& entry)
{
    vm_region_basic_info_64 info{};
    info.protection = entry.protection;
    info.max_protection = maxProtection(entry);
    info.inheritance = inheritance(entry);
    info.shared = entry.shared ? 1 : 0;
    info.offset = objectOffset(entry);
    info.user_wired_count = entry.hasFlag(HTVmFlagLocked) ? 1 : 0;
    return info;
}
