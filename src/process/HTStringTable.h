#pragma once

// A fixed-size table of shared strings, filled without locks, so that
// every process of a run that names the same image path or segment name
// refers to one string object.
//
// Each slot holds a pointer to a string, null while free. A free slot is
// claimed by compare-and-swap with release ordering and every slot is read
// with acquire ordering, so a thread that sees a string sees it fully
// built. A slot once filled never changes.
//
// The two process-wide tables are never destroyed: their strings live for
// the whole run and are never freed, which is what lets images point into
// them without owning them. A table made on its own (tests) frees its
// strings when it goes.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

class HTStringTable {
public:
    static constexpr size_t PathSlotCount = 2047;
    static constexpr size_t PathProbeCount = 18;
    static constexpr size_t SegmentNameSlotCount = 16;

    explicit HTStringTable(size_t slotCount);
    ~HTStringTable();
    HTStringTable(const HTStringTable&) = delete;
    HTStringTable& operator=(const HTStringTable&) = delete;

    // The table's string equal to `value`, looking at up to `probeCount`
    // slots from `firstSlot` on (wrapping at the end). A free slot met on
    // the way is claimed for a new copy of `value`. Null when every slot
    // looked at holds some other string.
    const std::string* intern(std::string_view value, size_t firstSlot, size_t probeCount);

    // Image paths, keyed by the image's base address.
    const std::string* internPath(std::string_view path, uint64_t baseAddress);
    // Segment names, looked up from the first slot.
    const std::string* internSegmentName(std::string_view name);

    size_t slotCount() const { return slotCount_; }

    // The first path slot looked at for an image at `baseAddress`.
    static size_t pathSlotForAddress(uint64_t baseAddress);

    static HTStringTable& pathTable();
    static HTStringTable& segmentNameTable();

private:
    size_t slotCount_;
    std::unique_ptr<std::atomic<const std::string*>[]> slots_;
};
