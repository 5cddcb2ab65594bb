#include "platform/linux/HTLiveThread.h"

#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

namespace {

// Whether the thread behind the directory still runs.
bool threadLives(int threadDir)
{
    thread_local HTProcBuffer buffer;
    if (!buffer.readFile(threadDir, "stat", HTProcBuffer::End::ShortRead)) return false;
    std::optional<HTProcStat> stat = htParseProcStat(buffer.view());
    return stat && !stat->hasExited();
}

}  // namespace

int htOpenLiveThreadDirectory(int processDir)
{
    int tasks = ::openat(processDir, "task", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    DIR* listing = tasks < 0 ? nullptr : ::fdopendir(tasks);
    if (listing == nullptr) {
        if (tasks >= 0) ::close(tasks);
        if (errno == ENOENT) errno = ESRCH;
        return -1;
    }
    int found = -1;
    // A thread that ends while it is looked at is simply passed over; any
    // other failure (out of descriptors) is the answer.
    int error = ESRCH;
    while (dirent* entry = ::readdir(listing)) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        int thread = ::openat(::dirfd(listing), entry->d_name, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        if (thread < 0 && errno != ENOENT && errno != ESRCH) {
            error = errno;
            break;
        }
        if (thread < 0) continue;
        if (threadLives(thread)) {
            found = thread;
            break;
        }
        ::close(thread);
    }
    ::closedir(listing);
    if (found < 0) errno = error;
    return found;
}
