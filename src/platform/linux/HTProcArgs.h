#pragma once

// The argument area of a process as heft reads it: a 32-bit argument count
// (native byte order), the executable path, NUL padding, then every
// argument NUL-terminated. On Linux the path comes from the /proc/PID/exe
// link and the arguments from /proc/PID/cmdline. Pure functions.

#include <cstddef>
#include <cstdint>
#include <string_view>

// The number of arguments in a cmdline file: NUL-terminated strings, the
// last of which may lack its NUL when the process rewrote its arguments.
int32_t htArgumentCount(std::string_view cmdline);

// The bytes before the arguments: count, path, its NUL and padding up to a
// multiple of 8 bytes.
size_t htProcArgsHeaderSize(std::string_view executablePath);

// Writes the argument area into `out`, at most `capacity` bytes of it, and
// returns its whole size (as snprintf does), so that a short buffer keeps
// the beginning: count and path first, then as many argument bytes as fit.
size_t htBuildProcArgs(std::string_view executablePath, std::string_view cmdline, char* out, size_t capacity);
