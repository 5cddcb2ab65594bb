#pragma once

#include <cstddef>
#include <cstdint>

// The text of one size in the report, written into a caller's buffer of at
// least kHTSizeTextCapacity bytes without allocating; each returns the
// length written (no terminating NUL). These run for every figure of every
// table, so they avoid printf and std::string.
inline constexpr size_t kHTSizeTextCapacity = 32;

// "16384 B"; sizes of 2^63 and above show as negative, as below.
size_t htBytesText(uint64_t bytes, char* out);
// "4 pages".
size_t htPagesText(uint64_t pages, char* out);
// In powers of 1024 with no decimals and at most four digits, rounded to
// nearest: "0 B", "9999 B", "10 KB", "2048 KB", "10 MB". The size is read as
// a signed 64-bit count, so sizes of 2^63 and above show as negative.
size_t htHumanizedText(uint64_t bytes, char* out);
