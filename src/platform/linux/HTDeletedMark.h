#pragma once

// The kernel appends " (deleted)" to the path of a file that was removed
// (or replaced) while mapped or running: in smaps, in map_files and in the
// exe link. A path that is the mark alone has no mark.

#include <string_view>

inline bool htHasDeletedMark(std::string_view path)
{
    constexpr std::string_view mark = " (deleted)";
    return path.size() > mark.size() && path.ends_with(mark);
}

// The path without one trailing " (deleted)".
inline std::string_view htPathWithoutDeletedMark(std::string_view path)
{
    if (htHasDeletedMark(path)) path.remove_suffix(std::string_view(" (deleted)").size());
    return path;
}
