#pragma once

// Parsing of /proc/PID/stat: one line of blank-separated fields, the second
// of which (comm) is set by the process itself and may hold blanks and
// parentheses. Pure functions from bytes to records.

#include <cstdint>
#include <optional>
#include <string_view>

// The kernel's task flag of a kernel thread (field 9 of the stat line).
inline constexpr uint32_t HT_PF_KTHREAD = 0x00200000;
// Set as a task begins to exit, before it lets go of its address space.
inline constexpr uint32_t HT_PF_EXITING = 0x00000004;

struct HTProcStat {
    int32_t pid = 0;
    // Points into the parsed buffer: valid as long as that buffer is.
    std::string_view comm;
    char state = '?';
    int32_t ppid = 0;
    int32_t pgrp = 0;
    int32_t session = 0;
    int32_t tty_nr = 0;
    int32_t tpgid = 0;
    uint32_t flags = 0;
    int32_t nice = 0;
    // Clock ticks after boot.
    uint64_t starttime = 0;
    // Where the stack began (field 28); 0 when the reader may not see it,
    // or the line stops short of it.
    uint64_t startstack = 0;

    bool isKernelThread() const { return (flags & HT_PF_KTHREAD) != 0; }
    // A zombie, or a task being reaped.
    bool isZombie() const { return state == 'Z' || state == 'X' || state == 'x'; }
    // A zombie, or on its way out, letting go of its address space.
    bool hasExited() const { return isZombie() || (flags & HT_PF_EXITING) != 0; }
};

// Parses a stat line; nullopt when the text is empty, cut short before the
// start time (field 22), or not a stat line. comm runs from the first '('
// to the last ')', since the name itself may contain ')'.
std::optional<HTProcStat> htParseProcStat(std::string_view text);

// The status value of a process information record (SRUN, SSLEEP, SSTOP,
// SZOMB) for a stat state letter.
uint32_t htProcStatusForState(char state);
