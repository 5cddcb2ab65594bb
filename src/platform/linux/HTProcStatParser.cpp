#include "platform/linux/HTProcStatParser.h"

#include "platform/HTPlatformTypes.h"

#include <charconv>

namespace {

// Reads one blank-separated integer field and moves past it.
template<typename Integer>
bool takeField(std::string_view& rest, Integer& value)
{
    size_t start = rest.find_first_not_of(' ');
    if (start == std::string_view::npos) return false;
    rest.remove_prefix(start);
    auto [end, error] = std::from_chars(rest.data(), rest.data() + rest.size(), value);
    if (error != std::errc() || (end != rest.data() + rest.size() && *end != ' ' && *end != '\n')) return false;
    rest.remove_prefix(static_cast<size_t>(end - rest.data()));
    return true;
}

bool skipFields(std::string_view& rest, int count)
{
    for (int i = 0; i < count; ++i) {
        size_t start = rest.find_first_not_of(' ');
        if (start == std::string_view::npos) return false;
        size_t end = rest.find_first_of(" \n", start);
        if (end == std::string_view::npos) end = rest.size();
        rest.remove_prefix(end);
    }
    return true;
}

}  // namespace

std::optional<HTProcStat> htParseProcStat(std::string_view text)
{
    HTProcStat stat;
    size_t open = text.find('(');
    size_t close = text.rfind(')');
    if (open == std::string_view::npos || close == std::string_view::npos || close < open) return std::nullopt;

    std::string_view head = text.substr(0, open);
    if (!takeField(head, stat.pid) || head.find_first_not_of(' ') != std::string_view::npos) return std::nullopt;
    stat.comm = text.substr(open + 1, close - open - 1);

    std::string_view rest = text.substr(close + 1);
    size_t stateAt = rest.find_first_not_of(' ');
    if (stateAt == std::string_view::npos || stateAt == 0) return std::nullopt;
    stat.state = rest[stateAt];
    rest.remove_prefix(stateAt + 1);

    // Fields 4 to 9, then nice (19) and starttime (22).
    if (!takeField(rest, stat.ppid) || !takeField(rest, stat.pgrp) || !takeField(rest, stat.session) ||
        !takeField(rest, stat.tty_nr) || !takeField(rest, stat.tpgid) || !takeField(rest, stat.flags))
        return std::nullopt;
    int64_t priority = 0;
    if (!skipFields(rest, 8) || !takeField(rest, priority) || !takeField(rest, stat.nice)) return std::nullopt;
    if (!skipFields(rest, 2) || !takeField(rest, stat.starttime)) return std::nullopt;
    // Fields 23 to 27, then startstack.
    if (!skipFields(rest, 5) || !takeField(rest, stat.startstack)) stat.startstack = 0;
    return stat;
}

uint32_t htProcStatusForState(char state)
{
    switch (state) {
    case 'R':
        return SRUN;
    case 'Z':
    case 'X':
        return SZOMB;
    case 'T':
    case 't':
        return SSTOP;
    default:
        return SSLEEP;  // S, D, I and the rarer waiting states
    }
}
