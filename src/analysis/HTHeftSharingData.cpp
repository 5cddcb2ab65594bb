#include "analysis/HTHeftSharingData.h"

#include "model/HTMemoryObject.h"
#include "process/HTProcessGroup.h"

void HTProcessGroupOrderedSet::insertAtFront(const std::shared_ptr<HTProcessGroup>& group)
{
    if (!index_.insert(group.get()).second) return;
    groups_.insert(groups_.begin(), group);
}

void HTProcessGroupOrderedSet::append(const std::shared_ptr<HTProcessGroup>& group)
{
    if (!index_.insert(group.get()).second) return;
    groups_.push_back(group);
}

const HTProcessGroupObjectMap::ObjectSet* HTProcessGroupObjectMap::find(const HTProcessGroup& group) const
{
    auto found = index_.find(&group);
    return found == index_.end() ? nullptr : &entries_[found->second].second;
}

HTProcessGroupObjectMap::ObjectSet&
HTProcessGroupObjectMap::objectsForGroup(const std::shared_ptr<HTProcessGroup>& group)
{
    auto [found, inserted] = index_.emplace(group.get(), entries_.size());
    if (inserted) entries_.emplace_back(group, ObjectSet{});
    return entries_[found->second].second;
}
