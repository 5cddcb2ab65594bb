#pragma once

#include "base/HTPidMap.h"
#include "model/HTIdentitySet.h"

#include <cstddef>
#include <memory>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

class HTMemoryObject;
class HTProcessGroup;

// The groups one process belongs to, each once (by identity), in order:
// its private group first when it has one, then its shared groups.
class HTProcessGroupOrderedSet {
public:
    using const_iterator = std::vector<std::shared_ptr<HTProcessGroup>>::const_iterator;

    // Both ignore a group that is already present, wherever it stands.
    void insertAtFront(const std::shared_ptr<HTProcessGroup>& group);
    void append(const std::shared_ptr<HTProcessGroup>& group);

    bool contains(const HTProcessGroup* group) const { return index_.count(group) != 0; }
    size_t size() const { return groups_.size(); }
    bool empty() const { return groups_.empty(); }
    const std::shared_ptr<HTProcessGroup>& operator[](size_t i) const { return groups_[i]; }
    const_iterator begin() const { return groups_.begin(); }
    const_iterator end() const { return groups_.end(); }

private:
    std::vector<std::shared_ptr<HTProcessGroup>> groups_;
    std::unordered_set<const HTProcessGroup*> index_;
};

// For each frozen group, the memory objects whose set of mapping processes
// is exactly that group. Groups are keys by identity and iterate in the
// order they were first stored.
class HTProcessGroupObjectMap {
public:
    using ObjectSet = HTIdentitySet<HTMemoryObject>;
    using Entry = std::pair<std::shared_ptr<HTProcessGroup>, ObjectSet>;

    // The objects of the group, or null.
    const ObjectSet* find(const HTProcessGroup& group) const;
    // The objects of the group, an empty set stored when it has none yet.
    ObjectSet& objectsForGroup(const std::shared_ptr<HTProcessGroup>& group);

    size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    std::vector<Entry>::const_iterator begin() const { return entries_.begin(); }
    std::vector<Entry>::const_iterator end() const { return entries_.end(); }

private:
    std::vector<Entry> entries_;
    std::unordered_map<const HTProcessGroup*, size_t> index_;
};

// The result of the sharing analysis: the groups of each process (under its
// pid) and the objects of each group. Every group in it is frozen, and no
// two of its groups have the same members.
class HTHeftSharingData {
public:
    using ProcessToProcessGroups = HTPidMap<HTProcessGroupOrderedSet>;

    HTHeftSharingData() = default;
    HTHeftSharingData(ProcessToProcessGroups processToProcessGroups, HTProcessGroupObjectMap processGroupToObjects)
        : processToProcessGroups_(std::move(processToProcessGroups)),
          processGroupToObjects_(std::move(processGroupToObjects))
    {
    }

    const ProcessToProcessGroups& processToProcessGroups() const { return processToProcessGroups_; }
    const HTProcessGroupObjectMap& processGroupToObjects() const { return processGroupToObjects_; }

private:
    ProcessToProcessGroups processToProcessGroups_;
    HTProcessGroupObjectMap processGroupToObjects_;
};
