#pragma once

// A process source whose gathering produces regions a test or benchmark
// wrote down beforehand. Header-only so that the benchmarks can use it too.

#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "process/HTProcess.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

// One region as a test writes it down; sizes in bytes.
struct HTScriptedRegion {
    uint64_t objectId = 0;
    uint64_t offset = 0;
    uint64_t size = 4096;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint8_t shareMode = SM_SHARED;
    uint8_t segment = HTSegmentNoImage;
    std::optional<std::string> name = std::string("region");
    std::optional<std::string> detailedName{};
    bool inSharedCache = false;
    uint64_t start = 0;
    bool owned = false;  // ownedExclusivelyByParentProcess
    bool fake = false;   // owned memory that is not mapped
    bool wired = false;
    uint64_t reclaimable = 0;
};

class HTScriptedProcess : public HTProcess {
public:
    HTScriptedProcess(std::shared_ptr<HTPlatform> platform, int32_t pid, std::vector<HTScriptedRegion> script,
                      bool is64bit = true)
        : HTProcess(std::move(platform)), script_(std::move(script))
    {
        setPid(pid);
        setIs64bit(is64bit);
        setName("proc" + std::to_string(pid));
        setDisplayString(name() + " [" + std::to_string(pid) + "]");
        setPageSize(4096);
    }

    void gatherData() override
    {
        std::vector<std::shared_ptr<HTMemoryRegion>> regions;
        for (const HTScriptedRegion& line : script_) {
            auto region = std::make_shared<HTMemoryRegion>();
            region->setObject_id(line.objectId);
            region->setOffset(line.offset);
            region->setStart(line.fake ? HTNoAddress : line.start);
            region->setSize(line.size);
            region->setDirtySize(line.dirty);
            region->setSwappedSize(line.swapped);
            region->setCleanNonSpecSize(line.clean);
            region->setShare_mode(line.shareMode);
            region->setSegment(line.segment);
            region->setName(line.name);
            region->setDetailedName(line.detailedName);
            region->setInSharedCache(line.inSharedCache);
            region->setOwnedExclusivelyByParentProcess(line.owned);
            region->setWired(line.wired);
            region->setReclaimableSize(line.reclaimable);
            if (line.fake) region->setUser_tag(HTFakeRegionTag);
            regions.push_back(region);
        }
        setMemoryRegions(std::move(regions));
        gatherCount_.fetch_add(1, std::memory_order_relaxed);
    }

    std::vector<HTScriptedRegion>& script() { return script_; }
    int gatherCount() const { return gatherCount_.load(std::memory_order_relaxed); }
    std::shared_ptr<HTAuxDataMap> auxData() override { return auxData_; }
    void setAuxData(std::shared_ptr<HTAuxDataMap> data) { auxData_ = std::move(data); }
    void scriptError(std::string error) { addError(std::move(error)); }

private:
    std::vector<HTScriptedRegion> script_;
    std::shared_ptr<HTAuxDataMap> auxData_;
    std::atomic<int> gatherCount_{0};
};
