#pragma once

#include "output/HTExpectedReport.h"

#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

// data/snapfiles/base.heftsnap with one edit, in the words described at the
// head of data/snapfiles/defects.txt; no words leave it as it is.
inline std::string editedSnapfile(const std::string& edit)
{
    std::string contents = contentsOf(HEFT_TEST_DATA_DIR "/snapfiles/base.heftsnap");
    std::istringstream in(edit);
    std::vector<std::string> words;
    for (std::string word; in >> std::quoted(word);) words.push_back(HTScenarioLine::decoded(word));
    if (words.empty()) return contents;
    if (words[0] == "truncate") return contents.substr(0, std::stoul(words[1]));
    if (words[0] == "replace") return contents.replace(contents.find(words[1]), words[1].size(), words[3]);
    rapidjson::Document document, value(&document.GetAllocator());
    rapidjson::Document::AllocatorType& allocator = document.GetAllocator();
    document.Parse(contents.c_str());
    rapidjson::Value* holder = &document;
    std::string key = words[1];
    for (size_t dot; (dot = key.find('.')) != std::string::npos; key.erase(0, dot + 1)) {
        const std::string step = key.substr(0, dot);
        holder = holder->IsArray() ? &(*holder)[std::stoul(step)] : &(*holder)[step.c_str()];
    }
    // Arrays are only set; a member set goes last.
    if (holder->IsArray()) {
        (*holder)[std::stoul(key)] = value.Parse(words[2].c_str()).Move();
    } else if (holder->RemoveMember(key.c_str()); words[0] == "set") {
        holder->AddMember(rapidjson::Value(key.c_str(), allocator), value.Parse(words[2].c_str()).Move(), allocator);
    }
    rapidjson::StringBuffer text;
    rapidjson::Writer<rapidjson::StringBuffer> writer(text);
    document.Accept(writer);
    return text.GetString();
}
