#pragma once

#include "base/HTError.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// A run of pages of one region as the page queries of the run that saved
// it answered: `count` pages from the region's page `firstPage`, all of
// one disposition; with a non-zero `identity`, page i of the run had the
// shared-page identity identity + i.
struct HTSnapshotPageRun {
    uint64_t firstPage = 0;
    uint64_t count = 0;
    int32_t disposition = 0;
    uint64_t identity = 0;
};

// One region of a snapshot, with the fields of the kernel's region record
// (sizes in bytes) and, where the saving run walked the region's pages,
// the runs it found.
struct HTSnapshotRegion {
    uint64_t address = 0;
    uint64_t length = 0;
    // The segment name of the image the region holds ("__TEXT"), or the
    // region's type.
    std::string type;
    std::string path;
    uint32_t prot = 0;
    uint32_t maxProt = 0;
    uint64_t offset = 0;
    uint32_t user_tag = 0;
    uint64_t resident_size = 0;
    uint64_t shared_now_private_size = 0;
    uint64_t swapped_out_size = 0;
    uint64_t dirty_size = 0;
    uint64_t reusable_size = 0;
    uint16_t ref_count = 0;
    uint8_t external_pager = 0;
    uint8_t share_mode = 0;
    uint32_t is_submap = 0;
    uint64_t object_id = 0;
    int32_t purgeable = 0;
    uint32_t inheritance = 0;
    uint16_t user_wired_count = 0;
    // Runs of populated pages in ascending order; absent when the saving
    // run did not walk the region's pages.
    std::optional<std::vector<HTSnapshotPageRun>> pages;
};

// A saved snapshot of one process's memory: who it was, its figures and its
// regions. openSnapshotGraph reads heft's snapfile format (a JSON document,
// described in docs/snapfile.md) and checks every field, so that whatever
// it returns can be walked without further checks: regions ascend without
// overlapping, sizes fit their regions, page runs fit their regions.
class HTSnapshotGraph {
public:
    // The format's name and the one version this reader knows.
    static constexpr const char* kFormat = "heft snapfile";
    static constexpr uint64_t kVersion = 1;
    // The largest snapfile read: enough for a process of a million regions.
    static constexpr uint64_t kMaxFileSize = uint64_t{1} << 30;
    // The most pages a snapfile may name with identities, and the most its
    // page runs may cover: each identified page costs about 40 bytes when
    // the snapfile is analysed, 64 GiB of such pages (of 4 KiB) some 650 MB.
    static constexpr uint64_t kMaxIdentifiedPages = uint64_t{1} << 24;
    static constexpr uint64_t kMaxRunPages = uint64_t{1} << 28;
    // Error domain and codes of the reader.
    static constexpr const char* kErrorDomain = "HTSnapshotGraph";
    enum : int64_t { ErrorCodeFile = 1, ErrorCodeFormat = 2 };

    // The graph in `contents`, or null with `error` saying what is wrong
    // and where.
    static std::unique_ptr<HTSnapshotGraph> openSnapshotGraph(std::string_view contents, HTError* error);
    // The whole file at `path` read and opened; null with `error` when it
    // cannot be read or is no snapfile.
    static std::unique_ptr<HTSnapshotGraph> openSnapshotFile(const std::string& path, HTError* error);

    // Calls `callback` with each region in address order until it sets its
    // stop flag.
    void enumerateSnapshotRegions(const std::function<void(const HTSnapshotRegion&, bool& stop)>& callback) const;

    // --- the process ------------------------------------------------------
    bool snapshotIs64Bit = false;
    int32_t snapshotPid = 0;
    std::string snapshotProcessName;
    // Names the system and its architecture ("Linux 6.1.0 x86_64").
    std::string snapshotProcessDescription;
    uint32_t snapshotPageSize = 0;
    uint64_t snapshotPhysHeft = 0;
    uint64_t snapshotPhysHeftPeak = 0;
    // The analysis mode of the saving run: per-region heft figures.
    bool snapshotShowsPhysHeft = false;
    // Whether the saving run could identify pages shared after a fork.
    bool snapshotIdentifiesSharedPages = false;
    // The process's page tables, in bytes.
    uint64_t snapshotPageTableSize = 0;
    // The run that saved the snapshot: page identities are comparable only
    // between snapshots of one capture.
    std::string snapshotCapture;
    std::vector<HTSnapshotRegion> regions;
};
