#pragma once

#include "process/HTProcess.h"

#include <cstdint>
#include <memory>

// A live user-space process, read through its task port.
class HTUserProcess : public HTProcess {
public:
    explicit HTUserProcess(std::shared_ptr<HTPlatform> platform);
    ~HTUserProcess() override;

    // The base steps, then the idle-exit status.
    bool initWithBsdInfo(const proc_bsdinfo& info) override;

    // Opens the task port; on failure reports it on standard error and in
    // the global error list, and the process is not created.
    bool _populateTask() override;
    bool _isAlive() override;

    // Null until _populateTask succeeded.
    const std::shared_ptr<HTTaskPort>& task() const { return task_; }

protected:
    virtual void _gatherIdleExitStatus();
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

private:
    std::shared_ptr<HTTaskPort> task_;
};
