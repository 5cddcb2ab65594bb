#pragma once

#include "base/HTOrderedMap.h"
#include "platform/HTPlatform.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

class HTMemoryRegion;

// One VM object the process owns, with what it charges to its owner.
struct HTOwnedVmObject : vm_owned_object {
    // The dirty and swapped bytes the object charges to its owner.
    uint64_t ownedDirtySize() const;
    uint64_t ownedSwappedSize() const;
};
static_assert(sizeof(HTOwnedVmObject) == sizeof(vm_owned_object), "read straight from the kernel's records");

// The owned VM objects under their ids, in the order the kernel listed
// them; a repeated id replaces the earlier record in place. A record taken
// out leaves an empty slot, so that taking one per region costs no shifting.
struct HTOwnedVmObjectKeyHash {
    size_t operator()(uint64_t key) const { return static_cast<size_t>(key >> 8); }
};
using HTOwnedVmObjectMap = HTOrderedMap<uint64_t, std::optional<HTOwnedVmObject>, HTOwnedVmObjectKeyHash>;

// The memory a process owns beyond what its mappings show: the VM objects
// it owns (mapped or not), the kernel's fake region that sums up the owned
// memory no region maps, and the page tables that the ledger charges it.
//
// One account serves one gathering: the walk charges each anonymous region
// its owned object, and what is left is added as regions at the end.
class HTOwnedMemory {
public:
    // The list of owned objects, or nullopt when the kernel keeps none.
    explicit HTOwnedMemory(std::optional<HTOwnedVmObjectMap> objects) : objects_(std::move(objects)) {}

    // Reads the owned objects of process `pid`: nullopt on a kernel without
    // the list, and nullopt with `failed` set and the errno in `error` when
    // the list could not be read.
    static std::optional<HTOwnedVmObjectMap> readOwnedVmObjects(HTPlatform& platform, int32_t pid, bool& failed,
                                                                int& error);

    // The balance of the "page_table" ledger entry of process `pid`, in
    // bytes: nullopt when the kernel has no such entry. False, with the
    // errno in `error`, when the entries could not be read.
    static bool readPageTableLedger(HTPlatform& platform, int32_t pid, std::optional<uint64_t>& balance, int& error);
    // The ledger template is read once per run; this makes the next process
    // read it again (for a kernel scripted anew).
    static void forgetLedgerTemplate();

    // Whether the kernel listed the owned objects; they then account for
    // unmapped owned memory themselves and the fake region is left out.
    bool hasObjectList() const { return objects_.has_value(); }
    // Keeps the kernel's fake region, to take out at the end what the
    // regions charged.
    void setFakeRegion(std::shared_ptr<HTMemoryRegion> region) { fakeRegion_ = std::move(region); }
    bool isFakeRegion(const std::shared_ptr<HTMemoryRegion>& region) const { return region == fakeRegion_; }

    // Charges an anonymous region what its owned object (or, without the
    // list, its purgeable memory) charges its owner.
    void chargeAnonymousRegion(HTMemoryRegion& region, const vm_region_submap_info_64& info, int32_t purgeState);

    // Appends the owned objects no region mapped, then the fake region less
    // what the regions charged (with a warning for `processName` when the
    // figures no longer agree), then the page tables of `pageTableBytes`.
    void addUnmappedMemory(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, std::vector<std::string>& warnings,
                           const std::string& processName);
    static void addPageTables(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t pageTableBytes);

private:
    std::optional<HTOwnedVmObjectMap> objects_;
    std::shared_ptr<HTMemoryRegion> fakeRegion_;
    uint64_t ownedTotal_ = 0;
};
