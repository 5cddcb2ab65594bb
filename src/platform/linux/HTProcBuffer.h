#pragma once

// A reusable buffer that holds one whole /proc file. /proc files report a
// size of 0 and are generated as they are read, so the file is read until
// read() answers 0; the buffer grows as needed and keeps its capacity from
// one file to the next, so reading thousands of small files allocates once.

#include <cstddef>
#include <memory>
#include <string_view>

class HTProcBuffer {
public:
    HTProcBuffer() = default;
    HTProcBuffer(const HTProcBuffer&) = delete;
    HTProcBuffer& operator=(const HTProcBuffer&) = delete;

    // Reads the file at `path` relative to the directory `dirfd` (or an
    // absolute path). False with errno set when it cannot be opened or read;
    // the contents are then empty.
    bool readFile(int dirfd, const char* path);
    // Reads everything from an open descriptor, which stays open.
    bool readDescriptor(int fd);

    std::string_view view() const { return std::string_view(data_.get(), size_); }
    size_t size() const { return size_; }
    size_t capacity() const { return capacity_; }

private:
    void grow(size_t minimum);

    std::unique_ptr<char[]> data_;
    size_t capacity_ = 0;
    size_t size_ = 0;
};
