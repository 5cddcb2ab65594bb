#include "platform/linux/HTLiveThread.h"

#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"

#include <cerrno>
#include <dirent.h>
#include <fcntl.h>

namespace {

// Reads and parses the stat file of the thread behind the directory; false
// with errno when it cannot be read. The record's name points into a
// per-thread buffer that the next call reuses.
bool readThreadStat(int threadDir, std::optional<HTProcStat>& stat)
{
    thread_local HTProcBuffer buffer;
    if (!buffer.readFile(threadDir, "stat", HTProcBuffer::End::ShortRead)) return false;
    stat = htParseProcStat(buffer.view());
    return true;
}

// Whether the thread behind the directory still runs.
bool threadLives(int threadDir)
{
    std::optional<HTProcStat> stat;
    return readThreadStat(threadDir, stat) && stat && !stat->hasExited();
}

}  // namespace

HTFileDescriptor htOpenLiveThreadDirectory(int processDir)
{
    HTDirectoryListing listing =
        htListDirectory(HTFileDescriptor(::openat(processDir, "task", O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
    if (!listing) {
        if (errno == ENOENT) errno = ESRCH;
        return HTFileDescriptor();
    }
    // A thread that ends while it is looked at is simply passed over; any
    // other failure (out of descriptors) is the answer.
    int error = ESRCH;
    while (dirent* entry = ::readdir(listing.get())) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        HTFileDescriptor thread(::openat(::dirfd(listing.get()), entry->d_name, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!thread.isOpen() && errno != ENOENT && errno != ESRCH) {
            error = errno;
            break;
        }
        if (thread.isOpen() && threadLives(thread.get())) return thread;
    }
    errno = error;
    return HTFileDescriptor();
}

bool htThreadHasExited(int dirfd)
{
    std::optional<HTProcStat> stat;
    if (!readThreadStat(dirfd, stat)) return htMeansGone(errno);
    return !stat || stat->hasExited();
}
