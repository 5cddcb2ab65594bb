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

    // How a file ends. Most /proc files come in pieces of a page or so, each
    // read returning less than asked, and end only with a read of 0 bytes.
    // The small files written whole by one call (stat, status, cmdline)
    // hand over everything they hold in the first read that has room: a
    // short read is their end, which spares a system call per file.
    enum class End { EmptyRead, ShortRead };

    // Reads the file at `path` relative to the directory `dirfd` (or an
    // absolute path). False with errno set when it cannot be opened or read;
    // the contents are then empty.
    bool readFile(int dirfd, const char* path, End end = End::EmptyRead);
    // Reads everything from an open descriptor, which stays open.
    bool readDescriptor(int fd, End end = End::EmptyRead);

    std::string_view view() const { return std::string_view(data_.get(), size_); }
    size_t size() const { return size_; }
    size_t capacity() const { return capacity_; }

private:
    void grow(size_t minimum);

    std::unique_ptr<char[]> data_;
    size_t capacity_ = 0;
    size_t size_ = 0;
};
