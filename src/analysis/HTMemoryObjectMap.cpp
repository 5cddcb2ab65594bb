#include "analysis/HTMemoryObjectMap.h"

#include "model/HTMemoryObject.h"

#include <algorithm>
#include <bit>

namespace {

constexpr size_t kMinimumSlots = 16;

// Slots for `entries` objects at a load of at most three quarters.
size_t slotCountFor(size_t entries) { return std::bit_ceil(std::max(kMinimumSlots, entries + entries / 3 + 1)); }

}  // namespace

HTMemoryObjectMap::HTMemoryObjectMap(size_t capacityHint)
{
    entries_.reserve(capacityHint);
    rehash(slotCountFor(capacityHint));
}

size_t HTMemoryObjectMap::slotFor(uint64_t key) const
{
    // The hash picks the slot through a Fibonacci multiplication, so that
    // keys whose hashes differ only in their low bits still spread over the
    // whole table.
    const size_t mask = slots_.size() - 1;
    size_t slot = static_cast<size_t>((hash(key) * 0x9E3779B97F4A7C15ull) >> shift_);
    while (slots_[slot].index != kEmpty && slots_[slot].key != key) slot = (slot + 1) & mask;
    return slot;
}

void HTMemoryObjectMap::rehash(size_t slotCount)
{
    slots_.assign(slotCount, Slot{0, kEmpty});
    shift_ = 64 - static_cast<unsigned>(std::countr_zero(slotCount));
    for (size_t i = 0; i < entries_.size(); ++i)
        slots_[slotFor(entries_[i].first)] = Slot{entries_[i].first, static_cast<uint32_t>(i)};
}

HTMemoryObject* HTMemoryObjectMap::find(uint64_t key) const
{
    const Slot& slot = slots_[slotFor(key)];
    return slot.index == kEmpty ? nullptr : entries_[slot.index].second.get();
}

const std::shared_ptr<HTMemoryObject>& HTMemoryObjectMap::objectForKey(uint64_t key)
{
    size_t slot = slotFor(key);
    if (slots_[slot].index != kEmpty) return entries_[slots_[slot].index].second;

    if (slotCountFor(entries_.size() + 1) > slots_.size()) {
        rehash(slots_.size() * 2);
        slot = slotFor(key);
    }
    slots_[slot] = Slot{key, static_cast<uint32_t>(entries_.size())};
    entries_.emplace_back(key, std::make_shared<HTMemoryObject>());
    return entries_.back().second;
}
