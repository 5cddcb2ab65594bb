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
    HT_ASSERT("HTProcessGroup", !immutable_, "!immutable_");
    const int32_t pid = process->pid();
    if (containsPid(pid)) return;

    processes_.push_back(process);
    pids_.push_back(pid);
    if (pidIndex_) {
        pidIndex_->insert(pid);
    } else if (pids_.size() > kIndexedGroupSize) {
        pidIndex_ = std::make_unique<std::unordered_set<int32_t>>(pids_.begin(), pids_.end());
    }
}
