#pragma once

// A process source whose gathering produces regions a test or benchmark
// wrote down beforehand, and a variant that waits at a gate before it
// gathers. Header-only so that the benchmarks can use it too.

#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "process/HTProcess.h"

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
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
        regions.reserve(script_.size());
        for (const HTScriptedRegion& line : script_) regions.push_back(makeRegion(line));
        setMemoryRegions(std::move(regions));
        gatherCount_.fetch_add(1, std::memory_order_relaxed);
    }

    int gatherCount() const { return gatherCount_.load(std::memory_order_relaxed); }

    std::shared_ptr<HTAuxDataMap> auxData() override { return auxData_; }
    void setAuxData(std::shared_ptr<HTAuxDataMap> data) { auxData_ = std::move(data); }
    void scriptError(std::string error) { addError(std::move(error)); }
    void scriptWarning(std::string warning) { warnings().push_back(std::move(warning)); }

    static std::shared_ptr<HTMemoryRegion> makeRegion(const HTScriptedRegion& line)
    {
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
        if (line.fake) region->setUser_tag(HTFakeRegionTag);
        return region;
    }

private:
    std::vector<HTScriptedRegion> script_;
    std::shared_ptr<HTAuxDataMap> auxData_;
    std::atomic<int> gatherCount_{0};
};

// A gate that scripted processes wait at until someone opens it.
class HTGate {
public:
    void open()
    {
        std::lock_guard<std::mutex> lock(mutex_);
        open_ = true;
        opened_.notify_all();
    }
    void wait()
    {
        std::unique_lock<std::mutex> lock(mutex_);
        opened_.wait(lock, [this] { return open_; });
    }
    // False when the gate stayed shut for `timeout`.
    template<typename Duration>
    bool waitFor(Duration timeout)
    {
        std::unique_lock<std::mutex> lock(mutex_);
        return opened_.wait_for(lock, timeout, [this] { return open_; });
    }

private:
    std::mutex mutex_;
    std::condition_variable opened_;
    bool open_ = false;
};

// Gathers only once the gate opens; `onEntry`, if set, runs first.
class HTGatedProcess : public HTScriptedProcess {
public:
    HTGatedProcess(std::shared_ptr<HTPlatform> platform, int32_t pid, std::vector<HTScriptedRegion> script,
                   std::shared_ptr<HTGate> gate, std::function<void()> onEntry = nullptr)
        : HTScriptedProcess(std::move(platform), pid, std::move(script)),
          gate_(std::move(gate)),
          onEntry_(std::move(onEntry))
    {
    }

    void gatherData() override
    {
        if (onEntry_) onEntry_();
        gate_->wait();
        HTScriptedProcess::gatherData();
    }

private:
    std::shared_ptr<HTGate> gate_;
    std::function<void()> onEntry_;
};
