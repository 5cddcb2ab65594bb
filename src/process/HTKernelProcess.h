#pragma once

#include "process/HTProcess.h"

#include <memory>

// The kernel, presented as a process so that its own memory shows up
// beside the user processes. It has no task port and is always readable.
class HTKernelProcess : public HTProcess {
public:
    explicit HTKernelProcess(std::shared_ptr<HTPlatform> platform);
    ~HTKernelProcess() override;

    // The base steps; the kernel is never under idle-exit control.
    bool initWithBsdInfo(const proc_bsdinfo& info) override;
    bool _populateTask() override;
    bool _isAlive() override;
};
