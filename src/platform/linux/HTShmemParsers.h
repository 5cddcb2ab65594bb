#pragma once

// Parsing of the files that say where shared memory lives: the System V
// segments of /proc/sysvipc/shm and the tmpfs mounts of
// /proc/self/mountinfo. Pure functions from bytes to records.

#include <cstdint>
#include <string_view>
#include <utility>
#include <vector>

// One System V shared-memory segment; sizes in bytes.
struct HTSysvSegment {
    int32_t shmid = 0;
    uint64_t size = 0;
    // The process that created it, and how many mappings it has.
    int32_t cpid = 0;
    uint64_t nattch = 0;
    uint64_t rss = 0;
    uint64_t swap = 0;
};

// The segments of /proc/sysvipc/shm, after its heading; a line cut short
// or not made of numbers is skipped.
std::vector<HTSysvSegment> htParseSysvShm(std::string_view text);

// The devices (major, minor) of the tmpfs mounts that /proc/PID/mountinfo
// lists: the file systems whose files are shared memory.
std::vector<std::pair<uint32_t, uint32_t>> htParseTmpfsDevices(std::string_view text);
