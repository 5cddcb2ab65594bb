#include "process/HTSnapfileProcess.h"

#include "base/HTAssert.h"
#include "model/HTMemoryRegion.h"
#include "process/HTImage.h"

#include <algorithm>
#include <cstdio>

namespace {

constexpr const char* kModule = "HTSnapfileProcess";

// A byte count of a region record as a page count of the kernel's record.
uint32_t pageCount(uint64_t bytes, uint64_t pageSize)
{
    if (pageSize == 0) return 0;
    return static_cast<uint32_t>(std::min<uint64_t>(bytes / pageSize, UINT32_MAX));
}

uint32_t clampedBytes(uint64_t bytes) { return static_cast<uint32_t>(std::min<uint64_t>(bytes, UINT32_MAX)); }

}  // namespace

HTSnapfileProcess::HTSnapfileProcess(std::shared_ptr<HTPlatform> platform) : HTUserProcess(std::move(platform)) {}

HTSnapfileProcess::~HTSnapfileProcess() = default;

std::shared_ptr<HTSnapfileProcess> HTSnapfileProcess::processWithSnapfile(std::shared_ptr<HTPlatform> platform,
                                                                          const HTSettings& settings,
                                                                          const std::string& path, HTError* error)
{
    std::unique_ptr<HTSnapshotGraph> graph = HTSnapshotGraph::openSnapshotFile(path, error);
    if (!graph) return nullptr;
    return processWithGraph(std::move(platform), settings, std::move(graph), error);
}

std::shared_ptr<HTSnapfileProcess> HTSnapfileProcess::processWithGraph(std::shared_ptr<HTPlatform> platform,
                                                                       const HTSettings& settings,
                                                                       std::unique_ptr<HTSnapshotGraph> graph,
                                                                       HTError* error)
{
    auto process = std::make_shared<HTSnapfileProcess>(std::move(platform));
    HTSettings own = settings;
    // The snapfile was gathered in one analysis mode, and is read in it.
    own.breakDownPhysHeft = graph->snapshotShowsPhysHeft;
    own.snapshotDirectory.clear();
    process->setSettings(own);
    if (!process->_initWithGraph(std::move(graph), error)) return nullptr;
    return process;
}

int HTSnapfileProcess::platformCodeForDescription(const std::string& description)
{
    // Linux first: its descriptions name the machine too ("x86_64").
    if (description.find("Linux") != std::string::npos) return HTPlatformLinux;
    if (description.find("X86-64") != std::string::npos) return 1;
    if (description.find("X86") != std::string::npos) return 0;
    const size_t arm64 = description.find("ARM64");
    if (arm64 != std::string::npos) return description.compare(arm64 + 5, 3, "-32") == 0 ? 4 : 3;
    if (description.find("ARM") != std::string::npos) return 2;
    return -1;
}

bool HTSnapfileProcess::_initWithGraph(std::unique_ptr<HTSnapshotGraph> graph, HTError* error)
{
    graph_ = std::move(graph);
    capture_ = graph_->snapshotCapture;
    // The shared region follows from the platform: without one, the
    // process cannot be walked.
    if (!_setSharedRegionFromPlatform(_platformCode())) {
        if (error)
            *error = HTError(HeftErrorDomain, 2, "Unable to determine platform from memory graph process description");
        return false;
    }
    proc_bsdinfo info{};
    info.pbi_flags = graph_->snapshotIs64Bit ? PROC_FLAG_LP64 : 0;
    info.pbi_pid = static_cast<uint32_t>(graph_->snapshotPid);
    if (!initWithBsdInfo(info)) {
        if (error && !error->description)
            *error = HTError(HeftErrorDomain, 1, "snapfile initialization failed with unknown error");
        return false;
    }
    setDisplayString(name() + " [" + std::to_string(pid()) + "] (snapfile)");
    return true;
}

std::string HTSnapfileProcess::_nameForProcess(const proc_bsdinfo&) { return graph_->snapshotProcessName; }

uint64_t HTSnapfileProcess::_gatherPageSize() { return graph_->snapshotPageSize; }

int HTSnapfileProcess::_platformCode() { return platformCodeForDescription(graph_->snapshotProcessDescription); }

void HTSnapfileProcess::_gatherPhysHeft() { _setPhysHeft(graph_->snapshotPhysHeft, graph_->snapshotPhysHeftPeak); }

// The page tables a live process in the breakdown mode is charged were
// saved with it.
void HTSnapfileProcess::_gatherLedgers()
{
    if (breakDownPhysHeft()) _setPageTableSize(graph_->snapshotPageTableSize);
}

void HTSnapfileProcess::gatherData()
{
    HTUserProcess::gatherData();
    // Every figure is in the regions now.
    graph_->regions.clear();
    graph_->regions.shrink_to_fit();
}

bool HTSnapfileProcess::_canWalkPages() { return currentRegion_ != nullptr && currentRegion_->pages.has_value(); }

bool HTSnapfileProcess::_canIdentifySharedPages() { return graph_->snapshotIdentifiesSharedPages; }

void HTSnapfileProcess::enumerateRegions(const RegionCallback& callback)
{
    const uint64_t page = pageSize();
    std::shared_ptr<HTImage> pending;
    std::vector<std::shared_ptr<HTImage>>& images = _images();
    graph_->enumerateSnapshotRegions([&](const HTSnapshotRegion& record, bool& stop) {
        const bool inShared = _isInSharedRegion(record.address);
        vm_region_submap_info_64 info{};
        info.protection = record.prot;
        info.max_protection = record.maxProt;
        info.inheritance = record.inheritance;
        info.offset = record.offset;
        info.user_tag = record.user_tag;
        // Shared-region records keep their sizes in bytes: the pieces cut
        // from them are measured in bytes.
        auto size = [&](uint64_t bytes) { return inShared ? clampedBytes(bytes) : pageCount(bytes, page); };
        info.pages_resident = size(record.resident_size);
        info.pages_shared_now_private = size(record.shared_now_private_size);
        info.pages_swapped_out = size(record.swapped_out_size);
        info.pages_dirtied = size(record.dirty_size);
        info.pages_reusable = size(record.reusable_size);
        info.ref_count = record.ref_count;
        info.external_pager = record.external_pager;
        info.share_mode = record.share_mode;
        info.is_submap = record.is_submap & 1;
        info.object_id = static_cast<uint32_t>(record.object_id);
        info.user_wired_count = record.user_wired_count;
        info.object_id_full = record.object_id;

        // A record of an image segment makes an image of its own, which the
        // region of the same record is then named after.
        if (!pending) pending = std::make_shared<HTImage>();
        pending->setName(record.type);
        if (pending->segment() != HTSegmentNotSet) {
            pending->setStart(record.address);
            pending->setSize(record.length);
            pending->setOwnerPath(record.path);
            images.push_back(std::move(pending));
        }

        std::optional<std::string> path;
        if (record.external_pager != 0 && !record.path.empty()) path = record.path;
        currentRegion_ = &record;
        stop = callback(record.address, record.length, info, record.purgeable, path);
        currentRegion_ = nullptr;
    });
}

kern_return_t HTSnapfileProcess::_readPages(uint64_t start, uint64_t pages, bool identify,
                                            const HTPageRunWalker::PageChunkCallback& chunk)
{
    if (!_canWalkPages()) return KERN_SUCCESS;
    const uint64_t page = pageSize();
    const uint64_t recordStart = currentRegion_->address / page * page;
    if (start < recordStart) return KERN_SUCCESS;
    // Runs are counted from the record's first page, the pages asked for
    // from `start`.
    const uint64_t skipped = (start - recordStart) / page;
    int32_t dispositions[HTPageRunWalker::kDispositionChunkPages];
    uint64_t identities[HTPageRunWalker::kDispositionChunkPages];
    for (const HTSnapshotPageRun& run : *currentRegion_->pages) {
        if (run.firstPage + run.count <= skipped) continue;
        const uint64_t first = std::max(run.firstPage, skipped) - skipped;
        if (first >= pages) break;
        const uint64_t count = std::min(run.firstPage + run.count - skipped, pages) - first;
        // Pages whose identities are not used count as this process's own.
        if (!identify || run.identity == 0 || ignoresPageIdentities_) {
            chunk(HTPageRunWalker::PageChunk{nullptr, run.disposition, count, first, nullptr});
            continue;
        }
        // Identified pages go page by page, as the live query gave them.
        const uint64_t firstIdentity = run.identity + (first + skipped - run.firstPage);
        for (uint64_t done = 0; done < count; done += HTPageRunWalker::kDispositionChunkPages) {
            const uint64_t n = std::min(count - done, HTPageRunWalker::kDispositionChunkPages);
            for (uint64_t i = 0; i < n; ++i) {
                dispositions[i] = run.disposition;
                identities[i] = firstIdentity + done + i;
            }
            chunk(HTPageRunWalker::PageChunk{dispositions, 0, n, first + done, identities});
        }
    }
    return KERN_SUCCESS;
}

bool HTSnapfileProcess::_populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                                             const vm_region_submap_info_64& info)
{
    HT_ASSERT(kModule, region->dirtySize() == 0, "memoryRegion.dirtySize == 0");
    HT_ASSERT(kModule, region->swappedSize() == 0, "memoryRegion.swappedSize == 0");
    // A shared-region record keeps bytes in its page counts.
    region->setDirtySize(info.pages_dirtied);
    region->setSwappedSize(info.pages_swapped_out);
    return true;
}
