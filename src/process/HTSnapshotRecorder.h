#pragma once

#include "platform/HTPlatform.h"
#include "platform/HTSnapshotGraph.h"
#include "process/HTPageRunWalker.h"

#include <cstdint>
#include <optional>
#include <string>

// Keeps what the walk of a live process found, as the snapshot graph that a
// snapfile saves: each region's record as the kernel gave it and the page
// runs that its page queries answered, so that the snapfile is analysed
// later as the live process was.
class HTSnapshotRecorder {
public:
    explicit HTSnapshotRecorder(uint64_t pageSize) : pageSize_(pageSize) {}

    // Starts the record of the next region of the walk; `type` names the
    // image segment it holds, or its kind.
    void addRegion(uint64_t start, uint64_t size, const vm_region_submap_info_64& info, int32_t purgeState,
                   const std::string& path, const std::string& type);
    // Adds one chunk of the current region's page queries, read from the
    // region's first page.
    void addPages(const HTPageRunWalker::PageChunk& chunk);

    // The graph so far; the caller fills in the process's own fields.
    HTSnapshotGraph& graph() { return graph_; }

    // The file name a process's snapfile gets: "NAME.PID.heftsnap", with
    // the characters a file name cannot hold replaced.
    static std::string fileName(const std::string& processName, int32_t pid);

private:
    void addRun(uint64_t page, uint64_t count, int32_t disposition, uint64_t identity);

    uint64_t pageSize_;
    HTSnapshotGraph graph_;
};
