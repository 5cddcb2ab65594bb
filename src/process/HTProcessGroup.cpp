#include "process/HTProcessGroup.h"

#include "base/HTAssert.h"
#include "process/HTProcess.h"

#include <algorithm>

namespace {

// Below this many members a linear scan of the pids beats a hash look-up.
constexpr size_t kIndexedGroupSize = 16;

}  // namespace

bool HTProcessGroup::containsPid(int32_t pid) const
{
    if (pidIndex_) return pidIndex_->count(pid) != 0;
    return std::find(pids_.begin(), pids_.end(), pid) != pids_.end();
}

void HTProcessGroup::addProcess(const std::shared_ptr<HTProcess>& process)
{
    HT_ASSERT("HTProcessGroup", !immutable_, "!_immutable");
    const int32_t pid = process->pid();
    if (containsPid(pid)) return;

    hashValue_ = (hashValue_ * 37) ^ static_cast<uint64_t>(static_cast<int64_t>(pid));
    processes_.push_back(process);
    pids_.push_back(pid);
    if (pidIndex_) {
        pidIndex_->insert(pid);
    } else if (pids_.size() > kIndexedGroupSize) {
        pidIndex_ = std::make_unique<std::unordered_set<int32_t>>(pids_.begin(), pids_.end());
    }
}

bool HTProcessGroup::isEqual(const HTProcessGroup& other) const
{
    if (other.immutable_) {
        HT_ASSERT("HTProcessGroup", immutable_, "self->_immutable");
        return this == &other;
    }
    if (pids_.size() != other.pids_.size()) return false;
    for (int32_t pid : other.pids_)
        if (!containsPid(pid)) return false;
    return true;
}

std::shared_ptr<HTProcessGroup> HTProcessGroup::copy(const std::shared_ptr<HTProcessGroup>& group)
{
    HT_ASSERT("HTProcessGroup", group->immutable_, "_immutable");
    return group;
}

std::string HTProcessGroup::description() const
{
    std::string text = "HTProcessGroup{";
    for (size_t i = 0; i < processes_.size(); ++i) {
        if (i > 0) text += ", ";
        text += processes_[i]->description();
    }
    text += "}";
    return text;
}
