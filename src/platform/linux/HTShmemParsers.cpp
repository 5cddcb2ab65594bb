#include "platform/linux/HTShmemParsers.h"

#include <charconv>

namespace {

// The next blank-separated word of `text`, taken off it.
std::string_view nextWord(std::string_view& text)
{
    size_t start = text.find_first_not_of(" \t");
    if (start == std::string_view::npos) {
        text = {};
        return {};
    }
    text.remove_prefix(start);
    size_t end = text.find_first_of(" \t");
    std::string_view word = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end);
    return word;
}

template<typename Number>
bool readNumber(std::string_view word, Number& value)
{
    auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), value);
    return error == std::errc() && end == word.data() + word.size();
}

// Takes the next line off `text`.
std::string_view nextLine(std::string_view& text)
{
    size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    return line;
}

}  // namespace

std::vector<HTSysvSegment> htParseSysvShm(std::string_view text)
{
    std::vector<HTSysvSegment> segments;
    nextLine(text);  // the heading
    while (!text.empty()) {
        std::string_view line = nextLine(text);
        // key shmid perms size cpid lpid nattch uid gid cuid cgid atime
        // dtime ctime rss swap
        std::string_view words[16];
        size_t count = 0;
        for (; count < 16; ++count)
            if ((words[count] = nextWord(line)).empty()) break;
        HTSysvSegment segment;
        if (count < 16 || !readNumber(words[1], segment.shmid) || !readNumber(words[3], segment.size) ||
            !readNumber(words[4], segment.cpid) || !readNumber(words[6], segment.nattch) ||
            !readNumber(words[14], segment.rss) || !readNumber(words[15], segment.swap))
            continue;
        segments.push_back(segment);
    }
    return segments;
}

std::vector<HTTmpfsMount> htParseTmpfsMounts(std::string_view text)
{
    std::vector<HTTmpfsMount> mounts;
    while (!text.empty()) {
        std::string_view line = nextLine(text);
        // ID PARENT MAJOR:MINOR ROOT MOUNTPOINT OPTIONS [TAGS...] - TYPE ...
        nextWord(line);
        nextWord(line);
        std::string_view device = nextWord(line);
        nextWord(line);
        std::string_view mountPoint = nextWord(line);
        size_t separator = line.find(" - ");
        if (separator == std::string_view::npos) continue;
        std::string_view rest = line.substr(separator + 3);
        if (nextWord(rest) != "tmpfs") continue;
        size_t colon = device.find(':');
        uint32_t major = 0;
        uint32_t minor = 0;
        if (colon == std::string_view::npos || !readNumber(device.substr(0, colon), major) ||
            !readNumber(device.substr(colon + 1), minor))
            continue;
        mounts.push_back({{major, minor}, mountPoint});
    }
    return mounts;
}
