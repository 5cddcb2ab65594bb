#include "platform/linux/HTLinuxUnheldTmpfs.h"

#include "platform/linux/HTLinuxOwnedObjects.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTShmemParsers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <map>
#include <set>
#include <string>
#include <string_view>

namespace {

using Device = HTLinuxOwnedObjects::Device;
using FileKey = HTLinuxOwnedObjects::FileKey;

// A tag beyond the kernel's own for each mount's files, after the one of
// System V segments.
constexpr uint64_t kFirstTag = 0x1100;

template<typename Number>
bool readNumber(std::string_view word, Number& value, int base)
{
    auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), value, base);
    return error == std::errc() && end == word.data() + word.size() && !word.empty();
}

// A mountinfo path with its octal escapes (\040 for a blank) undone.
std::string unescaped(std::string_view text)
{
    std::string path;
    for (size_t at = 0; at < text.size(); ++at) {
        unsigned value = 0;
        if (text[at] == '\\' && at + 3 < text.size() && readNumber(text.substr(at + 1, 3), value, 8)) {
            path.push_back(static_cast<char>(value));
            at += 3;
        } else {
            path.push_back(text[at]);
        }
    }
    return path;
}

// Adds to `mapped` the files of `devices` that `pid` maps and nobody
// holds, with their bytes in memory and swap.
void addMappedFiles(int32_t pid, const std::map<Device, uint64_t>& devices, const std::map<FileKey, uint64_t>& held,
                    std::map<FileKey, uint64_t>& mapped)
{
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/maps", pid);
    thread_local HTProcBuffer maps;
    if (!maps.readFile(AT_FDCWD, path)) return;
    std::string_view text = maps.view();
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        // START-END PERMS OFFSET MAJOR:MINOR INODE PATH, the device in hex.
        std::string_view words[5];
        for (std::string_view& word : words) {
            size_t blank = line.find(' ');
            word = line.substr(0, blank);
            line.remove_prefix(blank == std::string_view::npos ? line.size() : blank + 1);
        }
        const size_t colon = words[3].find(':');
        Device device;
        uint64_t inode = 0;
        if (colon == std::string_view::npos || !readNumber(words[3].substr(0, colon), device.first, 16) ||
            !readNumber(words[3].substr(colon + 1), device.second, 16) || !readNumber(words[4], inode, 10))
            continue;
        const FileKey key{device, inode};
        if (devices.count(device) == 0 || held.count(key) != 0 || mapped.count(key) != 0) continue;
        std::snprintf(path, sizeof(path), "/proc/%d/map_files/%.*s", pid, static_cast<int>(words[0].size()),
                      words[0].data());
        struct stat status {};
        mapped[key] = stat(path, &status) == 0 ? static_cast<uint64_t>(status.st_blocks) * 512 : 0;
    }
}

}  // namespace

void HTLinuxUnheldTmpfs::addSites(HTLinuxOwnedObjects& owned, std::vector<mach_memory_info_t>& sites)
{
    HTProcBuffer mountinfo;
    if (!mountinfo.readFile(AT_FDCWD, "/proc/self/mountinfo")) return;
    // Each device once, with what its files take and the first place it is
    // mounted.
    std::map<Device, uint64_t> used;
    std::map<Device, std::string> mountPoints;
    for (const HTTmpfsMount& mount : htParseTmpfsMounts(mountinfo.view())) {
        if (used.count(mount.device) != 0) continue;
        const std::string point = unescaped(mount.mountPoint);
        // A mount that another hides (two at /dev/shm, say) cannot be
        // asked through its mount point: only the one on top is seen.
        struct stat top {};
        if (stat(point.c_str(), &top) != 0 || major(top.st_dev) != mount.device.first ||
            minor(top.st_dev) != mount.device.second)
            continue;
        struct statfs status {};
        if (statfs(point.c_str(), &status) != 0) continue;
        used[mount.device] =
            static_cast<uint64_t>(status.f_blocks - status.f_bfree) * static_cast<uint64_t>(status.f_bsize);
        mountPoints[mount.device] = point;
    }
    std::map<Device, uint64_t> withFiles;
    for (const auto& [device, bytes] : used)
        if (bytes != 0) withFiles[device] = bytes;
    if (withFiles.empty()) return;

    const std::map<FileKey, uint64_t>& held = owned.heldFileBytes();
    std::map<FileKey, uint64_t> mapped;
    if (DIR* proc = opendir("/proc")) {
        while (dirent* entry = readdir(proc)) {
            int32_t pid = 0;
            if (readNumber(std::string_view(entry->d_name), pid, 10) && pid > 0)
                addMappedFiles(pid, withFiles, held, mapped);
        }
        closedir(proc);
    }
    const std::map<FileKey, uint64_t>* const accounted[] = {&held, &mapped};
    for (const auto* files : accounted)
        for (const auto& [key, bytes] : *files) {
            auto device = withFiles.find(key.first);
            if (device != withFiles.end()) device->second -= std::min(device->second, bytes);
        }

    uint64_t tag = kFirstTag;
    for (const auto& [device, bytes] : withFiles) {
        if (bytes == 0) continue;
        mach_memory_info_t site{};
        site.flags = VM_KERN_SITE_TAG | VM_KERN_SITE_NAMED | HT_KERN_SITE_SWAPPABLE;
        site.site = tag++;
        site.size = bytes;
        const std::string name = "tmpfs files no process holds or maps (" + mountPoints[device] + ")";
        std::memcpy(site.name, name.data(), std::min(name.size(), sizeof(site.name) - 1));
        sites.push_back(site);
    }
}
