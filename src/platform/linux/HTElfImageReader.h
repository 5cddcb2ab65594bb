#pragma once

// The image inventory of a Linux process: the ELF objects it has mapped,
// each with the segments its PT_LOAD program headers lay out, named by
// role in the terms the rest of heft uses for image segments:
//
//   executable                                   "__TEXT"
//   read-only, holding file offset 0 (headers,
//     dynamic symbols, relocations)              "__LINKEDIT"
//   other read-only (constants, unwind tables)   "__TEXT"
//   writable, the part made read-only after
//     relocation (PT_GNU_RELRO)                  "__DATA_CONST"
//   writable, the rest (data and bss)            "__DATA"
//
// The objects come from the process's mappings: every mapping of a regular file
// that begins with an ELF header. A file's layout is read once per run and
// kept by (device, inode), since all processes map the same libraries;
// what differs from process to process is only where the object was
// loaded (its bias), found from one of its file mappings.
//
// Safe to call from several threads at once.

#include "platform/HTPlatform.h"
#include "platform/linux/HTSmapsParser.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

class HTElfImageReader {
public:
    // An ELF file's load layout, with addresses as linked (bias 0).
    struct Layout {
        struct Load {
            uint64_t vaddr = 0;
            uint64_t offset = 0;
            uint64_t filesz = 0;
            bool executable = false;
        };
        struct Segment {
            const char* name = nullptr;
            uint64_t start = 0;  // page-aligned
            uint64_t end = 0;
        };
        uint16_t type = 0;  // ET_EXEC or ET_DYN
        uint64_t lowestAddress = 0;
        std::vector<Load> loads;
        std::vector<Segment> segments;
        uint64_t low = 0;  // the span of the segments
        uint64_t high = 0;
    };

    enum class ReadResult { Image, NotImage, Unreadable };

    HTElfImageReader();
    HTElfImageReader(const HTElfImageReader&) = delete;
    HTElfImageReader& operator=(const HTElfImageReader&) = delete;

    // Calls `callback` once per ELF object among a process's mappings (as
    // its smaps lists them), in address order; the files are opened
    // through the process's /proc directory.
    void forEachTaskImage(int procDirFd, const std::vector<HTSmapsEntry>& mappings,
                          const std::function<void(const HTPlatformImage&)>& callback);

    // --- the pieces, pure enough to test on their own ---------------------
    // Reads the ELF and program headers of an open file. Image: *layout is
    // set; NotImage: not an ELF executable or shared object, or headers cut
    // short; Unreadable: the read itself failed.
    static ReadResult readLayout(int fd, uint64_t pageSize, std::shared_ptr<const Layout>* layout);
    // The load bias of an object, from one of its file mappings: the
    // mapping's start, its file offset and whether it is executable. False
    // when no PT_LOAD holds that offset.
    static bool biasForMapping(const Layout& layout, uint64_t mapStart, uint64_t mapOffset, bool executable,
                               uint64_t pageSize, uint64_t* bias);

private:
    struct FileKey {
        uint64_t device;
        uint64_t inode;
        bool operator==(const FileKey&) const = default;
    };
    struct FileKeyHash {
        size_t operator()(const FileKey& key) const { return (key.inode >> 8) ^ key.inode ^ (key.device << 16); }
    };

    // The layout of the file of a mapping, from the cache or read now; null
    // when it is no image or cannot be read.
    std::shared_ptr<const Layout> layoutForMapping(int procDirFd, const HTSmapsEntry& mapping);

    uint64_t pageSize_;
    std::mutex cacheMutex_;
    // Null entries: files known to be no image.
    std::unordered_map<FileKey, std::shared_ptr<const Layout>, FileKeyHash> cache_;
};
