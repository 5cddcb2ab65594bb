#include "analysis/HTHeft.h"

#include "analysis/HTHeftSharingData.h"
#include "analysis/HTMemoryObjectMap.h"
#include "analysis/HTProcessGroup.h"
#include "analysis/HTSharedPageResolver.h"
#include "base/HTAssert.h"
#include "base/HTMix.h"
#include "base/HTPointerIndex.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryCategory.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "output/HTOutputFormatter.h"
#include "platform/HTSignalSource.h"
#include "platform/HTWorkQueue.h"
#include "process/HTProcess.h"
#include "process/HTUserProcess.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <span>
#include <string>
#include <unordered_map>
#include <unordered_set>

namespace {

enum : int { SwitchUnknown = 0, SwitchOff = 1, SwitchOn = 2 };

// Read from gathering threads after a write from the main thread: every
// reader computes the same answer, so a relaxed atomic suffices.
std::atomic<int> breakDownPhysHeftState{SwitchUnknown};
std::atomic<bool> sharingAnalysisDisabled{false};

constexpr const char* kSelfRegionHeft = "vm.self_region_heft";

}  // namespace

bool HTHeft::breakDownPhysHeft(HTPlatform& platform)
{
    int state = breakDownPhysHeftState.load(std::memory_order_relaxed);
    if (state != SwitchUnknown) return state == SwitchOn;

    int32_t value = 0;
    size_t length = sizeof(value);
    if (platform.sysctlbyname(kSelfRegionHeft, &value, &length, nullptr, 0) != 0) {
        if (errno != ENOENT) std::perror("Unable to retrieve status of physical heft data collection");
        value = 0;
    }
    state = value != 0 ? SwitchOn : SwitchOff;
    breakDownPhysHeftState.store(state, std::memory_order_relaxed);
    return state == SwitchOn;
}

void HTHeft::setBreakDownPhysHeft(HTPlatform& platform, bool enabled)
{
    int32_t value = enabled ? 1 : 0;
    if (platform.sysctlbyname(kSelfRegionHeft, nullptr, nullptr, &value, sizeof(value)) != 0 && errno != ENOENT)
        std::perror("Unable to configure physical heft data collection");
    // The next read asks the kernel what it really holds.
    breakDownPhysHeftState.store(SwitchUnknown, std::memory_order_relaxed);
}

bool HTHeft::isSharingAnalysisDisabled() { return sharingAnalysisDisabled.load(std::memory_order_relaxed); }

void HTHeft::setSharingAnalysisDisabled(bool disabled)
{
    sharingAnalysisDisabled.store(disabled, std::memory_order_relaxed);
}

// --- setting up --------------------------------------------------------------

namespace {

constexpr uint64_t kAllOnes = UINT64_MAX;
// Capacity hints of the object maps: most objects are ordinary ones, a
// process maps one __TEXT and one __LINKEDIT object per image, and the
// shared cache is cut into a few hundred pieces at most.
constexpr size_t kObjectsPerProcess = 100;
constexpr size_t kImageObjectsPerProcess = 2;
constexpr size_t kSharedCache64Capacity = 512;

// The key under which an object is filed in a category map. An object whose
// representative region carries no name still holds memory that the table
// and its total must show, so it is filed under one fixed key rather than
// left out; an empty key would look like a real, blank name. A full name is
// built in `storage`; a short name is the region's own.
std::string_view categoryKey(const HTMemoryObject& object, bool summarize, std::optional<std::string>& storage)
{
    if (summarize) {
        const std::optional<std::string>& name = object.name();
        return name ? std::string_view(*name) : "unknown";
    }
    storage = object.fullName();
    return storage ? std::string_view(*storage) : "unknown";
}

// The category of the key, created with `segment` when absent.
HTMemoryCategory& categoryFor(HTCategoryMap& categories, std::string_view key, uint8_t segment, bool summarize)
{
    if (HTMemoryCategory* found = categories.find(key)) return *found;
    auto made = std::make_shared<HTMemoryCategory>(segment, summarize);
    HTMemoryCategory& category = *made;
    categories.add(std::string(key), std::move(made));
    return category;
}

}  // namespace

HTHeft::HTHeft(ProcessList processes, std::shared_ptr<HTPlatform> platform)
    : platform_(std::move(platform)), processes_(std::move(processes))
{
    const size_t count = processes_.size();
    memoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kObjectsPerProcess);
    sharedCache64MemoryObjects_ = std::make_unique<HTMemoryObjectMap>(kSharedCache64Capacity);
    sharedCache32MemoryObjects_ = std::make_unique<HTMemoryObjectMap>();
    textMemoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kImageObjectsPerProcess);
    linkeditMemoryObjects_ = std::make_unique<HTMemoryObjectMap>(count * kImageObjectsPerProcess);
}

HTHeft::~HTHeft() = default;

std::unique_ptr<HTSignalSource> HTHeft::installCancelHandler(HTPlatform& platform, std::function<void()> callback)
{
    // On a terminal Ctrl-C ends the program at once, as the user expects;
    // with the report going elsewhere it stops the gathering instead, and
    // the report of what was gathered still follows.
    if (platform.isatty(1)) return nullptr;
    return HTSignalSource::create(SIGINT, std::move(callback));
}

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
    HT_ASSERT("HTHeft", memoryObjects_ != nullptr, "_memoryObjects");
    HTProcess& process = *processPointer;
    const bool sharingDisabled = isSharingAnalysisDisabled();
    const bool breakDown = breakDownPhysHeft(*platform_);
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
            object->addRegion(region, process);
        if (breakDown && region->ownedExclusivelyByParentProcess()) object->setOwnerPid(process.pid());
        region->setMemoryObject(object);
    }
}

void HTHeft::finalizeObjects()
{
    const bool breakDown = breakDownPhysHeft(*platform_);
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
    if (breakDownPhysHeft(*platform_)) {
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

HTCategoryMap HTHeft::_categoriesForObjects(const ObjectSet& objects, HTProcess& process, bool* hasProcessView,
                                            bool summarize)
{
    const bool breakDown = breakDownPhysHeft(*platform_);
    HTCategoryMap categories;
    bool ownView = false;
    std::optional<std::string> keyStorage;
    for (const auto& object : objects) {
        const uint8_t segment =
            object->memoryRegions().empty() ? HTSegmentNotSet : object->memoryRegions().front()->segment();
        HTMemoryCategory& category =
            categoryFor(categories, categoryKey(*object, summarize, keyStorage), segment, summarize);
        std::shared_ptr<HTMemoryObject> view = object->viewForProcess(process, breakDown);
        if (view != object) ownView = true;
        category.addMemoryObject(view);
    }
    if (hasProcessView) *hasProcessView = ownView;
    return categories;
}

HTCategoryMap HTHeft::_categoriesForAllProcessesShouldSummarize(bool summarize)
{
    HTCategoryMap categories;
    HTPointerIndex seen;
    std::optional<std::string> keyStorage;
    for (const auto& process : processes_) {
        if (process->hiddenFromDisplay()) continue;
        for (const auto& region : process->memoryRegions()) {
            std::shared_ptr<HTMemoryObject> object = region->memoryObject();
            if (!object || !seen.insert(object.get()).second) continue;
            categoryFor(categories, categoryKey(*object, summarize, keyStorage), region->segment(), summarize)
                .addMemoryObject(object);
        }
    }
    return categories;
}

void HTHeft::_totalForCategories(const HTCategoryMap& categories, HTMemoryTotals* outTotal)
{
    HTMemoryTotals total;
    for (const auto& [key, category] : categories) {
        total.dirty += category->totalDirtySize();
        total.swapped += category->totalSwappedSize();
        total.clean += category->totalCleanSize();
        total.reclaimable += category->totalReclaimableSize();
        total.wired += category->totalWiredSize();
        total.regions += static_cast<uint32_t>(category->totalRegions());
    }
    *outTotal = total;
}

// --- sharing analysis --------------------------------------------------------

namespace {

constexpr uint32_t kNoProcess = UINT32_MAX;

// The objects that reported processes map, in the order first met, and the
// processes that map each: those of objects[i] are mappers[first[i]] up to
// mappers[first[i + 1]], as indices into the process list, in list order,
// each once.
struct ObjectMappers {
    HTHeft::ObjectList objects;
    std::vector<uint32_t> first;
    std::vector<uint32_t> mappers;

    std::span<const uint32_t> of(size_t object) const
    {
        return {mappers.data() + first[object], mappers.data() + first[object + 1]};
    }
};

// The distinct sets of mappers as frozen groups, numbered in the order first
// met, and the number of each object's set.
struct MapperGroups {
    std::vector<std::shared_ptr<HTProcessGroup>> groups;
    std::vector<uint32_t> groupOf;
};

// Whether a hidden process's mapping of `object` is of interest: only where
// it maps memory that a reported process owns and that exists beyond any
// mapping.
bool hiddenMappingCounts(const HTMemoryObject& object, const std::unordered_set<int32_t>& visiblePids)
{
    return object.ownerPid() != -1 && visiblePids.count(object.ownerPid()) != 0 && object.containsFakeRegion();
}

ObjectMappers objectMappers(const HTHeft::ProcessList& processes)
{
    std::unordered_set<int32_t> visiblePids;
    size_t regionCount = 0;
    for (const auto& process : processes) {
        if (!process->hiddenFromDisplay()) visiblePids.insert(process->pid());
        regionCount += process->memoryRegions().size();
    }

    ObjectMappers result;
    HTPointerIndex numbers(regionCount / 2);
    std::vector<uint32_t> lastMapper;
    std::vector<std::pair<uint32_t, uint32_t>> mappings;  // object, process
    mappings.reserve(regionCount);
    for (uint32_t index = 0; index < processes.size(); ++index) {
        const HTProcess& process = *processes[index];
        const bool hidden = process.hiddenFromDisplay();
        for (const auto& region : process.memoryRegions()) {
            std::shared_ptr<HTMemoryObject> object = region->memoryObject();
            if (!object || (hidden && !hiddenMappingCounts(*object, visiblePids))) continue;
            auto [number, isNew] = numbers.insert(object.get());
            if (isNew) {
                result.objects.push_back(std::move(object));
                lastMapper.push_back(kNoProcess);
            }
            // A process's regions come one after another, so a process that
            // maps an object again is the one that mapped it last.
            if (lastMapper[number] == index) continue;
            lastMapper[number] = index;
            mappings.emplace_back(number, index);
        }
    }

    // The mappings by object, each object's in process order: a counting sort.
    result.first.assign(result.objects.size() + 1, 0);
    for (const auto& mapping : mappings) ++result.first[mapping.first + 1];
    for (size_t i = 1; i < result.first.size(); ++i) result.first[i] += result.first[i - 1];
    result.mappers.resize(mappings.size());
    std::vector<uint32_t> next(result.first.begin(), result.first.end() - 1);
    for (const auto& [object, process] : mappings) result.mappers[next[object]++] = process;
    return result;
}

uint64_t hashOfMappers(std::span<const uint32_t> mappers)
{
    uint64_t hash = mappers.size();
    for (uint32_t index : mappers) hash = htMix(hash + index);
    return hash;
}

MapperGroups mapperGroups(const ObjectMappers& mappers, const HTHeft::ProcessList& processes)
{
    MapperGroups result;
    result.groupOf.resize(mappers.objects.size());
    std::vector<uint32_t> example;  // an object of each group
    std::unordered_map<uint64_t, std::vector<uint32_t>> groupsByHash;
    for (uint32_t object = 0; object < mappers.objects.size(); ++object) {
        const std::span<const uint32_t> members = mappers.of(object);
        std::vector<uint32_t>& candidates = groupsByHash[hashOfMappers(members)];
        auto same = std::find_if(candidates.begin(), candidates.end(), [&](uint32_t group) {
            return std::ranges::equal(mappers.of(example[group]), members);
        });
        if (same != candidates.end()) {
            result.groupOf[object] = *same;
            continue;
        }
        const auto number = static_cast<uint32_t>(result.groups.size());
        auto group = std::make_shared<HTProcessGroup>();
        for (uint32_t index : members) group->addProcess(processes[index]);
        group->freeze();
        result.groups.push_back(std::move(group));
        example.push_back(object);
        candidates.push_back(number);
        result.groupOf[object] = number;
    }
    return result;
}

}  // namespace

std::unique_ptr<HTHeftSharingData> HTHeft::_sharingData()
{
    // Each object with the set of processes that map it, in the order the
    // objects are first met, so that the report is the same run after run;
    // one frozen group per distinct set.
    ObjectMappers mappers = objectMappers(processes_);
    const MapperGroups grouped = mapperGroups(mappers, processes_);
    std::vector<std::vector<uint32_t>> objectsOfGroup(grouped.groups.size());
    for (uint32_t object = 0; object < mappers.objects.size(); ++object)
        objectsOfGroup[grouped.groupOf[object]].push_back(object);

    // Groups are numbered in the order their first object was met, and are
    // stored and announced to their members in that order.
    HTHeftSharingData::ProcessToProcessGroups processToProcessGroups;
    HTProcessGroupObjectMap processGroupToObjects;
    for (size_t number = 0; number < grouped.groups.size(); ++number) {
        const std::shared_ptr<HTProcessGroup>& group = grouped.groups[number];
        ObjectSet& objects = processGroupToObjects.objectsForGroup(group);
        for (uint32_t object : objectsOfGroup[number]) objects.append(std::move(mappers.objects[object]));

        const bool isPrivate = group->count() == 1;
        for (const auto& member : group->processes()) {
            HTProcessGroupOrderedSet* groups = processToProcessGroups.find(member->pid());
            if (!groups) {
                processToProcessGroups.set(member->pid(), HTProcessGroupOrderedSet());
                groups = processToProcessGroups.find(member->pid());
            }
            // A process's private group leads its list.
            if (isPrivate)
                groups->insertAtFront(group);
            else
                groups->append(group);
        }
    }
    return std::make_unique<HTHeftSharingData>(std::move(processToProcessGroups), std::move(processGroupToObjects));
}

// --- the report --------------------------------------------------------------

const HTHeft::GroupTable& HTHeft::tableForGroup(const HTProcessGroup& group, const ObjectSet& objects,
                                                HTProcess& process, bool summarize, CommonTables& common,
                                                GroupTable& scratch)
{
    GroupTable* table = &scratch;
    if (group.count() > 1) {
        // Every member of a shared group prints its table: where they all
        // see the same, it is made once.
        auto found = common.find(&group);
        if (found != common.end()) return found->second;
        if (std::all_of(objects.begin(), objects.end(),
                        [](const auto& object) { return object->looksTheSameToEveryProcess(); }))
            table = &common[&group];
    }
    table->categories = _categoriesForObjects(objects, process, &table->hasProcessView, summarize);
    _totalForCategories(table->categories, &table->total);
    return *table;
}

void HTHeft::printSpanlistLikeOutputForProcesses(const ProcessList& processes)
{
    FormatterList listing;
    for (const auto& formatter : outputFormatters_)
        if (formatter->respondsToSpanlistLikeOutput()) listing.push_back(formatter);
    if (listing.empty()) return;
    for (const auto& process : processes)
        for (const auto& formatter : listing)
            formatter->printSpanlistLikeOutputForProcess(*process, process->memoryRegions());
}

void HTHeft::printOutputVerbose(bool verbose, bool summarize)
{
    const ProcessList reported = _processesBySortingHeft(_notHiddenProcesses());
    if (verbose) printSpanlistLikeOutputForProcesses(reported);

    const std::unique_ptr<HTHeftSharingData> sharing = _sharingData();
    // From here on the sharing result holds every object a reported process
    // maps; objects that only hidden processes map go with the maps.
    releaseMemoryObjectMaps();

    ProcessList processesWithWarnings;
    ProcessList processesWithErrors;
    std::shared_ptr<HTAuxDataMap> mergedAuxData;
    CommonTables commonTables;
    GroupTable scratchTable;

    for (const auto& process : reported) {
        const bool hasErrors = !process->errors().empty();
        const std::shared_ptr<HTAuxDataMap> auxData = process->auxData();
        if (!process->warnings().empty()) processesWithWarnings.push_back(process);
        if (hasErrors)
            processesWithErrors.push_back(process);
        else if (auxData)
            mergedAuxData = auxData->mergeWithData(mergedAuxData);

        const uint64_t* heft = pidToHeft_.find(process->pid());
        for (const auto& formatter : outputFormatters_) {
            formatter->printProcessHeader(*process);
            if (!hasErrors) formatter->printProcessTotal(heft ? *heft : 0, *process);
            formatter->endProcessHeader(*process);
        }

        const HTProcessGroupOrderedSet* groups =
            hasErrors ? nullptr : sharing->processToProcessGroups().find(process->pid());
        if (groups) {
            for (const auto& group : *groups) {
                static const ObjectSet kNoObjects;
                const ObjectSet* objects = sharing->processGroupToObjects().find(*group);
                const GroupTable& table = tableForGroup(*group, objects ? *objects : kNoObjects, *process, summarize,
                                                        commonTables, scratchTable);
                for (const auto& formatter : outputFormatters_) {
                    if (group->count() == 1)
                        formatter->printProcessCategories(table.categories, table.total);
                    else
                        formatter->printSharedCategories(table.categories, *group, *process, table.hasProcessView,
                                                         table.total);
                }
            }
        } else {
            const HTCategoryMap noCategories;
            const HTMemoryTotals zero;
            for (const auto& formatter : outputFormatters_) formatter->printProcessCategories(noCategories, zero);
        }

        for (const auto& formatter : outputFormatters_) formatter->printProcessAuxData(auxData);
    }

    const std::vector<std::string> globalErrors = HTProcess::globalErrors();
    for (const auto& formatter : outputFormatters_)
        formatter->printProcessesWithWarnings(processesWithWarnings, processesWithErrors, globalErrors);

    const HTCategoryMap summary = _categoriesForAllProcessesShouldSummarize(summarize);
    HTMemoryTotals summaryTotal;
    _totalForCategories(summary, &summaryTotal);
    const bool hadErrors = !globalErrors.empty() || !processesWithErrors.empty();
    for (const auto& formatter : outputFormatters_) {
        formatter->printSummaryCategories(summary, summaryTotal, hadErrors);
        formatter->printGlobalAuxData(mergedAuxData);
        formatter->end();
    }
}
