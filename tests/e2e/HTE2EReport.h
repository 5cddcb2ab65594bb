// Reading heft's reports in the tests that run the built heft: the JSON
// document, a process, region or shared table in it and the figures of their
// categories, a row of the text report, and a fixture that runs heft for
// both at once.

#pragma once

#include "e2e/HTE2ESupport.h"

#include <rapidjson/document.h>

#include <sstream>

namespace heft_e2e {

inline constexpr const char* kUntagged = "untagged (\"VM_ALLOCATE\")";

inline bool between(uint64_t value, uint64_t least, uint64_t most) { return least <= value && value <= most; }

inline bool loadReport(const std::string& path, rapidjson::Document& document)
{
    std::string text = readFile(path);
    document.Parse(text.c_str());
    if (document.HasParseError() || !document.IsObject()) {
        ADD_FAILURE() << "no JSON report at " << path << ": " << text.substr(0, 200);
        return false;
    }
    return true;
}

inline const rapidjson::Value* member(const rapidjson::Value& object, const std::string& key)
{
    if (!object.IsObject()) return nullptr;
    auto found = object.FindMember(key.c_str());
    return found == object.MemberEnd() ? nullptr : &found->value;
}

inline uint64_t number(const rapidjson::Value& object, const char* key)
{
    const rapidjson::Value* found = member(object, key);
    return found && found->IsUint64() ? found->GetUint64() : 0;
}

// The elements of the array `key` of `object`; none when it is not one.
inline auto arrayIn(const rapidjson::Value& object, const char* key)
{
    static const rapidjson::Value empty(rapidjson::kArrayType);
    const rapidjson::Value* array = member(object, key);
    return (array && array->IsArray() ? *array : empty).GetArray();
}

inline const rapidjson::Value* processIn(const rapidjson::Value& report, pid_t pid)
{
    for (const auto& process : arrayIn(report, "processes")) {
        if (process.HasMember("pid") && process["pid"].IsInt() && process["pid"].GetInt() == pid) return &process;
    }
    return nullptr;
}

// The region of `process` (listed with -v) that holds `address`; when none
// does, a failure and an empty object, whose figures are all 0.
inline const rapidjson::Value& regionAt(const rapidjson::Value& process, uint64_t address)
{
    for (const auto& region : arrayIn(process, "regions")) {
        uint64_t start = number(region, "addr");
        if (start <= address && address < start + number(region, "vsize")) return region;
    }
    ADD_FAILURE() << "no region holds " << std::hex << address;
    static const rapidjson::Value none(rapidjson::kObjectType);
    return none;
}

inline std::string nameOf(const rapidjson::Value& object)
{
    const rapidjson::Value* name = member(object, "name");
    return name && name->IsString() ? name->GetString() : "";
}

// The category of a process's own memory, or of a shared table.
inline const rapidjson::Value* categoryIn(const rapidjson::Value& owner, const std::string& name)
{
    const rapidjson::Value* categories = member(owner, "categories");
    return categories ? member(*categories, name) : nullptr;
}

// A figure of a category of `owner`: 0 when either is missing.
inline uint64_t figure(const rapidjson::Value* owner, const std::string& category, const char* key)
{
    const rapidjson::Value* found = owner ? categoryIn(*owner, category) : nullptr;
    return found ? number(*found, key) : 0;
}

inline std::set<int> pidsOf(const rapidjson::Value& shared)
{
    std::set<int> pids;
    for (const auto& pid : arrayIn(shared, "pids")) pids.insert(pid.GetInt());
    return pids;
}

// The table common to exactly `pids`; null when there is none.
inline const rapidjson::Value* sharedBy(const rapidjson::Value& report, const std::set<int>& pids)
{
    for (const auto& shared : arrayIn(report, "shared")) {
        if (!shared.HasMember("specific_to_pid") && pidsOf(shared) == pids) return &shared;
    }
    return nullptr;
}

// The first table row of `category` in the text report (printed with -v -w
// -f bytes, which name categories in full) shows the same figures as the
// JSON report gives the category: dirty, swapped, clean, reclaimable, wired
// and regions.
inline void expectTextRowShows(const std::string& report, const std::string& category, const rapidjson::Value* figures)
{
    ASSERT_NE(figures, nullptr) << report;
    std::vector<uint64_t> expected, numbers;
    for (const char* key : {"dirty", "swapped", "clean", "reclaimable", "wired", "regions"})
        expected.push_back(number(*figures, key));
    std::istringstream lines(report);
    const std::string ending = "    " + category;
    for (std::string line; numbers.size() != 6 && std::getline(lines, line);) {
        numbers.clear();
        std::istringstream words(line.ends_with(ending) ? line.substr(0, line.size() - ending.size()) : "");
        for (std::string word; words >> word;) {
            if (word != "B") numbers.push_back(std::strtoull(word.c_str(), nullptr, 10));
        }
    }
    EXPECT_EQ(numbers, expected) << report;
}

// A process's heft against the kernel's own count of what cannot be taken
// back from it, read right after heft ran while the process sat still.
// `cleanedSince` is how much of the count writeback may have cleaned in
// between (dirty file pages); anonymous memory of a blocked process stays as
// it is, so for it the two must agree exactly. The kernel's figures are read
// through `thread` when it is given.
inline void expectHeftMatchesKernel(const rapidjson::Value& report, pid_t pid, uint64_t cleanedSince = 0,
                                    pid_t thread = 0)
{
    const rapidjson::Value* process = processIn(report, pid);
    ASSERT_NE(process, nullptr) << "pid " << pid;
    uint64_t kernel = kernelHeft(pid, false, thread);
    EXPECT_PRED3(between, number(*process, "heft"), kernel, kernel + cleanedSince) << "pid " << pid;
}

class HTE2EReportTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(directory_.ok()) << "mkdtemp: " << std::strerror(errno); }

    // Runs heft for the text report with every region and figure in bytes,
    // and for the JSON report, which it parses into `report`.
    Outcome runForReport(std::vector<std::string> arguments, rapidjson::Document& report)
    {
        std::string path = directory_.file("report.json");
        unlink(path.c_str());
        arguments.insert(arguments.begin(), {"-v", "-w", "-f", "bytes", "-j", path});
        Outcome outcome = runHeft(arguments);
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        loadReport(path, report);
        return outcome;
    }

    TempDir directory_;
};

}  // namespace heft_e2e
