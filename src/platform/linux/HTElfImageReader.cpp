#include "platform/linux/HTElfImageReader.h"

#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTProcBuffer.h"

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

// pread until `size` bytes or the end of the file; the count read, -1 on
// an error.
ssize_t readFully(int fd, void* buffer, size_t size, off_t offset)
{
    size_t done = 0;
    while (done < size) {
        ssize_t count = ::pread(fd, static_cast<char*>(buffer) + done, size - done, offset + static_cast<off_t>(done));
        if (count < 0) {
            if (errno == EINTR) continue;
            return -1;
        }
        if (count == 0) break;
        done += static_cast<size_t>(count);
    }
    return static_cast<ssize_t>(done);
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

template <class Ehdr, class Phdr>
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
    ssize_t count = readFully(fd, table.get(), tableSize, static_cast<off_t>(header.e_phoff));
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
int openMappedFile(int procDirFd, const HTMapsLine& mapping, bool* notRegular)
{
    *notRegular = false;
    char mapFile[64];
    std::snprintf(mapFile, sizeof(mapFile), "map_files/%llx-%llx", static_cast<unsigned long long>(mapping.start),
                  static_cast<unsigned long long>(mapping.end));
    struct stat status;
    if (::fstatat(procDirFd, mapFile, &status, 0) == 0) {
        if (!S_ISREG(status.st_mode)) {
            *notRegular = true;
            return -1;
        }
        int fd = ::openat(procDirFd, mapFile, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
        if (fd >= 0) return fd;
    }
    // A deleted file's path names nothing, or some other file.
    constexpr std::string_view deleted = " (deleted)";
    if (mapping.path.size() >= deleted.size() && mapping.path.substr(mapping.path.size() - deleted.size()) == deleted) {
        return -1;
    }
    std::string path(mapping.path);
    std::string rootPath = "root" + path;
    const std::pair<int, const char*> candidates[] = {{procDirFd, rootPath.c_str()}, {AT_FDCWD, path.c_str()}};
    for (const auto& [dirfd, name] : candidates) {
        if (::fstatat(dirfd, name, &status, 0) != 0) continue;
        if (!S_ISREG(status.st_mode)) {
            *notRegular = true;
            return -1;
        }
        int fd = ::openat(dirfd, name, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
        if (fd >= 0) return fd;
    }
    return -1;
}

template <class T>
bool parseNumber(std::string_view text, size_t& position, int base, T& value)
{
    const char* first = text.data() + position;
    auto [end, error] = std::from_chars(first, text.data() + text.size(), value, base);
    if (error != std::errc() || end == first) return false;
    position += static_cast<size_t>(end - first);
    return true;
}

bool expect(std::string_view text, size_t& position, char c)
{
    if (position >= text.size() || text[position] != c) return false;
    position++;
    return true;
}

}  // namespace

HTElfImageReader::HTElfImageReader()
{
    long size = ::sysconf(_SC_PAGESIZE);
    pageSize_ = size > 0 ? static_cast<uint64_t>(size) : 4096;
}

bool HTElfImageReader::parseMapsLine(std::string_view line, HTMapsLine& out)
{
    size_t position = 0;
    if (!parseNumber(line, position, 16, out.start) || !expect(line, position, '-') ||
        !parseNumber(line, position, 16, out.end) || !expect(line, position, ' ')) {
        return false;
    }
    size_t permsEnd = line.find(' ', position);
    if (permsEnd == std::string_view::npos) return false;
    out.perms = line.substr(position, permsEnd - position);
    position = permsEnd + 1;
    if (!parseNumber(line, position, 16, out.offset) || !expect(line, position, ' ') ||
        !parseNumber(line, position, 16, out.devMajor) || !expect(line, position, ':') ||
        !parseNumber(line, position, 16, out.devMinor) || !expect(line, position, ' ') ||
        !parseNumber(line, position, 10, out.inode)) {
        return false;
    }
    while (position < line.size() && line[position] == ' ') position++;
    out.path = line.substr(position);
    return true;
}

HTElfImageReader::ReadResult HTElfImageReader::readLayout(int fd, uint64_t pageSize,
                                                          std::shared_ptr<const Layout>* layout)
{
    unsigned char header[sizeof(Elf64_Ehdr)];
    ssize_t count = readFully(fd, header, sizeof(header), 0);
    if (count < 0) return ReadResult::Unreadable;
    size_t length = static_cast<size_t>(count);
    if (length < EI_NIDENT || std::memcmp(header, ELFMAG, SELFMAG) != 0) return ReadResult::NotImage;
    // Only objects of this machine's byte order can be mapped by it.
    if (header[EI_DATA] != kNativeData) return ReadResult::NotImage;
    if (header[EI_CLASS] == ELFCLASS64) return readLayoutOf<Elf64_Ehdr, Elf64_Phdr>(fd, header, length, pageSize, layout);
    if (header[EI_CLASS] == ELFCLASS32) return readLayoutOf<Elf32_Ehdr, Elf32_Phdr>(fd, header, length, pageSize, layout);
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
                                                                                 const HTMapsLine& mapping)
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
    int fd = openMappedFile(procDirFd, mapping, &notRegular);
    std::shared_ptr<const Layout> layout;
    ReadResult result = ReadResult::NotImage;
    if (fd >= 0) {
        result = readLayout(fd, pageSize_, &layout);
        ::close(fd);
    } else if (!notRegular) {
        // Not opened this time; another process's view of it may be.
        return nullptr;
    }
    if (result == ReadResult::Unreadable) return nullptr;
    std::lock_guard<std::mutex> lock(cacheMutex_);
    return cache_.emplace(key, std::move(layout)).first->second;
}

bool HTElfImageReader::forEachTaskImage(HTLinuxTaskPort& task,
                                        const std::function<void(const HTPlatformImage&)>& callback)
{
    // One buffer a gathering thread, kept from process to process.
    thread_local HTProcBuffer buffer;
    if (!buffer.readFile(task.procDirFd(), "maps")) return false;

    struct Placed {
        FileKey key;
        uint64_t low;
        uint64_t high;
    };
    std::vector<Placed> placed;
    std::vector<HTPlatformImage> images;
    std::string_view maps = buffer.view();
    while (!maps.empty()) {
        size_t lineEnd = maps.find('\n');
        std::string_view line = maps.substr(0, lineEnd);
        maps = lineEnd == std::string_view::npos ? std::string_view() : maps.substr(lineEnd + 1);

        HTMapsLine mapping;
        if (!parseMapsLine(line, mapping)) continue;
        if (mapping.inode == 0 || mapping.path.empty() || mapping.path[0] != '/') continue;
        FileKey key{(uint64_t(mapping.devMajor) << 32) | mapping.devMinor, mapping.inode};
        // The further mappings of an object already placed.
        bool known = std::any_of(placed.begin(), placed.end(), [&](const Placed& object) {
            return object.key == key && object.low <= mapping.start && mapping.start < object.high;
        });
        if (known) continue;

        std::shared_ptr<const Layout> layout = layoutForMapping(task.procDirFd(), mapping);
        if (!layout) continue;
        bool executable = mapping.perms.size() >= 3 && mapping.perms[2] == 'x';
        uint64_t bias;
        if (!biasForMapping(*layout, mapping.start, mapping.offset, executable, pageSize_, &bias)) continue;

        HTPlatformImage image;
        image.path = std::string(mapping.path);
        image.baseAddress = bias + layout->lowestAddress;
        image.segments.reserve(layout->segments.size());
        for (const Layout::Segment& segment : layout->segments) {
            image.segments.push_back({segment.name, bias + segment.start, segment.end - segment.start});
        }
        placed.push_back({key, bias + layout->low, bias + layout->high});
        images.push_back(std::move(image));
    }
    // Called once the maps are parsed, so that a callback may itself list
    // another task's images on this thread.
    for (const HTPlatformImage& image : images) callback(image);
    return true;
}
