#include "platform/linux/HTSmapsParser.h"

#include "platform/HTPlatformTypes.h"

#include <algorithm>
#include <charconv>
#include <cstring>

namespace {

// Reads a number in `base` at the front of `text` and drops it; false when
// there is none.
template<typename T>
bool takeNumber(std::string_view& text, T& value, int base)
{
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
    if (error != std::errc() || end == text.data()) return false;
    text.remove_prefix(static_cast<size_t>(end - text.data()));
    return true;
}

bool takeChar(std::string_view& text, char expected)
{
    if (text.empty() || text.front() != expected) return false;
    text.remove_prefix(1);
    return true;
}

void skipBlanks(std::string_view& text)
{
    size_t count = 0;
    while (count < text.size() && text[count] == ' ') ++count;
    text.remove_prefix(count);
}

// "start-end perms offset major:minor inode   path". False when the line
// is not a maps line; `entry` is then unspecified.
bool parseMapsLine(std::string_view line, HTSmapsEntry& entry)
{
    if (!takeNumber(line, entry.start, 16) || !takeChar(line, '-') || !takeNumber(line, entry.end, 16) ||
        !takeChar(line, ' ') || line.size() < 5 || line[4] != ' ')
        return false;
    entry.protection = (line[0] == 'r' ? VM_PROT_READ : 0) | (line[1] == 'w' ? VM_PROT_WRITE : 0) |
        (line[2] == 'x' ? VM_PROT_EXECUTE : 0);
    entry.shared = line[3] == 's';
    line.remove_prefix(5);
    if (!takeNumber(line, entry.offset, 16) || !takeChar(line, ' ') || !takeNumber(line, entry.devMajor, 16) ||
        !takeChar(line, ':') || !takeNumber(line, entry.devMinor, 16) || !takeChar(line, ' ') ||
        !takeNumber(line, entry.inode, 10))
        return false;
    skipBlanks(line);
    entry.path.assign(line.data(), line.size());
    return entry.end >= entry.start;
}

// Two letters as one key, for the switch over VmFlags.
constexpr uint32_t flagKey(char first, char second)
{
    return (static_cast<uint32_t>(static_cast<unsigned char>(first)) << 8) | static_cast<unsigned char>(second);
}

uint32_t parseVmFlags(std::string_view text)
{
    uint32_t flags = 0;
    for (size_t at = 0; at + 1 < text.size(); at += 3) {
        // Tokens are two letters, each followed by a blank.
        switch (flagKey(text[at], text[at + 1])) {
        case flagKey('s', 'h'):
            flags |= HTVmFlagShared;
            break;
        case flagKey('m', 'r'):
            flags |= HTVmFlagMayRead;
            break;
        case flagKey('m', 'w'):
            flags |= HTVmFlagMayWrite;
            break;
        case flagKey('m', 'e'):
            flags |= HTVmFlagMayExec;
            break;
        case flagKey('l', 'o'):
            flags |= HTVmFlagLocked;
            break;
        case flagKey('d', 'c'):
            flags |= HTVmFlagDontCopy;
            break;
        case flagKey('h', 't'):
            flags |= HTVmFlagHugetlb;
            break;
        case flagKey('i', 'o'):
            flags |= HTVmFlagIO;
            break;
        case flagKey('p', 'f'):
            flags |= HTVmFlagPfnMap;
            break;
        case flagKey('m', 'm'):
            flags |= HTVmFlagMixedMap;
            break;
        default:
            break;
        }
    }
    return flags;
}

// The field of `entry` that a "Name:" line fills, or null for the fields
// heft does not use.
uint64_t* sizeField(HTSmapsEntry& entry, std::string_view name)
{
    switch (name.front()) {
    case 'R':
        if (name == "Rss") return &entry.rss;
        break;
    case 'S':
        if (name == "Shared_Clean") return &entry.sharedClean;
        if (name == "Shared_Dirty") return &entry.sharedDirty;
        if (name == "Swap") return &entry.swap;
        if (name == "SwapPss") return &entry.swapPss;
        if (name == "Shared_Hugetlb") return &entry.sharedHugetlb;
        break;
    case 'P':
        if (name == "Private_Dirty") return &entry.privateDirty;
        if (name == "Private_Hugetlb") return &entry.privateHugetlb;
        break;
    case 'A':
        if (name == "Anonymous") return &entry.anonymous;
        break;
    case 'L':
        if (name == "LazyFree") return &entry.lazyFree;
        break;
    case 'K':
        if (name == "KernelPageSize") return &entry.kernelPageSize;
        break;
    default:
        break;
    }
    return nullptr;
}

void parseFieldLine(std::string_view line, HTSmapsEntry& entry)
{
    size_t colon = line.find(':');
    if (colon == std::string_view::npos || colon == 0) return;
    std::string_view name = line.substr(0, colon);
    std::string_view value = line.substr(colon + 1);
    if (name == "VmFlags") {
        skipBlanks(value);
        entry.vmFlags = parseVmFlags(value);
        return;
    }
    uint64_t* field = sizeField(entry, name);
    if (field == nullptr) return;
    skipBlanks(value);
    uint64_t kilobytes = 0;
    if (takeNumber(value, kilobytes, 10)) *field = kilobytes * 1024;
}

void resetEntry(HTSmapsEntry& entry)
{
    std::string path = std::move(entry.path);
    entry = HTSmapsEntry{};
    entry.path = std::move(path);
}

bool isHexDigit(char c) { return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'); }

}  // namespace

HTSmapsKind htSmapsKind(std::string_view path, bool shared, uint32_t vmFlags)
{
    if (path.empty()) {
        // MAP_SHARED anonymous memory always carries a path; without one a
        // shared mapping still has a shared-memory inode behind it.
        return shared ? HTSmapsKind::SharedMemory : HTSmapsKind::Anonymous;
    }
    if (path.front() == '[') {
        if (path == "[heap]") return HTSmapsKind::Heap;
        if (path == "[stack]" || path.starts_with("[stack:")) return HTSmapsKind::Stack;
        if (path == "[vdso]" || path == "[vvar]" || path == "[vvar_vclock]" || path == "[vsyscall]" ||
            path == "[uprobes]")
            return HTSmapsKind::KernelProvided;
        if (path.starts_with("[anon:")) return HTSmapsKind::NamedAnonymous;
        if (path.starts_with("[anon_shmem:")) return HTSmapsKind::NamedSharedMemory;
        return shared ? HTSmapsKind::SharedMemory : HTSmapsKind::Anonymous;
    }
    // Anonymous huge pages (MAP_HUGETLB without a file) sit on an internal
    // hugetlbfs inode; private ones are private memory like any other.
    if (path == "/anon_hugepage (deleted)") return shared ? HTSmapsKind::SharedMemory : HTSmapsKind::Anonymous;
    // Shared memory lives on internal tmpfs inodes (memfd, MAP_SHARED
    // anonymous memory, whose file the kernel names "/dev/zero" and
    // unlinks, System V segments, whose inode number is the segment id), on
    // /dev/shm (POSIX shared memory), or on hugetlbfs: none of it has a file
    // on a disk behind it.
    if (path.starts_with("/memfd:") || path.starts_with("/dev/shm/") || path.starts_with("/SYSV") ||
        path == "/dev/zero (deleted)" || (vmFlags & HTVmFlagHugetlb) != 0)
        return HTSmapsKind::SharedMemory;
    return HTSmapsKind::File;
}

size_t htParseSmaps(std::string_view text, std::vector<HTSmapsEntry>& entries)
{
    size_t count = 0;
    HTSmapsEntry* current = nullptr;
    auto finish = [&] {
        if (current != nullptr) current->kind = htSmapsKind(current->path, current->shared, current->vmFlags);
        current = nullptr;
    };

    const char* cursor = text.data();
    const char* const end = text.data() + text.size();
    while (cursor < end) {
        const char* newline = static_cast<const char*>(std::memchr(cursor, '\n', static_cast<size_t>(end - cursor)));
        const char* lineEnd = newline != nullptr ? newline : end;
        std::string_view line(cursor, static_cast<size_t>(lineEnd - cursor));
        cursor = newline != nullptr ? newline + 1 : end;
        if (line.empty()) continue;

        // Field names begin with a capital letter; maps lines with a
        // lower-case hexadecimal address.
        if (isHexDigit(line.front())) {
            finish();
            if (count == entries.size()) entries.emplace_back();
            HTSmapsEntry& entry = entries[count];
            resetEntry(entry);
            if (parseMapsLine(line, entry)) {
                current = &entry;
                ++count;
            }
            continue;
        }
        if (current != nullptr) parseFieldLine(line, *current);
    }
    finish();
    entries.resize(count);

    // The kernel writes mappings in address order; a text read while the
    // process changed its mappings may not be, and look-ups need the order.
    auto byStart = [](const HTSmapsEntry& a, const HTSmapsEntry& b) { return a.start < b.start; };
    if (!std::is_sorted(entries.begin(), entries.end(), byStart))
        std::stable_sort(entries.begin(), entries.end(), byStart);
    return count;
}
