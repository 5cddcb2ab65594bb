#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>

// Reads up to `length` bytes at `offset`, retrying short and interrupted
// reads; the bytes read (fewer only at the end of the file), or -1 with
// errno when the first read fails.
ssize_t htPreadFully(int fd, void* buffer, size_t length, uint64_t offset);
