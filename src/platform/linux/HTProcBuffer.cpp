#include "platform/linux/HTProcBuffer.h"

#include "platform/linux/HTFileDescriptor.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace {
constexpr size_t kInitialCapacity = 4096;
}

void HTProcBuffer::grow(size_t minimum)
{
    size_t capacity = capacity_ == 0 ? kInitialCapacity : capacity_;
    while (capacity < minimum) capacity *= 2;
    if (capacity == capacity_) return;
    std::unique_ptr<char[]> data(new char[capacity]);
    if (size_ != 0) std::memcpy(data.get(), data_.get(), size_);
    data_ = std::move(data);
    capacity_ = capacity;
}

bool HTProcBuffer::readDescriptor(int fd, End end)
{
    size_ = 0;
    grow(kInitialCapacity);
    for (;;) {
        if (size_ == capacity_) grow(capacity_ * 2);
        size_t room = capacity_ - size_;
        ssize_t count = ::read(fd, data_.get() + size_, room);
        if (count < 0) {
            if (errno == EINTR) continue;
            size_ = 0;
            return false;
        }
        if (count == 0) return true;
        size_ += static_cast<size_t>(count);
        if (end == End::ShortRead && static_cast<size_t>(count) < room) return true;
    }
}

bool HTProcBuffer::readFile(int dirfd, const char* path, End end)
{
    size_ = 0;
    HTFileDescriptor fd(::openat(dirfd, path, O_RDONLY | O_CLOEXEC));
    return fd.isOpen() && readDescriptor(fd.get(), end);
}
