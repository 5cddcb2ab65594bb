#include "platform/linux/HTPreadFully.h"

#include <unistd.h>

#include <cerrno>

ssize_t htPreadFully(int fd, void* buffer, size_t length, uint64_t offset)
{
    size_t done = 0;
    while (done < length) {
        ssize_t count =
            ::pread(fd, static_cast<char*>(buffer) + done, length - done, static_cast<off_t>(offset + done));
        if (count < 0) {
            if (errno == EINTR) continue;
            if (done == 0) return -1;
            break;
        }
        if (count == 0) break;
        done += static_cast<size_t>(count);
    }
    return static_cast<ssize_t>(done);
}
