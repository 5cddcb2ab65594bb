#include "process/HTPageRunWalker.h"

#include "base/HTMix.h"
#include "model/HTMemoryRegion.h"
#include "model/HTSubrangeBuilder.h"

#include <algorithm>
#include <vector>

namespace {

// Identities heft derives for regions of its own keep to the namespaces of
// the platform's: the top bit for a file's pages, the top two bits 01 for
// anonymous memory.
constexpr uint64_t kFileIdentityBit = uint64_t{1} << 63;
constexpr uint64_t kAnonymousIdentityBit = uint64_t{1} << 62;
constexpr uint64_t kIdentityNamespaceBits = uint64_t{3} << 62;

// A 64-bit mix of two values, for identities derived from another.
uint64_t mixIdentity(uint64_t id, uint64_t salt) { return htMix(id ^ (salt * 0x9e3779b97f4a7c15ULL)); }

}  // namespace

HTPageKind HTPageRunWalker::pageKind(int32_t disposition, int32_t purgeState)
{
    if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) return HTPageKind::Swapped;
    if (disposition & VM_PAGE_QUERY_PAGE_DIRTY) return HTPageKind::Dirty;
    // A volatile object may lose any present page; elsewhere only pages
    // marked reusable can be taken back.
    int32_t reclaimableBit =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    if (disposition & reclaimableBit) return HTPageKind::Reclaimable;
    if (disposition & VM_PAGE_QUERY_PAGE_PRESENT) return HTPageKind::Clean;
    return HTPageKind::None;
}

kern_return_t HTPageRunWalker::enumerateDispositionChunks(uint64_t start, uint64_t pages, bool populatedOnly,
                                                          const DispositionChunkCallback& block) const
{
    if (pages == 0) return KERN_SUCCESS;
    const uint64_t page = pageSize_;
    const uint64_t end = start + pages * page;
    thread_local std::vector<HTPageRun> runs;
    if (populatedOnly)
        platform_.populatedRuns(task_, start, end, runs);
    else
        runs.assign(1, HTPageRun{start, end, 0});

    int32_t dispositions[kDispositionChunkPages];
    for (const HTPageRun& run : runs) {
        const uint64_t from = std::max(start, htRoundDown(run.start, page));
        const uint64_t to = std::min(end, htRoundUp(run.end, page));
        if (run.disposition != 0 && from < to) {
            block(nullptr, run.disposition, (to - from) / page, (from - start) / page);
            continue;
        }
        for (uint64_t address = from; address < to; address += kDispositionChunkPages * page) {
            const uint64_t wanted = std::min((to - address) / page, kDispositionChunkPages);
            uint64_t count = wanted;
            kern_return_t result =
                platform_.mach_vm_page_range_query(task_, address, wanted * page, dispositions, &count);
            if (result != KERN_SUCCESS) return result;
            block(dispositions, 0, std::min(count, wanted), (address - start) / page);
        }
    }
    return KERN_SUCCESS;
}

kern_return_t HTPageRunWalker::readPages(uint64_t start, uint64_t pages, bool identify,
                                         const PageChunkCallback& chunk) const
{
    uint64_t identities[kDispositionChunkPages];
    return enumerateDispositionChunks(
        start, pages, true, [&](const int32_t* dispositions, int32_t uniform, uint64_t filled, uint64_t first) {
            const bool named = identify && dispositions != nullptr &&
                platform_.sharedPageIdentities(task_, start + first * pageSize_, filled, identities) == KERN_SUCCESS;
            chunk(PageChunk{dispositions, uniform, filled, first, named ? identities : nullptr});
        });
}

kern_return_t HTPageRunWalker::walkPages(const HTMemoryRegion& region, const PageTargets& targets, int32_t purgeState,
                                         uint64_t page, const PageReader& reader)
{
    const uint64_t from = htRoundDown(region.start(), page);
    const uint64_t pages = (htRoundUp(region.end(), page) - from) / page;
    HTSharedPageList* list = targets.identify && targets.pages ? &targets.pages->makeSharedPageList() : nullptr;
    HTSubrangeBuilder runs(list ? nullptr : targets.pages, page);
    HTSubrangeBuilder fileRuns(targets.filePages, page);
    const bool separateCopies = targets.filePages != nullptr || targets.copiesOnly;
    // Hands one page, or a run of pages of one disposition, to its target.
    // A uniform run is one the reader knows to hold no page another process
    // maps privately: its pages have no identity.
    auto addRun = [&](uint64_t first, uint64_t count, int32_t disposition, const uint64_t* identity) {
        const HTPageKind kind = pageKind(disposition, purgeState);
        if (kind == HTPageKind::None) return;
        // In a private file mapping the file's own pages and the mapping's
        // copies belong to different objects.
        if (separateCopies && (disposition & VM_PAGE_QUERY_PAGE_COPIED) == 0) {
            fileRuns.addRun(targets.filePages ? targets.filePages->offset() + first * page : 0, count * page, kind);
        } else if (list && identity == nullptr) {
            // A run without identities goes in whole, however many pages.
            list->addUnidentifiedPages(static_cast<uint32_t>(first), static_cast<uint32_t>(count), kind);
        } else if (list) {
            for (uint64_t index = first; index < first + count; ++index)
                list->addPage(static_cast<uint32_t>(index), kind, *identity);
        } else {
            // Pages whose target is null are left out, as the file's are above.
            runs.addRun(targets.pages ? targets.pages->offset() + first * page : 0, count * page, kind);
        }
    };

    return reader(from, pages, list != nullptr, [&](const PageChunk& chunk) {
        if (chunk.dispositions == nullptr) {
            addRun(chunk.firstPage, chunk.count, chunk.uniform, nullptr);
            return;
        }
        for (uint64_t i = 0; i < chunk.count; ++i)
            addRun(chunk.firstPage + i, 1, chunk.dispositions[i], chunk.identities ? &chunk.identities[i] : nullptr);
    });
}

uint64_t HTPageRunWalker::fileSegmentIdentity(uint64_t objectId, uint64_t offset)
{
    return mixIdentity(objectId, offset) | kFileIdentityBit;
}

std::shared_ptr<HTMemoryRegion> HTPageRunWalker::splitCopiedPages(HTMemoryRegion& region,
                                                                  const vm_region_submap_info_64& info,
                                                                  uint64_t pageSize, int32_t pid)
{
    const uint64_t copied = pageSize * info.pages_shared_now_private;
    const uint64_t swapped = region.swappedSize();
    if (copied == 0 && swapped == 0) return nullptr;

    auto copies = std::make_shared<HTMemoryRegion>();
    copies->setStart(region.start());
    copies->setSize(region.size());
    copies->setUser_tag(region.user_tag());
    copies->setShare_mode(region.share_mode());
    copies->setWired(region.wired());
    copies->setSegment(region.segment());
    copies->setName(region.name());
    copies->setDetailedName(region.detailedName());
    // Copies are anonymous memory of this mapping in this process; pages
    // still shared after a fork are told apart by their identities.
    const uint64_t id = mixIdentity(mixIdentity(region.object_id(), region.start()), static_cast<uint32_t>(pid));
    copies->setObject_id((id & ~kIdentityNamespaceBits) | kAnonymousIdentityBit);

    // Every page swapped out is a copy (file pages go back to their file);
    // copies are dirty first, and at most what the mapping holds.
    const uint64_t dirty = std::min(copied, region.dirtySize());
    const uint64_t reclaimable = std::min(region.reclaimableSize(), copied - dirty);
    const uint64_t clean = std::min(region.cleanNonSpecSize(), copied - dirty - reclaimable);
    copies->setDirtySize(dirty);
    copies->setReclaimableSize(reclaimable);
    copies->setCleanNonSpecSize(clean);
    copies->setSwappedSize(swapped);
    region.setDirtySize(region.dirtySize() - dirty);
    region.setReclaimableSize(region.reclaimableSize() - reclaimable);
    region.setCleanNonSpecSize(region.cleanNonSpecSize() - clean);
    region.setSwappedSize(0);
    return copies;
}
