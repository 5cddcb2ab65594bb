#include "platform/linux/HTLinuxTaskPort.h"

#include <unistd.h>

HTLinuxTaskPort::HTLinuxTaskPort(int32_t pid, int procDirFd, int pidFd)
    : pid_(pid), procDirFd_(procDirFd), pidFd_(pidFd)
{
}

HTLinuxTaskPort::~HTLinuxTaskPort()
{
    if (procDirFd_ >= 0) ::close(procDirFd_);
    if (pidFd_ >= 0) ::close(pidFd_);
}
