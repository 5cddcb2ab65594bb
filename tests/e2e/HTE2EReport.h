// Reading heft's JSON report in the tests that run the built heft: the
// document, a process in it, and the figures of its categories.

#pragma once

#include "e2e/HTE2ESupport.h"

#include <rapidjson/document.h>

#include <cstdint>
#include <string>

namespace heft_e2e {

inline bool loadReport(const std::string& path, rapidjson::Document& document)
{
    std::string text;
    if (!SwapArea::readWholeFile(path, text)) {
        ADD_FAILURE() << "no JSON report at " << path;
        return false;
    }
    document.Parse(text.c_str());
    if (document.HasParseError() || !document.IsObject()) {
        ADD_FAILURE() << "the JSON report does not parse: " << text.substr(0, 200);
        return false;
    }
    return true;
}

inline const rapidjson::Value* processIn(const rapidjson::Document& report, pid_t pid)
{
    if (!report.HasMember("processes") || !report["processes"].IsArray()) return nullptr;
    for (const auto& process : report["processes"].GetArray()) {
        if (process.HasMember("pid") && process["pid"].IsInt() && process["pid"].GetInt() == pid) return &process;
    }
    return nullptr;
}

inline uint64_t number(const rapidjson::Value& object, const char* key)
{
    if (!object.IsObject() || !object.HasMember(key) || !object[key].IsUint64()) return 0;
    return object[key].GetUint64();
}

inline const rapidjson::Value* member(const rapidjson::Value& object, const std::string& key)
{
    if (!object.IsObject()) return nullptr;
    auto found = object.FindMember(key.c_str());
    return found == object.MemberEnd() ? nullptr : &found->value;
}

// The categories object of a process's own memory, or of a shared entry.
inline const rapidjson::Value* categoryIn(const rapidjson::Value& owner, const std::string& name)
{
    const rapidjson::Value* categories = member(owner, "categories");
    return categories ? member(*categories, name) : nullptr;
}

}  // namespace heft_e2e
