#include "process/HTUserProcess.h"

#include <cstdio>

HTUserProcess::HTUserProcess(std::shared_ptr<HTPlatform> platform) : HTProcess(std::move(platform)) {}

HTUserProcess::~HTUserProcess() = default;

bool HTUserProcess::initWithBsdInfo(const proc_bsdinfo& info)
{
    if (!HTProcess::initWithBsdInfo(info)) return false;
    _gatherIdleExitStatus();
    return true;
}

bool HTUserProcess::_populateTask()
{
    kern_return_t result = platform().task_for_pid(pid(), &task_);
    if (result == KERN_SUCCESS) return true;
    task_.reset();
    platform().mach_error("task_for_pid", result);
    char message[512];
    std::snprintf(message, sizeof(message), "task_for_pid [%d] %s", pid(),
                  platform().mach_error_string(result).c_str());
    _addGlobalError(message);
    return false;
}

bool HTUserProcess::_isAlive()
{
    return true;
}

void HTUserProcess::_gatherIdleExitStatus()
{
    // A process whose flags cannot be read is not under idle-exit control.
    uint32_t flags = 0;
    if (platform().proc_get_dirty(pid(), &flags) != 0) flags = 0;
    _setIdleExitStatusFromDirtyFlags(flags);
}

void HTUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags)
{
    constexpr uint32_t controlled = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & controlled) != controlled)
        setIdleExitStatus(HTIdleExitStatusNotControlled);
    else if (flags & PROC_DIRTY_IS_DIRTY)
        setIdleExitStatus(HTIdleExitStatusDirty);
    else
        setIdleExitStatus(HTIdleExitStatusClean);
}
