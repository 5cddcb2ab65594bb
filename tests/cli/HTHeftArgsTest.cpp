#include "cli/HTHeftArgs.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

namespace {

using Arguments = std::vector<std::string>;

struct Parsed {
    std::unique_ptr<HTHeftArgs> args;
    HTError error;
    std::string standardError;
};

// Parses "heft" followed by `arguments`, as main would receive them.
Parsed parse(Arguments arguments)
{
    arguments.insert(arguments.begin(), "heft");
    std::vector<char*> argv;
    for (auto& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    Parsed parsed;
    testing::internal::CaptureStderr();
    parsed.args = HTHeftArgs::initWithArgc(static_cast<int>(arguments.size()), argv.data(), &parsed.error);
    parsed.standardError = testing::internal::GetCapturedStderr();
    return parsed;
}

std::string joined(const std::vector<std::string>& values)
{
    std::string text;
    for (const auto& value : values) text += (text.empty() ? "" : ",") + value;
    return text;
}

// Everything a command line said, in one line: the switches that are on,
// the text report's format, option bits and sort column, then the file and
// the targets.
std::string described(const HTHeftArgs& args)
{
    const HTSettings settings = args.settings();
    const HTTargetSelection::Request request = args.targetRequest();
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
    if (args.JSONOutputFile()) text += " j=" + *args.JSONOutputFile();
    if (!request.potentialTargetProcesses.empty()) text += " t=" + joined(request.potentialTargetProcesses);
    std::vector<std::string> pids;
    for (const auto& [pid, name] : request.targetPids) pids.push_back(std::to_string(pid) + (name ? "?" : ""));
    if (!pids.empty()) text += " p=" + joined(pids);
    if (!request.excludedPidsOrProcesses.empty()) text += " x=" + joined(request.excludedPidsOrProcesses);
    // -a and --unmapped are what need root.
    EXPECT_EQ(args.targetAll(), request.targetAll);
    EXPECT_EQ(args.searchForUnmapped(), request.searchForUnmapped);
    EXPECT_TRUE(request.excludeSelf);
    return text;
}

// The words of `text`; "_" stands for a blank inside a word.
Arguments words(const std::string& text)
{
    Arguments result(1);
    for (char c : text) {
        if (c != ' ')
            result.back() += c == '_' ? ' ' : c;
        else if (!result.back().empty())
            result.emplace_back();
    }
    if (result.back().empty()) result.pop_back();
    return result;
}

TEST(HTHeftArgsTest, CommandLinesAndWhatTheySay)
{
    const std::pair<const char*, const char*> rows[] = {
        {"", "f1 o0 Dirty"},
        // Later values override; sets accumulate, each member once.
        {"-a -t -s -j a.json --json b.json -f pages --format bytes", "all children skip f0 o0 Dirty j=b.json"},
        {"-x 7 --exclude name -x 7 --format formatted", "f1 o0 Dirty x=7,name"},
        // -v trades the summary for the full listing.
        {"-v", "verbose full f1 o0 Dirty"},
        // The column options are bits.
        {"--wired", "f1 o1 Dirty"},
        {"--swapped --wired", "f1 o3 Dirty"},
        {"-w --wired", "f1 o7 Dirty"},
        {"--swapped --wide", "f1 o7 Dirty"},
        // Sort columns match in any case and are stored as named.
        {"--sort regions", "f1 o0 Regions"},
        {"--sort cAtEgOrY", "f1 o0 Category"},
        {"--sort wired --sort reclaimable", "f1 o0 Reclaimable"},
        // Pids are whole numbers in range, leading blanks allowed.
        {"--pid 42 --pid _7 --pid 0 --pid 2147483647", "f1 o0 Dirty p=42,7,0,2147483647"},
        // Options are taken in order wherever they stand, operands after
        // them; --pid between two --proc options is not one of them; -p does
        // not read its argument as a number.
        {"7 x -p 9 7 --proc x --pid 12 --proc y 9 z", "f1 o0 Dirty t=9,x,y,7,z p=12"},
        {"-p 42x", "f1 o0 Dirty t=42x"},
        {"--unmapped 7", "unmapped f1 o0 Dirty t=7"},
    };
    for (const auto& [arguments, expected] : rows) {
        Parsed parsed = parse(words(arguments));
        ASSERT_TRUE(parsed.args) << arguments;
        EXPECT_EQ(described(*parsed.args), expected) << arguments;
        EXPECT_EQ(parsed.standardError, "") << arguments;
    }
}

TEST(HTHeftArgsTest, WarningsAndHowTheyAreSettled)
{
    const std::string unmappedIgnored = "WARNING: ignoring '--unmapped' because the requested analysis mode "
                                        "'--vmObjectDirty' does not support unmapped owned VM objects\n";
    const std::string summary = "WARNING: -y/--summary options are deprecated because summary is the default mode\n";
    const std::string physHeft = "WARNING: --physHeft option is deprecated because it is the default mode\n";
    // --unmapped is settled after every option: the mode given after it
    // still wins, and -a makes it redundant. Deprecated options only warn.
    const std::tuple<const char*, const char*, std::string> rows[] = {
        {"-y", "f1 o0 Dirty", summary},
        {"--physHeft --summary", "f1 o0 Dirty", physHeft + summary},
        {"--vmObjectDirty --unmapped", "vmObjectDirty f1 o0 Dirty", unmappedIgnored},
        {"--unmapped --vmObjectDirty -a", "all vmObjectDirty f1 o0 Dirty", unmappedIgnored},
        {"--unmapped --all", "all f1 o0 Dirty", "NOTICE: '--unmapped' is redundant when using -a/--all\n"},
    };
    for (const auto& [arguments, expected, standardError] : rows) {
        Parsed parsed = parse(words(arguments));
        ASSERT_TRUE(parsed.args) << arguments;
        EXPECT_EQ(described(*parsed.args), expected) << arguments;
        EXPECT_EQ(parsed.standardError, standardError) << arguments;
    }
}

TEST(HTHeftArgsTest, BadCommandLinesAndTheirErrors)
{
    const std::string badSort = "Unrecognized argument 'size' to --sort.\nAccepted arguments: dirty, swapped, clean, "
                                "reclaimable, wired, regions, category";
    const std::string badFormat =
        "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.";
    // Trailing characters, values that would wrap to another pid, and
    // negative numbers name no process; the format must match exactly.
    const std::pair<const char*, std::string> rejected[] = {
        {"--sort size", badSort},
        {"--pid 5 --pid 42x", "42x"},
        {"--pid 12_abc", "12 abc"},
        {"--pid -7", "-7"},
        {"--pid 2147483648", "2147483648"},
        {"--pid 4294967297", "4294967297"},
        {"-f Bytes", badFormat},
        {"-f page", badFormat},
    };
    for (const auto& [arguments, description] : rejected) {
        Parsed parsed = parse(words(arguments));
        EXPECT_FALSE(parsed.args) << arguments;
        EXPECT_EQ(parsed.error.domain, "HTHeftError");
        const bool pid = description.size() < 20;
        EXPECT_EQ(parsed.error.code, pid ? 4 : description == badSort ? 3 : 2) << arguments;
        EXPECT_EQ(parsed.error.description,
                  pid ? "'" + description +
                          "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process "
                          "name."
                      : description);
        EXPECT_EQ(parsed.standardError, "") << arguments;
    }
    // Help stops the parse; the option parser names other culprits itself,
    // so their errors carry no text.
    const std::pair<const char*, int64_t> silent[] = {
        {"-a -h --sort size", 1}, {"--help", 1}, {"--bogus", 5}, {"-q", 5}, {"-j", 5}, {"--sort", 5}};
    for (const auto& [arguments, code] : silent) {
        Parsed parsed = parse(words(arguments));
        EXPECT_FALSE(parsed.args) << arguments;
        EXPECT_EQ(parsed.error.code, code) << arguments;
        EXPECT_EQ(parsed.error.description, std::nullopt) << arguments;
        EXPECT_EQ(parsed.standardError.rfind("heft: ", 0) == 0, code == 5) << parsed.standardError;
    }
    // The first parse stops inside a group of short options; a parser that
    // kept its place would carry the -s into the next command line.
    EXPECT_FALSE(parse({"-hs"}).args);
    EXPECT_EQ(described(*parse({"-t", "5"}).args), "children f1 o0 Dirty t=5");
}

}  // namespace
