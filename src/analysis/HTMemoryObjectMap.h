#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>
#include <vector>

class HTMemoryObject;

// Memory objects under raw 64-bit keys (VM object ids or shared cache
// addresses), owned by the map. Keys are compared as plain integers and
// hashed as the key shifted right by 8 bits: the ids are spread over their
// high bits and addresses are aligned, so the low byte says little. Lookups
// use open addressing over a power-of-two table; entries iterate in the
// order they were first stored, so that the same input gives the same
// report. Nothing is ever removed.
class HTMemoryObjectMap {
public:
    using Entry = std::pair<uint64_t, std::shared_ptr<HTMemoryObject>>;

    // Room for `capacityHint` objects before the table grows; a hint only.
    explicit HTMemoryObjectMap(size_t capacityHint = 0);

    // The object under the key, or null.
    HTMemoryObject* find(uint64_t key) const;
    // The object under the key, created and stored when absent.
    const std::shared_ptr<HTMemoryObject>& objectForKey(uint64_t key);

    size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    std::vector<Entry>::const_iterator end() const { return entries_.end(); }

    static uint64_t hash(uint64_t key) { return key >> 8; }

private:
    struct Slot {
        uint64_t key;
        uint32_t index;  // into entries_; kEmpty when the slot is free
    };
    static constexpr uint32_t kEmpty = UINT32_MAX;

    // The slot that holds the key, or the free slot where it belongs.
    size_t slotFor(uint64_t key) const;
    void rehash(size_t slotCount);

    std::vector<Slot> slots_;
    unsigned shift_ = 64;
    std::vector<Entry> entries_;
};
