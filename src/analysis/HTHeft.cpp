#include "analysis/HTHeft.h"

#include "analysis/HTHeftReport.h"
#include "analysis/HTHeftSharingData.h"
#include "analysis/HTMemoryObjectMap.h"
#include "analysis/HTSharedPageResolver.h"
#include "analysis/HTSharingAnalysis.h"
#include "base/HTAssert.h"
#include "base/HTPointerIndex.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "output/HTOutputFormatter.h"
#include "platform/HTWorkQueue.h"
#include "process/HTProcess.h"
#include "process/HTUserProcess.h"

#include <algorithm>
#include <cstdio>

// --- setting up --------------------------------------------------------------

namespace {

constexpr uint64_t kAllOnes = UINT64_MAX;
// Capacity hints of the object maps: most objects are ordinary ones, a
// process maps one __TEXT and one __LINKEDIT object per image, and the
// shared cache is cut into a few hundred pieces at most.
constexpr size_t kObjectsPerProcess = 100;
constexpr size_t kImageObjectsPerProcess = 2;
constexpr size_t kSharedCache64Capacity = 512;

}  // namespace

HTHeft::HTHeft(ProcessList processes, const HTSettings& settings)
    : settings_(settings), processes_(std::move(processes))
{
    const size_t count = processes_.size();
    memoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kObjectsPerProcess);
    sharedCache64MemoryObjects_ = std::make_unique<HTMemoryObjectMap>(kSharedCache64Capacity);
    sharedCache32MemoryObjects_ = std::make_unique<HTMemoryObjectMap>();
    textMemoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kImageObjectsPerProcess);
    linkeditMemoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kImageObjectsPerProcess);
}

HTHeft::~HTHeft() = default;

void HTHeft::addOutputFormatter(std::shared_ptr<HTOutputFormatter> formatter)
{
    outputFormatters_.push_back(std::move(formatter));
}

// --- gathering and routing ---------------------------------------------------

void HTHeft::gatherData()
{
    // Largest pid first; the routing below keeps the order given.
    const ProcessList sorted = _processesBySortingPidDesc(processes_);
    {
        const unsigned threads =
            static_cast<unsigned>(std::clamp<size_t>(sorted.size(), 1, HTWorkQueue::defaultThreadCount()));
        HTWorkQueue queue(kGatherQueueLabel, threads);
        queue.parallelFor(sorted.size(), [this, &sorted](size_t index) {
            // A process whose gathering has begun finishes; the rest are
            // skipped once the run is cancelled.
            if (earlyExit()) return;
            sorted[index]->gatherData();
        });
    }

    if (earlyExit()) HTProcess::_addGlobalError(kEarlyExitError);
    analyzeGatheredData();
}

void HTHeft::analyzeGatheredData()
{
    // Pages that processes share after a fork become objects of their own
    // before anything is routed.
    HTSharedPageResolver(processes_).resolve();
    reportUnidentifiedSharedPages();

    // Processes skipped by cancellation are routed too, with whatever
    // regions they have.
    for (const auto& process : processes_) _addProcess(process);
    finalizeObjects();
    _buildProcessToHeftMap();
}

void HTHeft::reportUnidentifiedSharedPages() const
{
    for (const auto& process : processes_) {
        const auto* user = dynamic_cast<const HTUserProcess*>(process.get());
        if (user && !user->hiddenFromDisplay() && user->sharedPagesUnidentified()) {
            std::fprintf(stderr, "%s\n", kUnidentifiedSharedPagesNotice);
            return;
        }
    }
}

void HTHeft::_addProcess(const std::shared_ptr<HTProcess>& processPointer)
{
    HT_ASSERT("HTHeft", memoryObjects_ != nullptr, "memoryObjects_ != nullptr");
    HTProcess& process = *processPointer;
    const bool sharingDisabled = settings_.sharingAnalysisDisabled;
    const bool breakDown = settings_.breakDownPhysHeft;
    const uint64_t pidBits = static_cast<uint64_t>(static_cast<uint32_t>(process.pid())) << 32;

    for (const auto& region : process.memoryRegions()) {
        uint64_t key;
        HTMemoryObjectMap* map;
        if (region->inSharedCache()) {
            // Shared cache pieces are told apart by address, and the 32-bit
            // and 64-bit caches are different mappings.
            key = region->start();
            map = process.is64bit() ? sharedCache64MemoryObjects_.get() : sharedCache32MemoryObjects_.get();
        } else {
            key = region->object_id();
            if (region->segment() == HTSegmentText)
                map = textMemoryObjects_.get();
            else if (region->segment() == HTSegmentLinkEdit)
                map = linkeditMemoryObjects_.get();
            else
                map = memoryObjects_.get();
        }

        // Copy-on-write memory that a process has touched is that process's
        // own copy: the pid in the high half keeps it apart from the others'.
        if (key != kAllOnes && region->share_mode() == SM_COW &&
            (region->dirtySize() != 0 || region->swappedSize() != 0))
            key ^= pidBits;

        std::shared_ptr<HTMemoryObject> object;
        if (key == 0 || key == kAllOnes) {
            // No identity to share by.
            object = std::make_shared<HTMemoryObject>();
            uniqueMemoryObjects_.push_back(object);
        } else {
            object = map->objectForKey(key);
        }

        if (sharingDisabled)
            object->addRegion(region, process.pageSize());
        else
            object->addRegion(region, process.pageSize(), process.pid());
        if (breakDown && region->ownedExclusivelyByParentProcess()) object->setOwnerPid(process.pid());
        region->setMemoryObject(object);
    }
}

void HTHeft::finalizeObjects()
{
    const bool breakDown = settings_.breakDownPhysHeft;
    auto finalizeMap = [breakDown](const std::unique_ptr<HTMemoryObjectMap>& map) {
        if (!map) return;
        for (const auto& entry : *map) entry.second->finalize(breakDown);
    };
    finalizeMap(memoryObjects_);
    finalizeMap(sharedCache32MemoryObjects_);
    finalizeMap(sharedCache64MemoryObjects_);
    for (const auto& object : uniqueMemoryObjects_) object->finalize(breakDown);
    finalizeMap(textMemoryObjects_);
    finalizeMap(linkeditMemoryObjects_);
}

void HTHeft::releaseMemoryObjectMaps()
{
    memoryObjects_.reset();
    sharedCache64MemoryObjects_.reset();
    sharedCache32MemoryObjects_.reset();
    textMemoryObjects_.reset();
    linkeditMemoryObjects_.reset();
    uniqueMemoryObjects_.clear();
    uniqueMemoryObjects_.shrink_to_fit();
}

// --- heft, categories and orders -------------------------------------------

uint64_t HTHeft::_calculateHeftForProcess(HTProcess& process)
{
    uint64_t heft = 0;
    if (settings_.breakDownPhysHeft) {
        // The kernel's per-region figures already say what this process is
        // charged, region by region.
        for (const auto& region : process.memoryRegions()) heft += region->dirtySize() + region->swappedSize();
        return heft;
    }
    // Each object counts once and whole: memory shared with others counts
    // in full in each of their hefts.
    HTPointerIndex seen(process.memoryRegions().size());
    for (const auto& region : process.memoryRegions()) {
        std::shared_ptr<HTMemoryObject> object = region->memoryObject();
        if (!object || !seen.insert(object.get()).second) continue;
        heft += object->totalDirtySize() + object->totalSwappedSize();
    }
    return heft;
}

void HTHeft::_buildProcessToHeftMap()
{
    pidToHeft_.clear();
    for (const auto& process : processes_)
        if (!process->hiddenFromDisplay()) pidToHeft_.set(process->pid(), _calculateHeftForProcess(*process));
}

HTHeft::ProcessList HTHeft::_notHiddenProcesses() const
{
    ProcessList visible;
    visible.reserve(processes_.size());
    for (const auto& process : processes_)
        if (!process->hiddenFromDisplay()) visible.push_back(process);
    return visible;
}

HTHeft::ProcessList HTHeft::_processesBySortingPidDesc(const ProcessList& processes)
{
    ProcessList sorted = processes;
    std::stable_sort(sorted.begin(), sorted.end(), [](const auto& a, const auto& b) { return a->pid() > b->pid(); });
    return sorted;
}

HTHeft::ProcessList HTHeft::_processesBySortingHeft(const ProcessList& processes) const
{
    struct Ranked {
        uint64_t heft;
        std::shared_ptr<HTProcess> process;
    };
    std::vector<Ranked> ranked;
    ranked.reserve(processes.size());
    for (const auto& process : processes) {
        const uint64_t* heft = pidToHeft_.find(process->pid());
        ranked.push_back({heft ? *heft : 0, process});
    }
    std::stable_sort(ranked.begin(), ranked.end(), [](const Ranked& a, const Ranked& b) {
        if (a.heft != b.heft) return a.heft > b.heft;
        return a.process->pid() > b.process->pid();
    });
    ProcessList sorted;
    sorted.reserve(ranked.size());
    for (auto& entry : ranked) sorted.push_back(std::move(entry.process));
    return sorted;
}

// --- the report --------------------------------------------------------------

void HTHeft::printOutputVerbose(bool verbose, bool summarize)
{
    HTHeftReport report(outputFormatters_, pidToHeft_, settings_.breakDownPhysHeft, summarize);
    const ProcessList reported = _processesBySortingHeft(_notHiddenProcesses());
    if (verbose) report.printSpanlistLikeOutputForProcesses(reported);

    const std::unique_ptr<HTHeftSharingData> sharing = HTSharingAnalysis::sharingDataForProcesses(processes_);
    // From here on the sharing result holds every object a reported process
    // maps; objects that only hidden processes map go with the maps.
    releaseMemoryObjectMaps();
    report.printReport(reported, *sharing, processes_);
}
