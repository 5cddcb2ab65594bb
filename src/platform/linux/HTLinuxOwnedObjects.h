#pragma once

#include "platform/HTPlatformTypes.h"

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <mutex>
#include <unordered_map>
#include <utility>
#include <vector>

class HTLinuxProcessTable;

// The shared memory that processes own, whether they map it or not: the
// files of tmpfs (memfd, /dev/shm, any other tmpfs file, deleted or not)
// that a process holds by a file descriptor, and the System V segments a
// process created. Such memory stays in use while it is held, mapped by
// nobody, and no mapping shows it.
//
// An object held by several processes has one owner, the one that has run
// longest (the smallest start time, then the smallest pid): most often the
// process that made it and handed it to the others, and one that outlives
// them, so that the charge does not move as helpers come and go. A System V
// segment is owned by its creator while that process lives.
//
// A tmpfs file outside the kernel's own tmpfs and /dev/shm that a holder
// also maps (a journal under /run, say) is left to its mappings, which
// name it as a mapped file.
//
// Every process's descriptors are read once, on the first question of a
// run; without root only the caller's own processes can be read, and
// standard error says how many could not. An
// object's resident and swapped pages come from cachestat, or, on a kernel
// without it, from mincore on a read-only mapping of heft's own, which
// faults nothing in; a System V segment's from /proc/sysvipc/shm.
class HTLinuxOwnedObjects {
public:
    explicit HTLinuxOwnedObjects(HTLinuxProcessTable& processes) : processes_(processes) {}

    using Device = std::pair<uint32_t, uint32_t>;
    using FileKey = std::pair<Device, uint64_t>;

    // The objects `pid` owns, sysctl-style: a 64-bit count and that many
    // records, or the size of that with a null `oldp`. 0, or -1 and errno.
    int ownedObjects(int32_t pid, void* oldp, size_t* oldlenp);
    // The tmpfs files that some process holds, each with the bytes it has
    // in memory and swap.
    const std::map<FileKey, uint64_t>& heldFileBytes();

private:
    // A tmpfs file some process holds, with the holder that owns it so far.
    struct HeldFile {
        int32_t owner = 0;
        uint64_t ownerStart = 0;
        int ownerFd = -1;
        uint64_t size = 0;
        uint64_t blocks = 0;
        // Mapped by a holder as an ordinary file: its mappings account
        // for it, under "mapped file".
        bool mappedAsFile = false;
    };

    void gather();
    // Reads the descriptors of `pid`, noting the tmpfs files it holds.
    void readDescriptors(int32_t pid, const std::vector<Device>& devices, const Device& shmDevice);
    // Marks the files of `files` that `pid` maps.
    void noteMappedFiles(int32_t pid, const std::vector<FileKey>& files);
    void addHeldFiles(uint64_t pageSize);
    void addSysvSegments(const Device& shmDevice, uint64_t pageSize);
    // The start time of `pid`, in clock ticks after boot; the largest
    // value when it cannot be read.
    uint64_t startTime(int32_t pid);

    HTLinuxProcessTable& processes_;
    std::once_flag gathered_;
    std::map<FileKey, HeldFile> heldFiles_;
    std::map<FileKey, uint64_t> heldFileBytes_;
    std::unordered_map<int32_t, std::vector<vm_owned_object>> byOwner_;
    // Processes whose descriptors the caller may not read.
    size_t unreadable_ = 0;
};
