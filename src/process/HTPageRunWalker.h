#pragma once

#include "model/HTSharedPageList.h"
#include "platform/HTPlatform.h"

#include <cstdint>
#include <functional>

class HTMemoryRegion;

// Reads the dispositions of a process's pages and breaks a region into runs
// of pages of one kind: as sub-ranges, as a page list with the identities of
// pages other processes may map too, and with the file's own pages of a
// private file mapping apart from the mapping's copies.
//
// A walker is three words made for one walk; it reports nothing itself: a
// failed page query comes back as the kernel's code, and the process says
// what that means.
class HTPageRunWalker {
public:
    // Receives the dispositions of one stretch of pages: one per page, or
    // null when every page has the disposition `uniform`; how many pages
    // there are, and the index of the first in the pages asked for.
    using DispositionChunkCallback =
        std::function<void(const int32_t* dispositions, int32_t uniform, uint64_t count, uint64_t firstPage)>;

    // One stretch of pages as a page query answers it: a disposition per
    // page (null when every page has the disposition `uniform`) and, when
    // asked for, an identity per page (null when none could be had).
    struct PageChunk {
        const int32_t* dispositions;
        int32_t uniform;
        uint64_t count;
        // The index of the first page in the pages asked for.
        uint64_t firstPage;
        const uint64_t* identities;
    };
    using PageChunkCallback = std::function<void(const PageChunk&)>;
    // Reads `pages` pages from the page-aligned `start` in chunks, with
    // identities when `identify`; KERN_SUCCESS, or the code of the query
    // that failed (the chunks before it were handed on). Stretches known to
    // hold nothing may be left out.
    using PageReader =
        std::function<kern_return_t(uint64_t start, uint64_t pages, bool identify, const PageChunkCallback&)>;

    // Page dispositions are queried in chunks of at most this many pages.
    static constexpr uint64_t kDispositionChunkPages = 4096;

    // Where a walk over a mapping's pages puts them.
    struct PageTargets {
        // Takes the pages (only the copied ones when the file's pages are
        // kept apart): as sub-ranges, or, with `identify`, as a page list
        // with the identities of pages other processes may map too. Null to
        // leave them out.
        HTMemoryRegion* pages = nullptr;
        // Takes the file's own pages of a private file mapping as
        // sub-ranges; null to leave them out.
        HTMemoryRegion* filePages = nullptr;
        bool identify = false;
        // Keeps the file's pages out of `pages` even when `filePages` is null.
        bool copiesOnly = false;
    };

    HTPageRunWalker(HTPlatform& platform, HTTaskPort& task, uint64_t pageSize)
        : platform_(platform), task_(task), pageSize_(pageSize)
    {
    }

    // Queries the dispositions of `pages` pages from `start`, in chunks;
    // KERN_SUCCESS, or the code of the query that failed (the chunks before
    // it were handed on). With `populatedOnly`, stretches the kernel knows
    // to hold nothing are stepped over (their pages, all of disposition 0,
    // are in no chunk), and runs whose disposition the kernel knows come
    // whole, as uniform.
    kern_return_t enumerateDispositionChunks(uint64_t start, uint64_t pages, bool populatedOnly,
                                             const DispositionChunkCallback& block) const;

    // The live process's pages, read through its task port.
    kern_return_t readPages(uint64_t start, uint64_t pages, bool identify, const PageChunkCallback& chunk) const;

    // Reads the dispositions of every page of the region with `reader` and
    // hands each populated page to its target; the runs found before a
    // failed query stay.
    static kern_return_t walkPages(const HTMemoryRegion& region, const PageTargets& targets, int32_t purgeState,
                                   uint64_t pageSize, const PageReader& reader);

    // The kind a page of this disposition counts as, in memory of this
    // purgeable state.
    static HTPageKind pageKind(int32_t disposition, int32_t purgeState);

    // Splits the copied pages of a private file mapping into a region of
    // their own, which it returns; null when the mapping holds no copies.
    // The copies' identity is private to the mapping in process `pid`.
    static std::shared_ptr<HTMemoryRegion>
    splitCopiedPages(HTMemoryRegion& region, const vm_region_submap_info_64& info, uint64_t pageSize, int32_t pid);
    // The identity of one segment's pages of a mapped file: the same in
    // every process that maps the image, and apart from its other segments.
    static uint64_t fileSegmentIdentity(uint64_t objectId, uint64_t offset);

private:
    HTPlatform& platform_;
    HTTaskPort& task_;
    uint64_t pageSize_;
};

inline uint64_t htRoundDown(uint64_t value, uint64_t unit) { return value / unit * unit; }
inline uint64_t htRoundUp(uint64_t value, uint64_t unit) { return (value + unit - 1) / unit * unit; }
