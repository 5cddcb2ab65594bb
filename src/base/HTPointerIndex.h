#pragma once

#include <cstddef>
#include <cstdint>
#include <utility>
#include <vector>

// Numbers for pointers in the order they are first offered: 0, 1, 2, and so
// on. The analysis meets tens of thousands of objects, each many times, and
// must tell which it has met and in what order; this open-addressing table
// does that without a node allocation per pointer, and allocates nothing
// until the first pointer arrives. Nothing is ever removed.
class HTPointerIndex {
public:
    // Room for `capacityHint` pointers before the table grows; a hint only.
    explicit HTPointerIndex(size_t capacityHint = 0) : capacityHint_(capacityHint) {}

    // The number of `pointer` (never null), and whether it was numbered now.
    std::pair<uint32_t, bool> insert(const void* pointer);
    bool contains(const void* pointer) const;
    size_t size() const { return size_; }

private:
    struct Slot {
        const void* pointer;  // null when the slot is free
        uint32_t number;
    };

    size_t slotFor(const void* pointer) const;
    void allocate(size_t slotCount);
    void grow();

    std::vector<Slot> slots_;
    unsigned shift_ = 64;
    size_t size_ = 0;
    size_t capacityHint_;
};
