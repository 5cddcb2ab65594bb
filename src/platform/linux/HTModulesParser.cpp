#include "platform/linux/HTModulesParser.h"

#include "platform/linux/HTProcText.h"

std::vector<HTModuleLine> htParseModules(std::string_view text)
{
    std::vector<HTModuleLine> modules;
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        std::string_view name = htTakeWord(line);
        auto size = htNumber<uint64_t>(htTakeWord(line));
        if (!name.empty() && size) modules.push_back({name, *size});
    }
    return modules;
}
