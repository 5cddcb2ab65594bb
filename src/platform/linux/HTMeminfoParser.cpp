#include "platform/linux/HTMeminfoParser.h"

#include "platform/linux/HTProcText.h"

std::vector<HTMeminfoField> htParseMeminfo(std::string_view text)
{
    std::vector<HTMeminfoField> fields;
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        size_t colon = line.find(':');
        if (colon == 0 || colon == std::string_view::npos) continue;
        std::string_view rest = line.substr(colon + 1);
        auto value = htNumber<uint64_t>(htTakeWord(rest));
        std::string_view unit = htTakeWord(rest);
        if (!value || !(unit.empty() || unit == "kB")) continue;
        fields.push_back({line.substr(0, colon), unit.empty() ? *value : *value * 1024});
    }
    return fields;
}

const HTMeminfoField* htFindMeminfoField(const std::vector<HTMeminfoField>& fields, std::string_view name)
{
    for (const HTMeminfoField& field : fields)
        if (field.name == name) return &field;
    return nullptr;
}
