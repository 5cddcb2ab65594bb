#include "process/HTOwnedMemory.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <string_view>

namespace {

constexpr const char* kModule = "HTOwnedMemory";
constexpr const char* kOwnedVmObjectsSetting = "vm.get_owned_vmobjects";
// Room for 16 more owned-object records each time the list is asked for,
// for objects created between two asks.
constexpr size_t kOwnedVmObjectsHeadroom = 16 * sizeof(HTOwnedVmObject);
constexpr uint32_t kIOKitTag = 87;

// The ledger template, read once per run by whichever process asks first.
struct LedgerTemplate {
    bool read = false;
    bool known = false;
    int entryCount = 0;
    std::optional<size_t> pageTableIndex;
};
std::mutex ledgerTemplateLock;
LedgerTemplate ledgerTemplateState;

LedgerTemplate ledgerTemplate(HTPlatform& platform)
{
    std::lock_guard<std::mutex> guard(ledgerTemplateLock);
    if (ledgerTemplateState.read) return ledgerTemplateState;
    ledgerTemplateState = LedgerTemplate{};
    ledgerTemplateState.read = true;

    int room = 80;
    std::vector<ledger_template_info> entries;
    int count = 0;
    while (true) {
        entries.assign(static_cast<size_t>(room), ledger_template_info{});
        count = room;
        if (platform.ledger_template(entries.data(), &count) < 0) {
            std::perror("Unable to retrieve ledger template info");
            return ledgerTemplateState;
        }
        // A full array may have left entries out.
        if (count < room) break;
        room *= 2;
    }
    ledgerTemplateState.known = true;
    ledgerTemplateState.entryCount = count;
    for (int i = 0; i < count; ++i) {
        const char* name = entries[static_cast<size_t>(i)].lti_name;
        if (std::string_view(name, strnlen(name, sizeof(entries[0].lti_name))) == "page_table") {
            ledgerTemplateState.pageTableIndex = static_cast<size_t>(i);
            break;
        }
    }
    return ledgerTemplateState;
}

}  // namespace

uint64_t HTOwnedVmObject::ownedDirtySize() const
{
    if (flags & 0x1) return 0;
    switch ((flags >> 4) & 0x3) {
    case VM_PURGABLE_VOLATILE:
    case VM_PURGABLE_EMPTY:
        return wired_size;
    default:
        return resident_size > reusable_size ? resident_size - reusable_size : 0;
    }
}

uint64_t HTOwnedVmObject::ownedSwappedSize() const
{
    if (flags & 0x1) return 0;
    switch ((flags >> 4) & 0x3) {
    case VM_PURGABLE_VOLATILE:
    case VM_PURGABLE_EMPTY:
        return 0;
    default:
        return compressed_size;
    }
}

// --- reading ---------------------------------------------------------------------

std::optional<HTOwnedVmObjectMap> HTOwnedMemory::readOwnedVmObjects(HTPlatform& platform, int32_t pid, bool& failed,
                                                                    int& error)
{
    failed = false;
    size_t length = 0;
    if (platform.sysctlbyname(kOwnedVmObjectsSetting, nullptr, &length, &pid, sizeof(pid)) != 0) {
        // A kernel without the facility: the process owns nothing to report.
        failed = errno != ENOENT;
        error = errno;
        return std::nullopt;
    }
    HTOwnedVmObjectMap objects;
    if (length == 0) return objects;

    // Objects may appear between two asks: ask again while the answer
    // fills the buffer to the last byte.
    std::vector<unsigned char> buffer;
    size_t answered = 0;
    do {
        length += kOwnedVmObjectsHeadroom;
        buffer.resize(length);
        answered = length;
        if (platform.sysctlbyname(kOwnedVmObjectsSetting, buffer.data(), &answered, &pid, sizeof(pid)) != 0) {
            failed = true;
            error = errno;
            return std::nullopt;
        }
    } while (answered == length);

    if (answered == 0) return objects;
    HT_ASSERT(kModule, answered >= sizeof(uint64_t), "answered >= sizeof(uint64_t)");
    uint64_t count = 0;
    std::memcpy(&count, buffer.data(), sizeof(count));
    HT_ASSERT(kModule, count <= (answered - sizeof(uint64_t)) / sizeof(HTOwnedVmObject),
              "count <= (answered - sizeof(uint64_t)) / sizeof(HTOwnedVmObject)");
    for (uint64_t i = 0; i < count; ++i) {
        HTOwnedVmObject object;
        std::memcpy(&object, buffer.data() + sizeof(uint64_t) + i * sizeof(HTOwnedVmObject), sizeof(object));
        objects.set(object.object_id, object);
    }
    return objects;
}

bool HTOwnedMemory::readPageTableLedger(HTPlatform& platform, int32_t pid, std::optional<uint64_t>& balance, int& error)
{
    balance.reset();
    LedgerTemplate layout = ledgerTemplate(platform);
    if (!layout.known || !layout.pageTableIndex) return true;

    std::vector<ledger_entry_info> entries(static_cast<size_t>(layout.entryCount));
    int count = layout.entryCount;
    if (platform.ledger_entries(pid, entries.data(), &count) < 0) {
        error = errno;
        return false;
    }
    HT_ASSERT(kModule, count >= 0 && *layout.pageTableIndex < static_cast<size_t>(count),
              "count >= 0 && pageTableIndex < count");
    int64_t value = entries[*layout.pageTableIndex].lei_balance;
    balance = value < 0 ? 0 : static_cast<uint64_t>(value);
    return true;
}

void HTOwnedMemory::forgetLedgerTemplate()
{
    std::lock_guard<std::mutex> guard(ledgerTemplateLock);
    ledgerTemplateState = LedgerTemplate{};
}

// --- accounting ------------------------------------------------------------------

void HTOwnedMemory::chargeAnonymousRegion(HTMemoryRegion& region, const vm_region_submap_info_64& info,
                                          int32_t purgeState)
{
    bool owned = false;
    uint64_t ownedDirty = 0;
    uint64_t ownedSwapped = 0;
    std::optional<HTOwnedVmObject>* slot = nullptr;
    if (objects_ && (slot = objects_->find(info.object_id_full)) && slot->has_value()) {
        const HTOwnedVmObject& object = **slot;
        owned = true;
        ownedDirty = object.ownedDirtySize();
        ownedSwapped = object.ownedSwappedSize();
        region.setReclaimableSize(object.reusable_size);
        slot->reset();
    } else if (!objects_ && purgeState != VM_PURGABLE_DENY && info.user_tag != kIOKitTag && info.pages_resident != 0) {
        // Without the owned-object list, purgeable memory is taken to belong
        // to the process that maps it.
        owned = true;
        ownedDirty = region.dirtySize() + region.cleanNonSpecSize();
    }
    if (owned) {
        region.setOwnedExclusivelyByParentProcess(true);
        ownedTotal_ += ownedDirty + ownedSwapped;
        region.setDirtySize(ownedDirty);
        region.setCleanNonSpecSize(0);
        region.setSwappedSize(ownedSwapped);
    }
}

void HTOwnedMemory::addUnmappedMemory(std::vector<std::shared_ptr<HTMemoryRegion>>& regions,
                                      std::vector<std::string>& warnings, const std::string& processName)
{
    // Owned objects that no region maps.
    if (objects_) {
        for (const auto& [id, slot] : *objects_) {
            if (!slot) continue;
            const HTOwnedVmObject& object = *slot;
            auto region = std::make_shared<HTMemoryRegion>();
            region->setObject_id(object.object_id);
            region->setOwnedExclusivelyByParentProcess(true);
            region->setUser_tag(HTFakeRegionTag);
            region->setName(HTMemoryRegion::categoryNameForTag(HTFakeRegionTag));
            region->setSize(object.virtual_size);
            region->setReclaimableSize(object.reusable_size);
            region->setStart(HTNoAddress);
            region->setShare_mode(SM_SHARED);
            region->setDirtySize(object.ownedDirtySize());
            region->setSwappedSize(object.ownedSwappedSize());
            region->setWired(object.wired_size != 0);
            regions.push_back(region);
        }
        objects_.reset();
    }

    // The kernel's fake region counts all owned memory that is not mapped,
    // including what the regions above already charged; take that out.
    if (!fakeRegion_) return;
    HTMemoryRegion& fake = *fakeRegion_;
    uint64_t remaining = ownedTotal_;
    if (fake.dirtySize() < remaining) {
        remaining -= fake.dirtySize();
        fake.setDirtySize(0);
        if (fake.swappedSize() >= remaining) {
            fake.setSwappedSize(fake.swappedSize() - remaining);
        } else {
            remaining -= fake.swappedSize();
            char message[1024];
            std::snprintf(message, sizeof(message),
                          "%s: Heft changed while analyzing \u2013 unmapped owned physical heft may be "
                          "over-counted by %llu bytes",
                          processName.c_str(), static_cast<unsigned long long>(remaining));
            warnings.push_back(message);
            fake.setSwappedSize(0);
        }
    } else {
        fake.setDirtySize(fake.dirtySize() - remaining);
    }
    if (fake.dirtySize() + fake.swappedSize() != 0) {
        fake.setStart(HTNoAddress);
        regions.push_back(fakeRegion_);
    }
}

void HTOwnedMemory::addPageTables(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t pageTableBytes)
{
    auto pageTables = std::make_shared<HTMemoryRegion>();
    pageTables->setName("page table");
    pageTables->setSize(pageTableBytes);
    pageTables->setDirtySize(pageTableBytes);
    pageTables->setStart(HTNoAddress);
    pageTables->setObject_id(0xFFFFFFFFFFFFFFFF);
    pageTables->setShare_mode(SM_PRIVATE);
    regions.push_back(pageTables);
}
