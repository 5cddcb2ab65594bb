#include "process/HTStringTable.h"

HTStringTable::HTStringTable(size_t slotCount)
    : slotCount_(slotCount), slots_(new std::atomic<const std::string*>[slotCount])
{
    for (size_t i = 0; i < slotCount_; i++) slots_[i].store(nullptr, std::memory_order_relaxed);
}

HTStringTable::~HTStringTable()
{
    for (size_t i = 0; i < slotCount_; i++) delete slots_[i].load(std::memory_order_acquire);
}

const std::string* HTStringTable::intern(std::string_view value, size_t firstSlot, size_t probeCount)
{
    if (slotCount_ == 0) return nullptr;
    if (probeCount > slotCount_) probeCount = slotCount_;
    // Made at most once, and only when a free slot is met; it is kept for
    // the next free slot when another thread wins the race for this one.
    std::string* candidate = nullptr;
    const std::string* found = nullptr;
    for (size_t probe = 0; probe < probeCount && found == nullptr; probe++) {
        std::atomic<const std::string*>& slot = slots_[(firstSlot + probe) % slotCount_];
        const std::string* held = slot.load(std::memory_order_acquire);
        if (held == nullptr) {
            if (candidate == nullptr) candidate = new std::string(value);
            if (slot.compare_exchange_strong(held, candidate, std::memory_order_release, std::memory_order_acquire)) {
                return candidate;
            }
            // Another thread filled the slot first: `held` is its string,
            // compared like any other.
        }
        if (*held == value) found = held;
    }
    delete candidate;
    return found;
}

size_t HTStringTable::pathSlotForAddress(uint64_t baseAddress)
{
    uint64_t b = baseAddress;
    return static_cast<size_t>((b ^ (b >> 8) ^ (b >> 16) ^ (b >> 24)) % PathSlotCount);
}

const std::string* HTStringTable::internPath(std::string_view path, uint64_t baseAddress)
{
    return intern(path, pathSlotForAddress(baseAddress), PathProbeCount);
}

const std::string* HTStringTable::internSegmentName(std::string_view name) { return intern(name, 0, slotCount_); }

HTStringTable& HTStringTable::pathTable()
{
    // Never destroyed: see the header.
    static HTStringTable* table = new HTStringTable(PathSlotCount);
    return *table;
}

HTStringTable& HTStringTable::segmentNameTable()
{
    static HTStringTable* table = new HTStringTable(SegmentNameSlotCount);
    return *table;
}
