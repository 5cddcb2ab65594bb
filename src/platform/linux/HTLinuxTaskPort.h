#pragma once

#include "platform/HTTaskPort.h"

#include <cstdint>

// A handle on a live Linux process: its /proc/PID directory, through which
// every file of the process is read with openat (so that a recycled pid
// cannot switch the target in the middle of a walk), and a pidfd that
// names the process itself. The handle owns both descriptors.
class HTLinuxTaskPort : public HTTaskPort {
public:
    // Takes ownership of the descriptors; pidFd may be -1 where the kernel
    // has no pidfds.
    HTLinuxTaskPort(int32_t pid, int procDirFd, int pidFd);
    ~HTLinuxTaskPort() override;
    HTLinuxTaskPort(const HTLinuxTaskPort&) = delete;
    HTLinuxTaskPort& operator=(const HTLinuxTaskPort&) = delete;

    int32_t pid() const override { return pid_; }
    int procDirFd() const { return procDirFd_; }
    int pidFd() const { return pidFd_; }

private:
    int32_t pid_;
    int procDirFd_;
    int pidFd_;
};
