#include "platform/linux/HTProcStatusParser.h"

#include <charconv>

HTProcStatus htParseProcStatus(std::string_view text)
{
    HTProcStatus status;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (line.size() < 3 || (line[0] != 'V' && line[0] != 'R')) continue;

        size_t colon = line.find(':');
        if (colon == std::string_view::npos) continue;
        std::string_view name = line.substr(0, colon);
        std::optional<uint64_t>* field = name == "RssAnon" ? &status.rssAnon
            : name == "VmSwap"                             ? &status.vmSwap
            : name == "VmPTE"                              ? &status.vmPTE
            : name == "VmHWM"                              ? &status.vmHWM
                                                           : nullptr;
        if (field == nullptr) continue;
        std::string_view value = line.substr(colon + 1);
        size_t digits = value.find_first_not_of(" \t");
        if (digits == std::string_view::npos) continue;
        value.remove_prefix(digits);
        uint64_t kilobytes = 0;
        auto [end, error] = std::from_chars(value.data(), value.data() + value.size(), kilobytes);
        if (error == std::errc() && end != value.data()) *field = kilobytes * 1024;
    }
    return status;
}
