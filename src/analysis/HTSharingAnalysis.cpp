#include "analysis/HTSharingAnalysis.h"

#include "analysis/HTHeftSharingData.h"
#include "base/HTMix.h"
#include "base/HTPointerIndex.h"
#include "model/HTMemoryObject.h"
#include "model/HTMemoryRegion.h"
#include "process/HTProcess.h"
#include "process/HTProcessGroup.h"

#include <algorithm>
#include <span>
#include <unordered_map>
#include <unordered_set>
#include <utility>

namespace {

constexpr uint32_t kNoProcess = UINT32_MAX;

// The objects that reported processes map, in the order first met, and the
// processes that map each: those of objects[i] are mappers[first[i]] up to
// mappers[first[i + 1]], as indices into the process list, in list order,
// each once.
struct ObjectMappers {
    std::vector<std::shared_ptr<HTMemoryObject>> objects;
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

ObjectMappers objectMappers(const HTSharingAnalysis::ProcessList& processes)
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

MapperGroups mapperGroups(const ObjectMappers& mappers, const HTSharingAnalysis::ProcessList& processes)
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

std::unique_ptr<HTHeftSharingData> HTSharingAnalysis::sharingDataForProcesses(const ProcessList& processes)
{
    // Each object with the set of processes that map it, in the order the
    // objects are first met, so that the report is the same run after run;
    // one frozen group per distinct set.
    ObjectMappers mappers = objectMappers(processes);
    const MapperGroups grouped = mapperGroups(mappers, processes);
    std::vector<std::vector<uint32_t>> objectsOfGroup(grouped.groups.size());
    for (uint32_t object = 0; object < mappers.objects.size(); ++object)
        objectsOfGroup[grouped.groupOf[object]].push_back(object);

    // Groups are numbered in the order their first object was met, and are
    // stored and announced to their members in that order.
    HTHeftSharingData::ProcessToProcessGroups processToProcessGroups;
    HTProcessGroupObjectMap processGroupToObjects;
    for (size_t number = 0; number < grouped.groups.size(); ++number) {
        const std::shared_ptr<HTProcessGroup>& group = grouped.groups[number];
        HTProcessGroupObjectMap::ObjectSet& objects = processGroupToObjects.objectsForGroup(group);
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
