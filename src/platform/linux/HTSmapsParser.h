#pragma once

// Parsing of /proc/PID/smaps: one record per mapping (VMA), a maps line
// followed by "Name: value kB" lines and a VmFlags line. A pure function
// from bytes to records, in one pass over the text; the only allocation is
// the path of each mapping, and a vector of records is reused from one
// parse to the next.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

// What a mapping is, as far as its maps line tells.
enum class HTSmapsKind : uint8_t {
    Anonymous,          // private anonymous memory with no pseudo-path
    Heap,               // [heap]
    Stack,              // [stack]
    File,               // a file of a file system
    SharedMemory,       // memfd, /dev/shm, System V, MAP_SHARED anonymous, hugetlbfs
    KernelProvided,     // [vdso], [vvar], [vvar_vclock], [vsyscall], [uprobes]
    NamedAnonymous,     // [anon:NAME], private anonymous memory named by prctl
    NamedSharedMemory,  // [anon_shmem:NAME], shared anonymous memory named by prctl
};

// The VmFlags heft uses, one bit each.
enum HTSmapsVmFlag : uint32_t {
    HTVmFlagShared = 1u << 0,    // sh
    HTVmFlagMayRead = 1u << 1,   // mr
    HTVmFlagMayWrite = 1u << 2,  // mw
    HTVmFlagMayExec = 1u << 3,   // me
    HTVmFlagLocked = 1u << 4,    // lo (mlock)
    HTVmFlagDontCopy = 1u << 5,  // dc (MADV_DONTFORK)
    HTVmFlagHugetlb = 1u << 6,   // ht
    HTVmFlagIO = 1u << 7,        // io (device memory)
    HTVmFlagPfnMap = 1u << 8,    // pf (raw page frames, no struct page)
    HTVmFlagMixedMap = 1u << 9,  // mm (page frames with and without struct page)
};

struct HTSmapsEntry {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t offset = 0;  // file offset of the maps line, in bytes
    uint64_t inode = 0;
    uint32_t devMajor = 0;
    uint32_t devMinor = 0;
    uint8_t protection = 0;  // VM_PROT_READ | WRITE | EXECUTE from "rwx"
    bool shared = false;     // 's' rather than 'p'
    HTSmapsKind kind = HTSmapsKind::Anonymous;
    uint32_t vmFlags = 0;
    // The maps line's path as the kernel wrote it, " (deleted)" included;
    // empty for anonymous memory.
    std::string path;

    // Sizes in bytes.
    uint64_t kernelPageSize = 0;
    uint64_t rss = 0;
    uint64_t sharedClean = 0;
    uint64_t sharedDirty = 0;
    uint64_t privateDirty = 0;
    uint64_t anonymous = 0;
    uint64_t lazyFree = 0;
    uint64_t swap = 0;
    // Below `swap` when some swap slots are shared with other processes
    // (after a fork).
    uint64_t swapPss = 0;
    // hugetlbfs pages are not in Rss: the kernel counts them here.
    uint64_t sharedHugetlb = 0;
    uint64_t privateHugetlb = 0;

    uint64_t size() const { return end - start; }
    bool hasFlag(HTSmapsVmFlag flag) const { return (vmFlags & flag) != 0; }
    // Device memory: raw page frames, with or without page structures.
    bool mapsDeviceMemory() const { return (vmFlags & (HTVmFlagIO | HTVmFlagPfnMap | HTVmFlagMixedMap)) != 0; }
    bool isSharedMemory() const { return kind == HTSmapsKind::SharedMemory || kind == HTSmapsKind::NamedSharedMemory; }
    // Whether pages of this mapping may be mapped by other processes too:
    // resident pages counted shared, or swap slots shared.
    bool mayShareWithOtherProcesses() const { return sharedClean + sharedDirty + sharedHugetlb != 0 || swapPss < swap; }
    // Backed by a kernel object (a file or a shared-memory inode) that other
    // processes may map as well.
    bool hasBackingObject() const { return kind == HTSmapsKind::File || isSharedMemory(); }
};

// Parses a whole smaps text into `entries`, reusing the records (and their
// path strings) already there; returns the number of mappings. Records are
// in address order. Lines that are not understood are skipped, as are the
// fields of a mapping whose maps line is malformed.
size_t htParseSmaps(std::string_view text, std::vector<HTSmapsEntry>& entries);

// The kind of a mapping from its path, sharing and VmFlags (exposed for
// tests).
HTSmapsKind htSmapsKind(std::string_view path, bool shared, uint32_t vmFlags);
