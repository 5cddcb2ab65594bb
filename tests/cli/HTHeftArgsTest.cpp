#include "cli/HTHeftArgs.h"

#include "output/HTExpectedReport.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

namespace {

std::string joined(const std::vector<std::string>& values)
{
    std::string text;
    for (const auto& value : values) text += (text.empty() ? "" : ",") + value;
    return text;
}

// Parses "heft" and the words of `line` ("_" stands for a blank inside a
// word), as main would receive them. Returns everything the command line
// said in one line: the switches that are on, the text report's format,
// option bits and sort column, then the file and the targets; or the error.
std::string parsed(const std::string& line, std::string* standardError)
{
    std::vector<std::string> words{"heft", ""};
    for (char c : line + " ")
        if (c != ' ')
            words.back() += c == '_' ? ' ' : c;
        else if (!words.back().empty())
            words.emplace_back();
    words.pop_back();
    std::vector<char*> argv;
    for (auto& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);
    HTError error;
    testing::internal::CaptureStderr();
    auto args = HTHeftArgs::initWithArgc(static_cast<int>(words.size()), argv.data(), &error);
    *standardError = testing::internal::GetCapturedStderr();
    if (!args) return "error " + std::to_string(error.code) + (error.description ? ": " + *error.description : "");

    const HTSettings settings = args->settings();
    const HTTargetSelection::Request request = args->targetRequest();
    std::string text;
    auto flag = [&](bool on, const char* name) { text += on ? std::string(name) + " " : ""; };
    flag(request.targetAll, "all");
    flag(request.targetChildren, "children");
    flag(request.skipIdleExitClean, "skip");
    flag(request.searchForUnmapped, "unmapped");
    flag(!settings.breakDownPhysHeft, "vmObjectDirty");
    flag(settings.verbose, "verbose");
    flag(!settings.summarize, "full");
    text += "f" + std::to_string(settings.summaryFormat) + " o" + std::to_string(settings.textOptions) + " " +
        settings.textSort;
    if (args->JSONOutputFile()) text += " j=" + *args->JSONOutputFile();
    if (!request.potentialTargetProcesses.empty()) text += " t=" + joined(request.potentialTargetProcesses);
    std::vector<std::string> pids;
    for (const auto& [pid, name] : request.targetPids) pids.push_back(std::to_string(pid) + (name ? "?" : ""));
    if (!pids.empty()) text += " p=" + joined(pids);
    if (!request.excludedPidsOrProcesses.empty()) text += " x=" + joined(request.excludedPidsOrProcesses);
    if (args->runsProgram()) text += " exec=" + joined(args->programArguments());
    // -a and --unmapped are what need root.
    EXPECT_EQ(args->targetAll(), request.targetAll);
    EXPECT_EQ(args->searchForUnmapped(), request.searchForUnmapped);
    EXPECT_TRUE(request.excludeSelf);
    return text;
}

TEST(HTHeftArgsTest, CommandLinesAndWhatTheySay)
{
    const std::string name = "cli/command-lines";
    std::istringstream lines(contentsOf(std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name + ".scenario"));
    std::string said;
    for (std::string line; std::getline(lines, line);) {
        if (line.rfind("heft", 0) != 0) continue;
        std::string written;
        said += line + "\n  " + parsed(line.substr(4), &written) + "\n";
        if (!written.empty()) said += "  standard error: " + written;
    }
    expectReport(name + ".txt", said);
}

}  // namespace
