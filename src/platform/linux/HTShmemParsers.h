#pragma once

// Parsing of the files that say where shared memory lives: the System V
// segments of /proc/sysvipc/shm, the tmpfs mounts of /proc/self/mountinfo
// and the files that /proc/PID/maps maps. Pure functions from bytes to
// records.

#include <cstdint>
#include <optional>
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

// A tmpfs mount of /proc/PID/mountinfo: a file system whose files are
// shared memory.
struct HTTmpfsMount {
    std::pair<uint32_t, uint32_t> device;  // major, minor
    // Points into the parsed text; escaped as mountinfo escapes it (a
    // blank is \040).
    std::string_view mountPoint;
};

std::vector<HTTmpfsMount> htParseTmpfsMounts(std::string_view text);

// A line of /proc/PID/maps that maps a file (inode not 0).
struct HTMapsFileLine {
    // "START-END", as /proc/PID/map_files names the mapping; points into
    // the parsed text.
    std::string_view range;
    std::pair<uint32_t, uint32_t> device;  // major, minor
    uint64_t inode = 0;
};

// The mapping of a maps line; nullopt for anonymous memory or a line that
// is no maps line.
std::optional<HTMapsFileLine> htParseMapsFileLine(std::string_view line);
