#pragma once

#include "platform/HTPlatformTypes.h"

#include <vector>

class HTLinuxOwnedObjects;

// The files of tmpfs mounts that no process holds open or maps: shared
// memory the kernel keeps for nobody (files under /run or /dev/shm left
// behind), which no process's report shows. Per mount, what the mount
// uses (statfs) less the files that processes hold (from the owned
// objects) or map (every process's /proc/PID/maps, each mapped file's size
// through /proc/PID/map_files) is one site of the kernel's report. A file
// that is only partly mapped counts whole as mapped.
class HTLinuxUnheldTmpfs {
public:
    // Appends a swappable site for each tmpfs mount whose files nobody
    // holds or maps, named after its mount point.
    static void addSites(HTLinuxOwnedObjects& owned, std::vector<mach_memory_info_t>& sites);
};
