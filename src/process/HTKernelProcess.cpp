#include "process/HTKernelProcess.h"

HTKernelProcess::HTKernelProcess(std::shared_ptr<HTPlatform> platform) : HTProcess(std::move(platform)) {}

HTKernelProcess::~HTKernelProcess() = default;

bool HTKernelProcess::initWithBsdInfo(const proc_bsdinfo& info)
{
    if (!HTProcess::initWithBsdInfo(info)) return false;
    setIdleExitStatus(HTIdleExitStatusNotControlled);
    return true;
}

bool HTKernelProcess::_populateTask() { return true; }

bool HTKernelProcess::_isAlive() { return true; }
