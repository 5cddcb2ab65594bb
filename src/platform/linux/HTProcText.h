#pragma once

// Small steps for walking the text of /proc files: lines, blank-separated
// words and numbers, without copying.

#include <charconv>
#include <optional>
#include <string_view>

// The next line of `text` without its line feed; drops it from `text`.
inline std::string_view htTakeLine(std::string_view& text)
{
    size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    return line;
}

// The next run of characters other than blanks and tabs; drops it and the
// blanks before it from `text`. Empty at the end.
inline std::string_view htTakeWord(std::string_view& text)
{
    size_t start = text.find_first_not_of(" \t");
    if (start == std::string_view::npos) {
        text = {};
        return {};
    }
    size_t end = text.find_first_of(" \t", start);
    std::string_view word = text.substr(start, end == std::string_view::npos ? end : end - start);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end);
    return word;
}

// The whole of `word` as a number; nullopt when it is anything else.
template<typename Integer>
std::optional<Integer> htNumber(std::string_view word, int base = 10)
{
    Integer value{};
    auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), value, base);
    if (error != std::errc() || word.empty() || end != word.data() + word.size()) return std::nullopt;
    return value;
}
