#pragma once

#include "base/HTPidMap.h"
#include "base/HTSettings.h"
#include "model/HTIdentitySet.h"
#include "model/HTMemoryTotals.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <vector>

class HTMemoryObject;
class HTMemoryObjectMap;
class HTOutputFormatter;
class HTProcess;

// The analysis driver. It gathers every target process's regions in
// parallel, routes every region to the memory object behind it so that
// memory mapped by several regions or processes counts once, finalises the
// objects, computes each process's heft, and hands the report to
// HTHeftReport, which feeds the attached formatters; HTSharingAnalysis
// groups the objects by the processes that map them.
//
// An instance gathers once and prints once, on one thread; only cancel()
// may be called from another thread.
class HTHeft {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;
    using ObjectList = std::vector<std::shared_ptr<HTMemoryObject>>;
    using ObjectSet = HTIdentitySet<HTMemoryObject>;
    using FormatterList = std::vector<std::shared_ptr<HTOutputFormatter>>;

    // The label of the gathering threads.
    static constexpr const char* kGatherQueueLabel = "heft.gatherdata";
    static constexpr const char* kEarlyExitError =
        "Heft exited early due to SIGINT and did not finish gathering all data";
    // Said once on standard error when a reported process may share memory
    // after a fork and its pages could not be told apart (without root).
    static constexpr const char* kUnidentifiedSharedPagesNotice =
        "Memory shared after fork may be counted more than once: telling its pages apart needs root";

    // The targets, in the order given; that order is kept for routing. The
    // settings are those the processes were made with.
    HTHeft(ProcessList processes, const HTSettings& settings);
    ~HTHeft();
    HTHeft(const HTHeft&) = delete;
    HTHeft& operator=(const HTHeft&) = delete;

    const HTSettings& settings() const { return settings_; }
    const ProcessList& processes() const { return processes_; }
    // The heft of every visible process, filled by gatherData.
    const HTPidMap<uint64_t>& pidToHeft() const { return pidToHeft_; }

    // The object maps, null once the report has released them: ordinary
    // regions by VM object id; shared cache regions of 64-bit and of 32-bit
    // processes by start address; image __TEXT and __LINKEDIT segments by
    // VM object id.
    const HTMemoryObjectMap* memoryObjects() const { return memoryObjects_.get(); }
    const HTMemoryObjectMap* sharedCache64MemoryObjects() const { return sharedCache64MemoryObjects_.get(); }
    const HTMemoryObjectMap* sharedCache32MemoryObjects() const { return sharedCache32MemoryObjects_.get(); }
    const HTMemoryObjectMap* textMemoryObjects() const { return textMemoryObjects_.get(); }
    const HTMemoryObjectMap* linkeditMemoryObjects() const { return linkeditMemoryObjects_.get(); }
    // Objects of one region each, never looked up.
    const ObjectList& uniqueMemoryObjects() const { return uniqueMemoryObjects_; }

    const FormatterList& outputFormatters() const { return outputFormatters_; }
    void addOutputFormatter(std::shared_ptr<HTOutputFormatter> formatter);
    // Lets go of the output formatters, which finish and close their files.
    void finishOutput() { outputFormatters_.clear(); }

    // Makes gathering skip the processes it has not begun. Safe to call from
    // any thread, at any time.
    void cancel() { earlyExit_.store(true, std::memory_order_relaxed); }
    bool earlyExit() const { return earlyExit_.load(std::memory_order_relaxed); }

    // Gathers every process's data in parallel, largest pid first, then
    // routes the regions, finalises the objects and computes the hefts.
    // Called once.
    void gatherData();
    // The steps after the gathering, for processes gathered one by one
    // beforehand (each at its own exit). Called once, instead of
    // gatherData.
    void analyzeGatheredData();
    // Finalises every memory object once.
    void finalizeObjects();

    // Sends the report to every formatter. With `verbose`, every process's
    // region listing comes first; with `summarize`, categories are keyed by
    // short names. Called once, after gatherData: it releases the object
    // maps.
    void printOutputVerbose(bool verbose, bool summarize);

protected:
    // Routes every region of the process to its memory object.
    void _addProcess(const std::shared_ptr<HTProcess>& process);

    // Dirty plus swapped bytes charged to the process.
    uint64_t _calculateHeftForProcess(HTProcess& process);
    void _buildProcessToHeftMap();

    // The processes that are reported, in the order given.
    ProcessList _notHiddenProcesses() const;
    static ProcessList _processesBySortingPidDesc(const ProcessList& processes);
    // Largest heft first; equal hefts larger pid first.
    ProcessList _processesBySortingHeft(const ProcessList& processes) const;

private:
    void releaseMemoryObjectMaps();
    void reportUnidentifiedSharedPages() const;

    HTSettings settings_;
    ProcessList processes_;
    HTPidMap<uint64_t> pidToHeft_;
    std::unique_ptr<HTMemoryObjectMap> memoryObjects_;
    std::unique_ptr<HTMemoryObjectMap> sharedCache64MemoryObjects_;
    std::unique_ptr<HTMemoryObjectMap> sharedCache32MemoryObjects_;
    std::unique_ptr<HTMemoryObjectMap> textMemoryObjects_;
    std::unique_ptr<HTMemoryObjectMap> linkeditMemoryObjects_;
    ObjectList uniqueMemoryObjects_;
    FormatterList outputFormatters_;
    std::atomic<bool> earlyExit_{false};
};
