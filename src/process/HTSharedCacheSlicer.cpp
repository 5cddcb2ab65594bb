#include "process/HTSharedCacheSlicer.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"
#include "process/HTImage.h"
#include "process/HTImageEnumerator.h"
#include "process/HTPageRunWalker.h"

#include <algorithm>
#include <string>

namespace {

constexpr const char* kModule = "HTSharedCacheSlicer";

// A page of a shared-cache piece counts as dirty when the kernel says so or
// when it is resident anonymous memory.
bool countsAsDirty(int32_t disposition)
{
    return (disposition & VM_PAGE_QUERY_PAGE_DIRTY) ||
        ((disposition & VM_PAGE_QUERY_PAGE_PRESENT) && !(disposition & VM_PAGE_QUERY_PAGE_EXTERNAL));
}

}  // namespace

bool HTSharedCacheSlicer::addRegions(std::vector<std::shared_ptr<HTMemoryRegion>>& regions, uint64_t start,
                                     uint64_t size, const vm_region_submap_info_64& info, HTImageEnumerator& enumerator,
                                     const MeasureCallback& measure)
{
    pendingUnusedSharedRegion_.reset();
    const uint64_t alignment = kAlignment;
    const uint64_t page = pageSize_;
    const bool writable = (info.max_protection & VM_PROT_WRITE) != 0;
    const uint64_t end = start + size;

    auto makePiece = [&](uint64_t from, uint64_t to) {
        auto piece = std::make_shared<HTMemoryRegion>();
        piece->setStart(from);
        piece->setSize(to - from);
        piece->setUser_tag(info.user_tag);
        piece->setObject_id(info.object_id_full);
        piece->setShare_mode(info.share_mode);
        piece->setOffset(info.offset + (from - start));
        piece->setInSharedCache(true);
        piece->setWired(info.user_wired_count != 0);
        return piece;
    };

    std::shared_ptr<HTImage> image = enumerator.nextImageForStart(start, end);
    uint64_t cursor = start;
    while (cursor < end) {
        if (!image || cursor < image->start()) {
            const uint64_t to = image ? std::min(image->start(), end) : end;
            auto piece = makePiece(cursor, to);
            piece->setName("unused rtld shared cache area");
            piece->setUnusedSharedCacheRegion(true);
            // Only a piece that shares a page with its neighbour needs
            // measuring; the rest of an unused area holds nothing.
            if (writable && (cursor % page != 0 || to % page != 0) && !measure(piece, info)) return false;
            regions.push_back(piece);
            cursor = to;
            if (cursor >= end || !image) return true;
        }

        const uint64_t pieceStart = std::max(cursor, image->start());
        uint64_t pieceEnd = std::min(image->end(), end);
        // Images are never empty (empty segments are not listed), so every
        // piece moves the cursor on.
        HT_ASSERT(kModule, pieceEnd > pieceStart, "pieceEnd > pieceStart");
        std::shared_ptr<HTImage> next = enumerator.nextImageForStart(pieceEnd, end);
        const uint64_t nextStart = next ? next->start() : 0;
        // Segments laid out on alignment boundaries own the padding up to
        // the next boundary.
        if (next != image && pieceStart % alignment == 0 && nextStart % alignment == 0)
            pieceEnd = htRoundUp(pieceEnd, alignment);

        auto piece = makePiece(pieceStart, pieceEnd);
        piece->setName(image->name());
        piece->setDetailedName(image->segment() == HTSegmentLinkEdit ? std::string("rtld shared cache")
                                                                     : image->ownerPath());
        piece->setSegment(image->segment());
        if (writable && !measure(piece, info)) return false;
        regions.push_back(piece);
        cursor = pieceEnd;
        image = next;
    }
    return true;
}

kern_return_t HTSharedCacheSlicer::measurePiece(const std::shared_ptr<HTMemoryRegion>& region,
                                                const HTPageRunWalker& walker)
{
    HTMemoryRegion& piece = *region;
    HT_ASSERT(kModule, piece.dirtySize() == 0, "piece.dirtySize() == 0");
    HT_ASSERT(kModule, piece.swappedSize() == 0, "piece.swappedSize() == 0");
    const uint64_t page = pageSize_;
    const uint64_t start = piece.start();
    const uint64_t end = piece.end();
    const uint64_t size = piece.size();
    const uint64_t alignedStart = htRoundDown(start, page);
    const uint64_t alignedEnd = htRoundUp(end, page);
    // The piece's bytes in its first page.
    const uint64_t firstPageBytes = std::min(page - (start - alignedStart), size);

    uint64_t dirty = 0;
    uint64_t swapped = 0;
    auto count = [&](int32_t disposition, uint64_t amount) {
        if (countsAsDirty(disposition))
            dirty += amount;
        else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
            swapped += amount;
    };

    uint64_t pages = (alignedEnd - alignedStart) / page;
    uint64_t queryStart = alignedStart;
    // The first page is the last page of the piece before, already queried.
    const bool firstPageCached = alignedStart == cachedDispositionAddress_;
    if (firstPageCached) {
        count(cachedDisposition_, firstPageBytes);
        --pages;
        queryStart += page;
    }

    if (piece.unusedSharedCacheRegion()) {
        // Unused areas are not queried: only their partial pages, shared
        // with a neighbour, hold anything, and the neighbour's query
        // measures them.
        if (firstPageCached) {
            piece.setDirtySize(dirty);
            piece.setSwappedSize(swapped);
        } else if (start % page != 0) {
            HT_FATAL(kModule, "Unused shared cache region has no cache entry for non-page-aligned start address");
        }
        if (end % page != 0 && pages != 0) pendingUnusedSharedRegion_ = region;
        return KERN_SUCCESS;
    }

    const kern_return_t result = walker.enumerateDispositionChunks(
        queryStart, pages, false, [&](const int32_t* dispositions, int32_t, uint64_t filled, uint64_t firstPage) {
            for (uint64_t i = 0; i < filled; ++i) {
                const uint64_t index = firstPage + i;
                const int32_t disposition = dispositions[i];
                const bool partialFirst = index == 0 && !firstPageCached && start % page != 0;
                const bool partialLast = index == pages - 1 && end % page != 0;
                uint64_t amount = page;
                if (partialFirst) {
                    amount = firstPageBytes;
                } else if (partialLast) {
                    amount = end - (alignedEnd - page);
                    HT_ASSERT(kModule, amount <= size, "lastPageBytes <= size");
                }
                count(disposition, amount);

                if (partialFirst && pendingUnusedSharedRegion_) {
                    // The unused piece before this one ends in this page.
                    HTMemoryRegion& pending = *pendingUnusedSharedRegion_;
                    HT_ASSERT(kModule, pending.end() == start, "pending.end() == piece.start()");
                    const uint64_t pendingBytes = pending.end() - htRoundUp(pending.end(), page) + page;
                    HT_ASSERT(kModule, pendingBytes <= pending.size(), "pendingBytes <= pending.size()");
                    if (countsAsDirty(disposition))
                        pending.setDirtySize(pending.dirtySize() + pendingBytes);
                    else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
                        pending.setSwappedSize(pending.swappedSize() + pendingBytes);
                    pendingUnusedSharedRegion_.reset();
                }
                if (partialLast) {
                    // The next piece starts in this page.
                    cachedDispositionAddress_ = alignedEnd - page;
                    cachedDisposition_ = disposition;
                }
            }
        });
    piece.setSwappedSize(swapped);
    piece.setDirtySize(dirty);
    return result;
}
