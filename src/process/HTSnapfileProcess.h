#pragma once

#include "base/HTError.h"
#include "platform/HTSnapshotGraph.h"
#include "process/HTUserProcess.h"

#include <memory>
#include <string>

// A process read from a snapfile rather than from the kernel: the walk, the
// naming and the accounting of a live process, with every figure taken
// from the saved snapshot graph. Where the snapfile holds the page runs
// that the saving run's page queries found, the pages are walked again
// from them, so that the analysis sees what it saw live.
class HTSnapfileProcess : public HTUserProcess {
public:
    explicit HTSnapfileProcess(std::shared_ptr<HTPlatform> platform);
    ~HTSnapfileProcess() override;

    // The process saved in the file at `path`, or null with `error` saying
    // why it cannot be read. `settings` are the run's; the analysis mode
    // comes from the file.
    static std::shared_ptr<HTSnapfileProcess> processWithSnapfile(std::shared_ptr<HTPlatform> platform,
                                                                  const HTSettings& settings, const std::string& path,
                                                                  HTError* error);
    // The same for a graph already opened.
    static std::shared_ptr<HTSnapfileProcess> processWithGraph(std::shared_ptr<HTPlatform> platform,
                                                               const HTSettings& settings,
                                                               std::unique_ptr<HTSnapshotGraph> graph, HTError* error);

    // The platform code a snapshot's process description names; -1 for
    // none.
    static int platformCodeForDescription(const std::string& description);

    // The run that saved the snapfile.
    const std::string& capture() const { return capture_; }
    // Pages shared after a fork are compared only between snapfiles of one
    // capture; this leaves this snapfile's page identities unused.
    void setIgnoresPageIdentities(bool value) { ignoresPageIdentities_ = value; }

    // --- replaced steps of a live process ------------------------------
    std::string _nameForProcess(const proc_bsdinfo& info) override;
    bool _populateTask() override { return true; }
    bool _isAlive() override { return false; }
    uint64_t _gatherPageSize() override;
    void gatherData() override;
    void enumerateRegions(const RegionCallback& callback) override;

protected:
    int _platformCode() override;
    bool _canWalkPages() override;
    bool _canIdentifySharedPages() override;
    kern_return_t _readPages(uint64_t start, uint64_t pages, bool identify,
                             const HTPageRunWalker::PageChunkCallback& chunk) override;
    bool _populateMemoryRegionWithPageQueries(const std::shared_ptr<HTMemoryRegion>& region,
                                              const vm_region_submap_info_64& info) override;
    void _gatherImageData() override {}
    void _gatherPhysHeft() override;
    void _gatherLedgers() override;
    std::optional<HTOwnedVmObjectMap> _gatherOwnedVmObjects() override { return std::nullopt; }
    // A snapfile's process is under no idle-exit control that heft knows.
    void _gatherIdleExitStatus() override {}

private:
    bool _initWithGraph(std::unique_ptr<HTSnapshotGraph> graph, HTError* error);

    std::unique_ptr<HTSnapshotGraph> graph_;
    std::string capture_;
    // The record of the region being walked.
    const HTSnapshotRegion* currentRegion_ = nullptr;
    bool ignoresPageIdentities_ = false;
};
