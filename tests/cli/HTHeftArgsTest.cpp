#include "cli/HTHeftArgs.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>
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
    // -a and --unmapped are what need root.
    EXPECT_EQ(args->targetAll(), request.targetAll);
    EXPECT_EQ(args->searchForUnmapped(), request.searchForUnmapped);
    EXPECT_TRUE(request.excludeSelf);
    return text;
}

TEST(HTHeftArgsTest, CommandLinesAndWhatTheySay)
{
    const std::string unmappedIgnored = "WARNING: ignoring '--unmapped' because the requested analysis mode "
                                        "'--vmObjectDirty' does not support unmapped owned VM objects\n";
    const std::string summary = "WARNING: -y/--summary options are deprecated because summary is the default mode\n";
    const std::string badSort = "error 3: Unrecognized argument 'size' to --sort.\nAccepted arguments: dirty, "
                                "swapped, clean, reclaimable, wired, regions, category";
    const std::string badFormat =
        "error 2: Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.";
    auto badPid = [](const char* pid) {
        return "error 4: '" + std::string(pid) +
            "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name.";
    };
    // The command line, what it says, and what it wrote to standard error
    // ("heft: *": a line from the option parser).
    const std::tuple<const char*, std::string, std::string> rows[] = {
        {"", "f1 o0 Dirty", ""},
        // Later values override; sets accumulate, each member once.
        {"-a -t -s -j a.json --json b.json -f pages --format bytes", "all children skip f0 o0 Dirty j=b.json", ""},
        {"-x 7 --exclude name -x 7 --format formatted", "f1 o0 Dirty x=7,name", ""},
        // -v trades the summary for the full listing; the column options are bits.
        {"-v", "verbose full f1 o0 Dirty", ""},
        {"--wired", "f1 o1 Dirty", ""},
        {"--swapped --wired", "f1 o3 Dirty", ""},
        {"-w --wired", "f1 o7 Dirty", ""},
        {"--swapped --wide", "f1 o7 Dirty", ""},
        // Sort columns match in any case and are stored as named.
        {"--sort regions", "f1 o0 Regions", ""},
        {"--sort cAtEgOrY", "f1 o0 Category", ""},
        {"--sort wired --sort reclaimable", "f1 o0 Reclaimable", ""},
        // Pids are whole numbers in range, leading blanks allowed.
        {"--pid 42 --pid _7 --pid 0 --pid 2147483647", "f1 o0 Dirty p=42,7,0,2147483647", ""},
        // Options are taken in order wherever they stand, operands after
        // them; --pid between two --proc options is not one of them; -p does
        // not read its argument as a number.
        {"7 x -p 9 7 --proc x --pid 12 --proc y 9 z", "f1 o0 Dirty t=9,x,y,7,z p=12", ""},
        {"-p 42x", "f1 o0 Dirty t=42x", ""},
        {"--unmapped 7", "unmapped f1 o0 Dirty t=7", ""},
        // --unmapped is settled after every option: the mode given after it
        // still wins, and -a makes it redundant. Deprecated options only warn.
        {"-y", "f1 o0 Dirty", summary},
        {"--physHeft --summary", "f1 o0 Dirty",
         "WARNING: --physHeft option is deprecated because it is the default mode\n" + summary},
        {"--vmObjectDirty --unmapped", "vmObjectDirty f1 o0 Dirty", unmappedIgnored},
        {"--unmapped --vmObjectDirty -a", "all vmObjectDirty f1 o0 Dirty", unmappedIgnored},
        {"--unmapped --all", "all f1 o0 Dirty", "NOTICE: '--unmapped' is redundant when using -a/--all\n"},
        // Trailing characters, values that would wrap to another pid, and
        // negative numbers name no process; the format must match exactly.
        {"--sort size", badSort, ""},
        {"--pid 5 --pid 42x", badPid("42x"), ""},
        {"--pid 12_abc", badPid("12 abc"), ""},
        {"--pid -7", badPid("-7"), ""},
        {"--pid 2147483648", badPid("2147483648"), ""},
        {"--pid 4294967297", badPid("4294967297"), ""},
        {"-f Bytes", badFormat, ""},
        {"-f page", badFormat, ""},
        // Help stops the parse; the option parser names other culprits itself.
        {"-a -h --sort size", "error 1", ""},
        {"--help", "error 1", ""},
        {"--bogus", "error 5", "heft: *"},
        {"-q", "error 5", "heft: *"},
        {"-j", "error 5", "heft: *"},
        {"--sort", "error 5", "heft: *"},
        // The parse before stops inside a group of short options; a parser
        // that kept its place would carry the -s into the next command line.
        {"-hs", "error 1", ""},
        {"-t 5", "children f1 o0 Dirty t=5", ""},
    };
    for (const auto& [line, said, standardError] : rows) {
        std::string written;
        EXPECT_EQ(parsed(line, &written), said) << line;
        if (standardError == "heft: *")
            EXPECT_EQ(written.rfind("heft: ", 0), 0u) << line << ": " << written;
        else
            EXPECT_EQ(written, standardError) << line;
    }
}

}  // namespace
