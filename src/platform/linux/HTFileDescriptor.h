#pragma once

// The one owner of a file descriptor: closed when the owner goes, with
// errno kept as it was, so that a failure read just before the close still
// says what went wrong.

#include <cerrno>
#include <dirent.h>
#include <memory>
#include <unistd.h>
#include <utility>

class HTFileDescriptor {
public:
    HTFileDescriptor() = default;
    explicit HTFileDescriptor(int fd) : fd_(fd) {}
    ~HTFileDescriptor() { reset(); }
    HTFileDescriptor(HTFileDescriptor&& other) noexcept : fd_(other.release()) {}
    HTFileDescriptor& operator=(HTFileDescriptor&& other) noexcept
    {
        if (this != &other) reset(other.release());
        return *this;
    }
    HTFileDescriptor(const HTFileDescriptor&) = delete;
    HTFileDescriptor& operator=(const HTFileDescriptor&) = delete;

    int get() const { return fd_; }
    bool isOpen() const { return fd_ >= 0; }
    // Gives the descriptor up without closing it.
    int release() { return std::exchange(fd_, -1); }
    // Closes the descriptor held, if any, and takes `fd`.
    void reset(int fd = -1)
    {
        if (fd_ >= 0) {
            int savedErrno = errno;
            ::close(fd_);
            errno = savedErrno;
        }
        fd_ = fd;
    }

private:
    int fd_ = -1;
};

// A directory listing, closed (errno kept) when its owner goes.
struct HTDirectoryCloser {
    void operator()(DIR* dir) const
    {
        int savedErrno = errno;
        ::closedir(dir);
        errno = savedErrno;
    }
};
using HTDirectoryListing = std::unique_ptr<DIR, HTDirectoryCloser>;

// A listing of the open directory `fd`, which it then owns; null with errno
// (and `fd` closed) when it cannot be made.
inline HTDirectoryListing htListDirectory(HTFileDescriptor fd)
{
    if (!fd.isOpen()) return nullptr;
    DIR* dir = ::fdopendir(fd.get());
    if (dir == nullptr) return nullptr;
    fd.release();
    return HTDirectoryListing(dir);
}
