#include "platform/linux/HTElfImageReader.h"

#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTPreadFully.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <elf.h>
#include <endian.h>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr const char* kText = "__TEXT";
constexpr const char* kLinkEdit = "__LINKEDIT";
constexpr const char* kDataConst = "__DATA_CONST";
constexpr const char* kData = "__DATA";

#if __BYTE_ORDER == __LITTLE_ENDIAN
constexpr unsigned char kNativeData = ELFDATA2LSB;
#else
constexpr unsigned char kNativeData = ELFDATA2MSB;
#endif

// More program headers than any real object has; a larger count is a
// damaged file.
constexpr uint32_t kMaxProgramHeaders = 4096;

uint64_t pageDown(uint64_t value, uint64_t pageSize) { return value & ~(pageSize - 1); }

// Rounds up; false on overflow.
bool pageUp(uint64_t value, uint64_t pageSize, uint64_t* out)
{
    if (value > UINT64_MAX - (pageSize - 1)) return false;
    *out = (value + pageSize - 1) & ~(pageSize - 1);
    return true;
}

// Splits a writable PT_LOAD [start, end) at the page-aligned part of the
// RELRO range that the loader makes read-only after relocation (it rounds
// both ends down to the page, leaving a partial last page writable).
void addWritableSegments(std::vector<HTElfImageReader::Layout::Segment>& segments, uint64_t start, uint64_t end,
                         bool hasRelro, uint64_t relroStart, uint64_t relroEnd)
{
    uint64_t constStart = std::max(start, relroStart);
    uint64_t constEnd = std::min(end, relroEnd);
    if (!hasRelro || constStart >= constEnd) {
        segments.push_back({kData, start, end});
        return;
    }
    if (start < constStart) segments.push_back({kData, start, constStart});
    segments.push_back({kDataConst, constStart, constEnd});
    if (constEnd < end) segments.push_back({kData, constEnd, end});
}

template<class Ehdr, class Phdr>
HTElfImageReader::ReadResult readLayoutOf(int fd, const unsigned char* headerBytes, size_t headerLength,
                                          uint64_t pageSize, std::shared_ptr<const HTElfImageReader::Layout>* out)
{
    using Result = HTElfImageReader::ReadResult;
    if (headerLength < sizeof(Ehdr)) return Result::NotImage;
    Ehdr header;
    std::memcpy(&header, headerBytes, sizeof(header));
    if (header.e_type != ET_EXEC && header.e_type != ET_DYN) return Result::NotImage;
    if (header.e_phentsize < sizeof(Phdr) || header.e_phnum == 0 || header.e_phnum >= PN_XNUM ||
        header.e_phnum > kMaxProgramHeaders) {
        return Result::NotImage;
    }
    size_t tableSize = static_cast<size_t>(header.e_phnum) * header.e_phentsize;
    std::unique_ptr<unsigned char[]> table(new unsigned char[tableSize]);
    ssize_t count = htPreadFully(fd, table.get(), tableSize, header.e_phoff);
    if (count < 0) return Result::Unreadable;
    if (static_cast<size_t>(count) != tableSize) return Result::NotImage;

    auto layout = std::make_shared<HTElfImageReader::Layout>();
    layout->type = header.e_type;
    std::vector<Phdr> loads;
    bool hasRelro = false;
    uint64_t relroStart = 0;
    uint64_t relroEnd = 0;
    for (size_t i = 0; i < header.e_phnum; i++) {
        Phdr entry;
        std::memcpy(&entry, table.get() + i * header.e_phentsize, sizeof(entry));
        uint64_t vaddr = entry.p_vaddr;
        uint64_t memsz = entry.p_memsz;
        if (vaddr + memsz < vaddr) return Result::NotImage;
        if (entry.p_type == PT_LOAD && memsz != 0) {
            loads.push_back(entry);
        } else if (entry.p_type == PT_GNU_RELRO && !hasRelro && memsz != 0) {
            hasRelro = true;
            relroStart = pageDown(vaddr, pageSize);
            relroEnd = pageDown(vaddr + memsz, pageSize);
        }
    }
    if (loads.empty()) return Result::NotImage;

    layout->lowestAddress = UINT64_MAX;
    for (const Phdr& load : loads) {
        uint64_t start = pageDown(load.p_vaddr, pageSize);
        uint64_t end;
        if (!pageUp(uint64_t(load.p_vaddr) + load.p_memsz, pageSize, &end)) return Result::NotImage;
        layout->lowestAddress = std::min<uint64_t>(layout->lowestAddress, load.p_vaddr);
        layout->loads.push_back({load.p_vaddr, load.p_offset, load.p_filesz, (load.p_flags & PF_X) != 0});
        if (load.p_flags & PF_X) {
            layout->segments.push_back({kText, start, end});
        } else if (!(load.p_flags & PF_W)) {
            bool holdsHeader = load.p_offset == 0 && load.p_filesz != 0;
            layout->segments.push_back({holdsHeader ? kLinkEdit : kText, start, end});
        } else {
            addWritableSegments(layout->segments, start, end, hasRelro, relroStart, relroEnd);
        }
    }
    layout->low = UINT64_MAX;
    for (const auto& segment : layout->segments) {
        layout->low = std::min(layout->low, segment.start);
        layout->high = std::max(layout->high, segment.end);
    }
    *out = std::move(layout);
    return Result::Image;
}

// Opens the file of a mapping for reading its headers: through
// map_files (the very file mapped, even when deleted or in another mount
// namespace; needs CAP_SYS_ADMIN), else the path as the process sees it
// from its root, else the path as we see it. Only regular files are opened:
// opening a device node can have effects of its own. -1 when none opens;
// *notRegular is set when the mapped file is known not to be a regular file.
HTFileDescriptor openMappedFile(int procDirFd, const HTSmapsEntry& mapping, bool* notRegular)
{
    *notRegular = false;
    char mapFile[64];
    std::snprintf(mapFile, sizeof(mapFile), "map_files/%llx-%llx", static_cast<unsigned long long>(mapping.start),
                  static_cast<unsigned long long>(mapping.end));
    struct stat status;
    if (::fstatat(procDirFd, mapFile, &status, 0) == 0) {
        if (!S_ISREG(status.st_mode)) {
            *notRegular = true;
            return HTFileDescriptor();
        }
        HTFileDescriptor fd(::openat(procDirFd, mapFile, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
        if (fd.isOpen()) return fd;
    }
    // A deleted file's path names nothing, or some other file.
    if (htHasDeletedMark(mapping.path)) return HTFileDescriptor();
    const std::string& path = mapping.path;
    std::string rootPath = "root" + path;
    const std::pair<int, const char*> candidates[] = {{procDirFd, rootPath.c_str()}, {AT_FDCWD, path.c_str()}};
    for (const auto& [dirfd, name] : candidates) {
        if (::fstatat(dirfd, name, &status, 0) != 0) continue;
        if (!S_ISREG(status.st_mode)) {
            *notRegular = true;
            return HTFileDescriptor();
        }
        HTFileDescriptor fd(::openat(dirfd, name, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
        if (fd.isOpen()) return fd;
    }
    return HTFileDescriptor();
}

}  // namespace

HTElfImageReader::HTElfImageReader()
{
    long size = ::sysconf(_SC_PAGESIZE);
    pageSize_ = size > 0 ? static_cast<uint64_t>(size) : 4096;
}

HTElfImageReader::ReadResult HTElfImageReader::readLayout(int fd, uint64_t pageSize,
                                                          std::shared_ptr<const Layout>* layout)
{
    unsigned char header[sizeof(Elf64_Ehdr)];
    ssize_t count = htPreadFully(fd, header, sizeof(header), 0);
    if (count < 0) return ReadResult::Unreadable;
    size_t length = static_cast<size_t>(count);
    if (length < EI_NIDENT || std::memcmp(header, ELFMAG, SELFMAG) != 0) return ReadResult::NotImage;
    // Only objects of this machine's byte order can be mapped by it.
    if (header[EI_DATA] != kNativeData) return ReadResult::NotImage;
    if (header[EI_CLASS] == ELFCLASS64)
        return readLayoutOf<Elf64_Ehdr, Elf64_Phdr>(fd, header, length, pageSize, layout);
    if (header[EI_CLASS] == ELFCLASS32)
        return readLayoutOf<Elf32_Ehdr, Elf32_Phdr>(fd, header, length, pageSize, layout);
    return ReadResult::NotImage;
}

bool HTElfImageReader::biasForMapping(const Layout& layout, uint64_t mapStart, uint64_t mapOffset, bool executable,
                                      uint64_t pageSize, uint64_t* bias)
{
    // A non-PIE executable runs where it was linked.
    if (layout.type == ET_EXEC) {
        *bias = 0;
        return true;
    }
    // Two PT_LOADs can share a file page (small objects linked without
    // page-separated code); the mapping's protection tells them apart.
    const Layout::Load* found = nullptr;
    for (const Layout::Load& load : layout.loads) {
        uint64_t fileStart = pageDown(load.offset, pageSize);
        if (mapOffset < fileStart || mapOffset >= load.offset + load.filesz) continue;
        if (found == nullptr || (load.executable == executable && found->executable != executable)) found = &load;
    }
    if (found == nullptr) return false;
    *bias = mapStart - pageDown(found->vaddr, pageSize) - (mapOffset - pageDown(found->offset, pageSize));
    return true;
}

std::shared_ptr<const HTElfImageReader::Layout> HTElfImageReader::layoutForMapping(int procDirFd,
                                                                                   const HTSmapsEntry& mapping)
{
    FileKey key{(uint64_t(mapping.devMajor) << 32) | mapping.devMinor, mapping.inode};
    {
        std::lock_guard<std::mutex> lock(cacheMutex_);
        auto found = cache_.find(key);
        if (found != cache_.end()) return found->second;
    }
    // Read outside the lock: two threads may both read a new file, and the
    // first to store its layout wins.
    bool notRegular = false;
    HTFileDescriptor fd = openMappedFile(procDirFd, mapping, &notRegular);
    std::shared_ptr<const Layout> layout;
    ReadResult result = ReadResult::NotImage;
    if (fd.isOpen()) {
        result = readLayout(fd.get(), pageSize_, &layout);
    } else if (!notRegular) {
        // Not opened this time; another process's view of it may be.
        return nullptr;
    }
    if (result == ReadResult::Unreadable) return nullptr;
    std::lock_guard<std::mutex> lock(cacheMutex_);
    return cache_.emplace(key, std::move(layout)).first->second;
}

void HTElfImageReader::forEachTaskImage(int procDirFd, const std::vector<HTSmapsEntry>& mappings,
                                        const std::function<void(const HTPlatformImage&)>& callback)
{
    struct Placed {
        FileKey key;
        uint64_t low;
        uint64_t high;
    };
    std::vector<Placed> placed;
    for (const HTSmapsEntry& mapping : mappings) {
        if (mapping.inode == 0 || mapping.path.empty() || mapping.path[0] != '/') continue;
        FileKey key{(uint64_t(mapping.devMajor) << 32) | mapping.devMinor, mapping.inode};
        // The further mappings of an object already placed.
        bool known = std::any_of(placed.begin(), placed.end(), [&](const Placed& object) {
            return object.key == key && object.low <= mapping.start && mapping.start < object.high;
        });
        if (known) continue;

        std::shared_ptr<const Layout> layout = layoutForMapping(procDirFd, mapping);
        if (!layout) continue;
        bool executable = (mapping.protection & VM_PROT_EXECUTE) != 0;
        uint64_t bias;
        if (!biasForMapping(*layout, mapping.start, mapping.offset, executable, pageSize_, &bias)) continue;

        HTPlatformImage image;
        image.path = mapping.path;
        image.baseAddress = bias + layout->lowestAddress;
        image.segments.reserve(layout->segments.size());
        for (const Layout::Segment& segment : layout->segments) {
            image.segments.push_back({segment.name, bias + segment.start, segment.end - segment.start});
        }
        placed.push_back({key, bias + layout->low, bias + layout->high});
        callback(image);
    }
}
