#include "platform/linux/HTVmallocinfoParser.h"

#include "platform/linux/HTProcText.h"

#include <unordered_map>

namespace {

// The function of a caller printed as "name+0xoffset/0xlength", followed by
// "[module]" for module code.
std::string callerFunction(std::string_view caller, std::string_view next)
{
    std::string function(caller.substr(0, caller.find('+')));
    if (next.size() > 2 && next.front() == '[' && next.back() == ']') function.append(" ").append(next);
    return function;
}

}  // namespace

std::vector<HTVmallocCaller> htParseVmallocinfo(std::string_view text)
{
    std::vector<HTVmallocCaller> callers;
    std::unordered_map<std::string, size_t> indexes;
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        htTakeWord(line);  // the address range
        htTakeWord(line);  // its size, guard page included
        std::string_view caller = htTakeWord(line), next = htTakeWord(line), word = next;
        if (caller.starts_with("pages=")) word = caller, caller = next = {};
        while (!word.empty() && !word.starts_with("pages=")) word = htTakeWord(line);
        auto pages = htNumber<uint64_t>(word.substr(word.find('=') + 1));
        if (!pages) continue;

        std::string function = callerFunction(caller, next);
        auto [found, added] = indexes.try_emplace(function, callers.size());
        if (added) callers.push_back({std::move(function), 0});
        callers[found->second].pages += *pages;
    }
    return callers;
}
