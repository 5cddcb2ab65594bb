#include "cli/HTHeftArgs.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

namespace {

struct Parsed {
    std::unique_ptr<HTHeftArgs> args;
    HTError error;
    std::string standardError;
};

// Parses "heft" followed by `arguments`, as main would receive them.
Parsed parse(std::vector<std::string> arguments)
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

// Parses `arguments`, which must fail with `code` and `description`.
Parsed rejected(std::vector<std::string> arguments, int code, const std::optional<std::string>& description)
{
    Parsed parsed = parse(std::move(arguments));
    EXPECT_FALSE(parsed.args);
    EXPECT_EQ(parsed.error.domain, "HTHeftError");
    EXPECT_EQ(parsed.error.code, code);
    EXPECT_EQ(parsed.error.description, description);
    return parsed;
}

std::vector<int32_t> pidsOf(const HTHeftArgs& args) { return args.targetPids().keys(); }

TEST(HTHeftArgsTest, DefaultsWithoutOptions)
{
    Parsed parsed = parse({});
    ASSERT_TRUE(parsed.args);
    const HTHeftArgs& args = *parsed.args;
    EXPECT_TRUE(args.summarize());
    EXPECT_TRUE(args.shouldGetPhysHeftBreakdown());
    EXPECT_FALSE(args.didSetShouldGetPhysHeftBreakdown());
    EXPECT_TRUE(args.excludeSelf());
    EXPECT_EQ(args.summaryFormat(), 1);
    EXPECT_EQ(args.textSort(), "Dirty");
    EXPECT_TRUE(args.targetPids().empty() && args.potentialTargetProcesses().empty());
    EXPECT_EQ(parsed.standardError, "");
}

TEST(HTHeftArgsTest, LaterOptionsOverrideAndSetsAccumulate)
{
    Parsed parsed = parse({"-a", "-t", "-s", "-j", "first.json", "--json", "second.json", "-f", "pages", "--format",
                           "bytes", "-x", "7", "--exclude", "name", "-x", "7", "-v"});
    ASSERT_TRUE(parsed.args);
    const HTHeftArgs& args = *parsed.args;
    EXPECT_TRUE(args.targetAll());
    EXPECT_TRUE(args.targetChildren());
    EXPECT_TRUE(args.skipIdleExitClean());
    EXPECT_EQ(args.JSONOutputFile(), "second.json");
    EXPECT_EQ(args.summaryFormat(), 0);
    EXPECT_EQ(args.excludedPidsOrProcesses().values(), (std::vector<std::string>{"7", "name"}));
    // -v trades the summary for the full listing.
    EXPECT_TRUE(args.spanlistLikeOutput());
    EXPECT_FALSE(args.summarize());

    parsed = parse({"--format", "formatted"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(parsed.args->summaryFormat(), 1);
}

TEST(HTHeftArgsTest, ColumnOptionsAreBitSets)
{
    EXPECT_EQ(parse({"--wired"}).args->textOptions(), 1);
    EXPECT_EQ(parse({"--swapped"}).args->textOptions(), 2);
    EXPECT_EQ(parse({"--swapped", "--wired"}).args->textOptions(), 3);
    EXPECT_EQ(parse({"-w", "--wired"}).args->textOptions(), 7);
    EXPECT_EQ(parse({"--swapped", "--wide"}).args->textOptions(), 7);
}

TEST(HTHeftArgsTest, SortMatchesAnyCaseAndStoresTheColumnName)
{
    EXPECT_EQ(parse({"--sort", "regions"}).args->textSort(), "Regions");
    EXPECT_EQ(parse({"--sort", "DIRTY"}).args->textSort(), "Dirty");
    EXPECT_EQ(parse({"--sort", "cAtEgOrY"}).args->textSort(), "Category");
    EXPECT_EQ(parse({"--sort", "wired", "--sort", "reclaimable"}).args->textSort(), "Reclaimable");
}

TEST(HTHeftArgsTest, PidValuesAreWholeNumbersInRange)
{
    Parsed parsed = parse({"--pid", "42", "--pid", " 7", "--pid", "0", "--pid", "2147483647"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(pidsOf(*parsed.args), (std::vector<int32_t>{42, 7, 0, 2147483647}));
    for (const auto& entry : parsed.args->targetPids()) EXPECT_FALSE(entry.second) << entry.first;
    EXPECT_TRUE(parsed.args->potentialTargetProcesses().empty());
}

TEST(HTHeftArgsTest, BadValuesAreRejectedWithTheirOwnCodeAndRemedy)
{
    rejected({"--sort", "size"}, 3,
             "Unrecognized argument 'size' to --sort.\nAccepted arguments: dirty, swapped, clean, reclaimable, wired, "
             "regions, category");
    // Trailing characters, values that would wrap to another pid, and
    // negative numbers name no process.
    for (const char* value : {"abc", "42x", "12 abc", "", "-7", "2147483648", "4294967297", "99999999999999999999"}) {
        SCOPED_TRACE(value);
        rejected({"--pid", "5", "--pid", value}, 4,
                 std::string("'") + value +
                     "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name.");
    }
    // The format must match exactly.
    for (const char* value : {"bad", "Bytes", "page", ""}) {
        SCOPED_TRACE(value);
        rejected({"-f", value}, 2,
                 "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
    }
}

TEST(HTHeftArgsTest, HelpAndParserErrorsCarryNoDescription)
{
    // Parsing stops at the first error; help leaves standard error alone.
    for (const char* help : {"-h", "--help"})
        EXPECT_EQ(rejected({"-a", help, "--sort", "size"}, 1, std::nullopt).standardError, "") << help;
    // The option parser names the culprit itself.
    for (std::vector<std::string> bad : {std::vector<std::string>{"--bogus"}, {"-q"}, {"-j"}, {"--sort"}}) {
        SCOPED_TRACE(bad[0]);
        EXPECT_NE(rejected(bad, 5, std::nullopt).standardError.find("heft: "), std::string::npos);
    }

    // Without an error slot a failure is silent.
    std::string program = "heft";
    std::string help = "-h";
    char* argv[] = {program.data(), help.data(), nullptr};
    EXPECT_FALSE(HTHeftArgs::initWithArgc(2, argv, nullptr));
}

TEST(HTHeftArgsTest, DeprecatedOptionsOnlyWarn)
{
    Parsed parsed = parse({"-y"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(parsed.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n");
    EXPECT_TRUE(parsed.args->summarize());
    EXPECT_FALSE(parsed.args->spanlistLikeOutput());

    parsed = parse({"--physHeft", "--summary"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(parsed.standardError,
              "WARNING: --physHeft option is deprecated because it is the default mode\n"
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n");
    EXPECT_TRUE(parsed.args->shouldGetPhysHeftBreakdown());
    EXPECT_FALSE(parsed.args->didSetShouldGetPhysHeftBreakdown());
}

TEST(HTHeftArgsTest, UnmappedIsSettledAfterAllOptions)
{
    Parsed parsed = parse({"--unmapped", "7"});
    ASSERT_TRUE(parsed.args);
    EXPECT_TRUE(parsed.args->searchForUnmapped());
    EXPECT_EQ(parsed.standardError, "");

    // The mode given after --unmapped still wins.
    for (std::vector<std::string> arguments :
         {std::vector<std::string>{"--vmObjectDirty", "--unmapped"}, {"--unmapped", "--vmObjectDirty", "-a"}}) {
        parsed = parse(arguments);
        ASSERT_TRUE(parsed.args);
        EXPECT_FALSE(parsed.args->searchForUnmapped());
        EXPECT_FALSE(parsed.args->shouldGetPhysHeftBreakdown());
        EXPECT_TRUE(parsed.args->didSetShouldGetPhysHeftBreakdown());
        EXPECT_EQ(parsed.standardError,
                  "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
                  "support unmapped owned VM objects\n");
    }

    parsed = parse({"--unmapped", "--all"});
    ASSERT_TRUE(parsed.args);
    EXPECT_FALSE(parsed.args->searchForUnmapped());
    EXPECT_TRUE(parsed.args->targetAll());
    EXPECT_EQ(parsed.standardError, "NOTICE: '--unmapped' is redundant when using -a/--all\n");
}

TEST(HTHeftArgsTest, OperandsAndProcOptionsFormOneOrderedSet)
{
    // Options are taken in order wherever they stand; the operands follow.
    // --pid between two --proc options must not be mistaken for one.
    Parsed parsed = parse({"7", "x", "-p", "9", "7", "--proc", "x", "--pid", "12", "--proc", "y", "9", "z"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(parsed.args->potentialTargetProcesses().values(), (std::vector<std::string>{"9", "x", "y", "7", "z"}));
    EXPECT_EQ(pidsOf(*parsed.args), (std::vector<int32_t>{12}));

    // -p does not read its argument as a number.
    parsed = parse({"-p", "42x"});
    ASSERT_TRUE(parsed.args);
    EXPECT_EQ(parsed.args->potentialTargetProcesses().values(), (std::vector<std::string>{"42x"}));
    EXPECT_TRUE(parsed.args->targetPids().empty());
}

TEST(HTHeftArgsTest, EachParseStartsAfresh)
{
    // The first parse stops inside a group of short options; a parser that
    // kept its place would carry the -s into the next command line.
    EXPECT_FALSE(parse({"-hs"}).args);
    Parsed parsed = parse({"-t", "5"});
    ASSERT_TRUE(parsed.args);
    EXPECT_TRUE(parsed.args->targetChildren());
    EXPECT_FALSE(parsed.args->skipIdleExitClean());
    EXPECT_EQ(parsed.args->potentialTargetProcesses().values(), (std::vector<std::string>{"5"}));
}

}  // namespace
