#include "platform/linux/HTShmemParsers.h"

#include "platform/linux/HTProcText.h"

namespace {

// A device written "MAJOR:MINOR", in hexadecimal in maps and in decimal in
// mountinfo.
std::optional<std::pair<uint32_t, uint32_t>> parseDevice(std::string_view word, int base)
{
    const size_t colon = word.find(':');
    if (colon == std::string_view::npos) return std::nullopt;
    auto major = htNumber<uint32_t>(word.substr(0, colon), base);
    auto minor = htNumber<uint32_t>(word.substr(colon + 1), base);
    if (!major || !minor) return std::nullopt;
    return std::make_pair(*major, *minor);
}

}  // namespace

std::vector<HTSysvSegment> htParseSysvShm(std::string_view text)
{
    std::vector<HTSysvSegment> segments;
    htTakeLine(text);  // the heading
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        // key shmid perms size cpid lpid nattch uid gid cuid cgid atime
        // dtime ctime rss swap
        std::string_view words[16];
        size_t count = 0;
        for (; count < 16; ++count)
            if ((words[count] = htTakeWord(line)).empty()) break;
        if (count < 16) continue;
        auto shmid = htNumber<int32_t>(words[1]);
        auto size = htNumber<uint64_t>(words[3]);
        auto cpid = htNumber<int32_t>(words[4]);
        auto nattch = htNumber<uint64_t>(words[6]);
        auto rss = htNumber<uint64_t>(words[14]);
        auto swap = htNumber<uint64_t>(words[15]);
        if (shmid && size && cpid && nattch && rss && swap)
            segments.push_back({*shmid, *size, *cpid, *nattch, *rss, *swap});
    }
    return segments;
}

std::vector<HTTmpfsMount> htParseTmpfsMounts(std::string_view text)
{
    std::vector<HTTmpfsMount> mounts;
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        // ID PARENT MAJOR:MINOR ROOT MOUNTPOINT OPTIONS [TAGS...] - TYPE ...
        htTakeWord(line);
        htTakeWord(line);
        auto device = parseDevice(htTakeWord(line), 10);
        htTakeWord(line);
        std::string_view mountPoint = htTakeWord(line);
        size_t separator = line.find(" - ");
        if (!device || separator == std::string_view::npos) continue;
        std::string_view rest = line.substr(separator + 3);
        if (htTakeWord(rest) == "tmpfs") mounts.push_back({*device, mountPoint});
    }
    return mounts;
}

std::optional<HTMapsFileLine> htParseMapsFileLine(std::string_view line)
{
    // START-END PERMS OFFSET MAJOR:MINOR INODE PATH
    HTMapsFileLine parsed;
    parsed.range = htTakeWord(line);
    htTakeWord(line);
    htTakeWord(line);
    auto device = parseDevice(htTakeWord(line), 16);
    auto inode = htNumber<uint64_t>(htTakeWord(line));
    if (!device || !inode || *inode == 0) return std::nullopt;
    parsed.device = *device;
    parsed.inode = *inode;
    return parsed;
}
