#include "base/HTPointerIndex.h"

#include "base/HTAssert.h"

#include <algorithm>
#include <bit>

namespace {

constexpr size_t kMinimumSlots = 16;

// Slots for `count` pointers at a load of at most three quarters.
size_t slotCountFor(size_t count) { return std::bit_ceil(std::max(kMinimumSlots, count + count / 3 + 1)); }

}  // namespace

void HTPointerIndex::allocate(size_t slotCount)
{
    slots_.assign(slotCount, Slot{nullptr, 0});
    shift_ = 64 - static_cast<unsigned>(std::countr_zero(slotCount));
}

size_t HTPointerIndex::slotFor(const void* pointer) const
{
    // Objects are at least 16-byte aligned; a Fibonacci multiplication
    // spreads what is left over the table.
    const auto bits = reinterpret_cast<uintptr_t>(pointer) >> 4;
    const size_t mask = slots_.size() - 1;
    size_t slot = static_cast<size_t>((bits * 0x9E3779B97F4A7C15ull) >> shift_);
    while (slots_[slot].pointer != nullptr && slots_[slot].pointer != pointer) slot = (slot + 1) & mask;
    return slot;
}

void HTPointerIndex::grow()
{
    std::vector<Slot> old = std::move(slots_);
    allocate(old.size() * 2);
    for (const Slot& slot : old)
        if (slot.pointer) slots_[slotFor(slot.pointer)] = slot;
}

bool HTPointerIndex::contains(const void* pointer) const
{
    return size_ != 0 && slots_[slotFor(pointer)].pointer != nullptr;
}

std::pair<uint32_t, bool> HTPointerIndex::insert(const void* pointer)
{
    HT_ASSERT("HTPointerIndex", pointer != nullptr, "pointer != nullptr");
    if (slots_.empty()) allocate(slotCountFor(capacityHint_));
    size_t slot = slotFor(pointer);
    if (slots_[slot].pointer) return {slots_[slot].number, false};
    if (slotCountFor(size_ + 1) > slots_.size()) {
        grow();
        slot = slotFor(pointer);
    }
    const auto number = static_cast<uint32_t>(size_++);
    slots_[slot] = Slot{pointer, number};
    return {number, true};
}
