#pragma once

// Expected reports are files under tests/data/reports/ (see the README
// there). With HEFT_UPDATE_REPORTS=1 every report a test compares is
// written back from what heft prints now, and the diff of tests/data/
// shows what changed.

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <iomanip>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

// The whole of a file.
inline std::string contentsOf(const std::string& path)
{
    std::stringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

inline void expectReport(const std::string& name, const std::string& actual)
{
    const std::string path = std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name;
    const char* update = std::getenv("HEFT_UPDATE_REPORTS");
    if (update && *update && std::string(update) != "0") {
        std::ofstream(path, std::ios::binary) << actual;
        return;
    }
    EXPECT_EQ(actual, contentsOf(path)) << "differs from " << path << "; HEFT_UPDATE_REPORTS=1 rewrites it";
}

// One line of a scenario: a keyword, then pairs of a key and a value, with
// one value before the pairs when the count is odd. Values may be quoted;
// %XX stands for the byte XX. A line starting with `#` is a comment.
struct HTScenarioLine {
    std::string kind, argument;
    std::multimap<std::string, std::string> fields;

    explicit HTScenarioLine(const std::string& line)
    {
        std::istringstream in(line);
        std::vector<std::string> words;
        for (std::string word; in >> std::quoted(word);) words.push_back(decoded(word));
        if (words.empty() || words[0][0] == '#') return;
        kind = words[0];
        size_t at = 1;
        if (words.size() % 2 == 0) argument = words[at++];
        for (; at + 1 < words.size(); at += 2) fields.emplace(words[at], words[at + 1]);
    }

    std::optional<std::string> text(const char* key) const
    {
        auto found = fields.find(key);
        return found == fields.end() ? std::nullopt : std::optional<std::string>(found->second);
    }
    uint64_t number(const char* key, uint64_t fallback = 0) const
    {
        return text(key) ? std::stoull(*text(key), nullptr, 0) : fallback;
    }
    // `text` with each %XX replaced by the byte XX.
    static std::string decoded(std::string text)
    {
        for (size_t at = 0; (at = text.find('%', at)) != std::string::npos; ++at)
            text.replace(at, 3, 1, static_cast<char>(std::stoi(text.substr(at + 1, 2), nullptr, 16)));
        return text;
    }
};
