#include "platform/linux/HTAllocinfoParser.h"

#include "platform/linux/HTProcText.h"

namespace {

bool parseSiteLine(std::string_view line, HTAllocinfoSite& site)
{
    auto bytes = htNumber<int64_t>(htTakeWord(line));
    auto calls = htNumber<uint64_t>(htTakeWord(line));
    std::string_view location = htTakeWord(line);
    size_t colon = location.rfind(':');
    if (!bytes || !calls || colon == std::string_view::npos) return false;
    auto number = htNumber<int32_t>(location.substr(colon + 1));
    if (!number) return false;
    site.bytes = *bytes;
    site.calls = *calls;
    site.path = location.substr(0, colon);
    site.line = *number;

    std::string_view word = htTakeWord(line);
    if (word.size() > 2 && word.front() == '[' && word.back() == ']') {
        site.module = word.substr(1, word.size() - 2);
        word = htTakeWord(line);
    }
    if (!word.starts_with("func:")) return false;
    site.function = word.substr(5);
    return !site.function.empty();
}

}  // namespace

std::vector<HTAllocinfoSite> htParseAllocinfo(std::string_view text)
{
    std::vector<HTAllocinfoSite> sites;
    while (!text.empty()) {
        HTAllocinfoSite site;
        if (parseSiteLine(htTakeLine(text), site)) sites.push_back(site);
    }
    return sites;
}
