#include "platform/linux/HTLinuxUnheldTmpfs.h"

#include "platform/linux/HTLinuxOwnedObjects.h"
#include "platform/linux/HTLinuxProcessTable.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcText.h"
#include "platform/linux/HTShmemParsers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <string_view>

namespace {

using Device = HTLinuxOwnedObjects::Device;
using FileKey = HTLinuxOwnedObjects::FileKey;

// A tag beyond the kernel's own for each mount's files, after the one of
// System V segments.
constexpr uint64_t kFirstTag = 0x1100;

// A tmpfs device whose files take room: the bytes no process holds or maps
// so far, and where it is mounted.
struct Mount {
    uint64_t unheld = 0;
    std::string point;
};

// A mountinfo path with its octal escapes (\040 for a blank) undone.
std::string unescaped(std::string_view text)
{
    std::string path;
    for (size_t at = 0; at < text.size(); ++at) {
        std::optional<unsigned> value;
        if (text[at] == '\\' && at + 3 < text.size() && (value = htNumber<unsigned>(text.substr(at + 1, 3), 8))) {
            path.push_back(static_cast<char>(*value));
            at += 3;
        } else {
            path.push_back(text[at]);
        }
    }
    return path;
}

// Adds to `mapped` the files of `devices` that `pid` maps and nobody
// holds, with their bytes in memory and swap.
void addMappedFiles(int32_t pid, const std::map<Device, Mount>& devices, const std::map<FileKey, uint64_t>& held,
                    std::map<FileKey, uint64_t>& mapped)
{
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/maps", pid);
    thread_local HTProcBuffer maps;
    if (!maps.readFile(AT_FDCWD, path)) return;
    std::string_view text = maps.view();
    while (!text.empty()) {
        std::optional<HTMapsFileLine> mapping = htParseMapsFileLine(htTakeLine(text));
        if (!mapping) continue;
        const FileKey key{mapping->device, mapping->inode};
        if (devices.count(key.first) == 0 || held.count(key) != 0 || mapped.count(key) != 0) continue;
        std::snprintf(path, sizeof(path), "/proc/%d/map_files/%.*s", pid, static_cast<int>(mapping->range.size()),
                      mapping->range.data());
        struct stat status {};
        mapped[key] = stat(path, &status) == 0 ? static_cast<uint64_t>(status.st_blocks) * 512 : 0;
    }
}

}  // namespace

void HTLinuxUnheldTmpfs::addSites(HTLinuxOwnedObjects& owned, std::vector<mach_memory_info_t>& sites)
{
    HTProcBuffer mountinfo;
    if (!mountinfo.readFile(AT_FDCWD, "/proc/self/mountinfo")) return;
    // The devices whose files take room, each with what they take and the
    // first place it is mounted where it is not hidden.
    std::map<Device, Mount> withFiles;
    for (const HTTmpfsMount& mount : htParseTmpfsMounts(mountinfo.view())) {
        if (withFiles.count(mount.device) != 0) continue;
        const std::string point = unescaped(mount.mountPoint);
        // A mount that another hides (two at /dev/shm, say) cannot be
        // asked through its mount point: only the one on top is seen.
        struct stat top {};
        if (stat(point.c_str(), &top) != 0 || major(top.st_dev) != mount.device.first ||
            minor(top.st_dev) != mount.device.second)
            continue;
        struct statfs status {};
        if (statfs(point.c_str(), &status) != 0 || status.f_blocks == status.f_bfree) continue;
        const uint64_t used =
            static_cast<uint64_t>(status.f_blocks - status.f_bfree) * static_cast<uint64_t>(status.f_bsize);
        withFiles.emplace(mount.device, Mount{used, point});
    }
    if (withFiles.empty()) return;

    const std::map<FileKey, uint64_t>& held = owned.heldFileBytes();
    std::map<FileKey, uint64_t> mapped;
    HTLinuxProcessTable::forEachPid([&](int32_t pid) { addMappedFiles(pid, withFiles, held, mapped); });
    const std::map<FileKey, uint64_t>* const accounted[] = {&held, &mapped};
    for (const auto* files : accounted)
        for (const auto& [key, bytes] : *files) {
            auto device = withFiles.find(key.first);
            if (device != withFiles.end()) device->second.unheld -= std::min(device->second.unheld, bytes);
        }

    uint64_t tag = kFirstTag;
    for (const auto& [device, mount] : withFiles) {
        if (mount.unheld == 0) continue;
        mach_memory_info_t site{};
        site.flags = VM_KERN_SITE_TAG | VM_KERN_SITE_NAMED | HT_KERN_SITE_SWAPPABLE;
        site.site = tag++;
        site.size = mount.unheld;
        const std::string name = "tmpfs files no process holds or maps (" + mount.point + ")";
        std::memcpy(site.name, name.data(), std::min(name.size(), sizeof(site.name) - 1));
        sites.push_back(site);
    }
}
