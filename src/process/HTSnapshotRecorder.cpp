#include "process/HTSnapshotRecorder.h"

#include <cstdio>

void HTSnapshotRecorder::addRegion(uint64_t start, uint64_t size, const vm_region_submap_info_64& info,
                                   int32_t purgeState, const std::string& path, const std::string& type)
{
    HTSnapshotRegion& region = graph_.regions.emplace_back();
    region.address = start;
    region.length = size;
    region.type = type;
    region.path = path;
    region.prot = info.protection;
    region.maxProt = info.max_protection;
    region.offset = info.offset;
    region.user_tag = info.user_tag;
    region.resident_size = pageSize_ * info.pages_resident;
    region.shared_now_private_size = pageSize_ * info.pages_shared_now_private;
    region.swapped_out_size = pageSize_ * info.pages_swapped_out;
    region.dirty_size = pageSize_ * info.pages_dirtied;
    region.reusable_size = pageSize_ * info.pages_reusable;
    region.ref_count = static_cast<uint16_t>(info.ref_count > UINT16_MAX ? UINT16_MAX : info.ref_count);
    region.external_pager = info.external_pager;
    region.share_mode = info.share_mode;
    region.is_submap = info.is_submap;
    region.object_id = info.object_id_full;
    region.purgeable = purgeState;
    region.inheritance = info.inheritance;
    region.user_wired_count = info.user_wired_count;
}

void HTSnapshotRecorder::addPages(const HTPageRunWalker::PageChunk& chunk)
{
    if (graph_.regions.empty()) return;
    if (!graph_.regions.back().pages) graph_.regions.back().pages.emplace();
    if (chunk.dispositions == nullptr) {
        addRun(chunk.firstPage, chunk.count, chunk.uniform, 0);
        return;
    }
    for (uint64_t i = 0; i < chunk.count; ++i)
        addRun(chunk.firstPage + i, 1, chunk.dispositions[i], chunk.identities ? chunk.identities[i] : 0);
}

// Pages in a row of one disposition, whose identities (if any) follow each
// other, are one run: a stretch of memory that a fork shared is mostly of
// consecutive physical pages.
void HTSnapshotRecorder::addRun(uint64_t page, uint64_t count, int32_t disposition, uint64_t identity)
{
    // A page with no disposition holds nothing: the query's answer for an
    // unpopulated page.
    if (disposition == 0) return;
    std::vector<HTSnapshotPageRun>& runs = *graph_.regions.back().pages;
    if (!runs.empty()) {
        HTSnapshotPageRun& last = runs.back();
        const bool follows = last.firstPage + last.count == page && last.disposition == disposition;
        const bool identitiesFollow =
            identity == 0 ? last.identity == 0 : last.identity != 0 && last.identity + last.count == identity;
        if (follows && identitiesFollow) {
            last.count += count;
            return;
        }
    }
    runs.push_back(HTSnapshotPageRun{page, count, disposition, identity});
}

std::string HTSnapshotRecorder::fileName(const std::string& processName, int32_t pid)
{
    std::string name = processName;
    for (char& c : name)
        if (c == '/' || static_cast<unsigned char>(c) < 0x20) c = '_';
    if (name.empty() || name == "." || name == "..") name = "process";
    char suffix[32];
    std::snprintf(suffix, sizeof(suffix), ".%d.heftsnap", pid);
    return name + suffix;
}
