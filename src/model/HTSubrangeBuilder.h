#pragma once

#include "model/HTSharedPageList.h"

#include <cstdint>

class HTMemoryRegion;

// Gathers pages, one at a time and in ascending order of their offset in the
// region's object, into runs of one kind, and adds each run to the region's
// sub-ranges. A page that goes elsewhere leaves a gap that ends the run.
class HTSubrangeBuilder {
public:
    // A null region takes nothing.
    HTSubrangeBuilder(HTMemoryRegion* region, uint64_t pageSize) : region_(region), pageSize_(pageSize) {}
    ~HTSubrangeBuilder() { flush(); }
    HTSubrangeBuilder(const HTSubrangeBuilder&) = delete;
    HTSubrangeBuilder& operator=(const HTSubrangeBuilder&) = delete;

    // One page at `location` in the object.
    void add(uint64_t location, HTPageKind kind) { addRun(location, pageSize_, kind); }
    // `length` bytes of pages of one kind from `location`.
    void addRun(uint64_t location, uint64_t length, HTPageKind kind);
    // Adds the run in hand.
    void flush();

private:
    HTMemoryRegion* region_;
    uint64_t pageSize_;
    HTPageKind kind_ = HTPageKind::None;
    uint64_t location_ = 0;
    uint64_t length_ = 0;
};
