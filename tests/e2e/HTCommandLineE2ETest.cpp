// The built heft, run as a user runs it: its exact output on both streams
// and its exit status, for every way the command line can end a run before
// the analysis, and for a run that selects a live process.

#include "e2e/HTE2ESupport.h"

#include <gmock/gmock.h>
#include <rapidjson/document.h>

namespace {

using namespace heft_e2e;
using testing::AllOf, testing::AnyOf, testing::EndsWith, testing::HasSubstr, testing::StartsWith;

// Written out in full so that any change to the usage text shows up here.
constexpr const char* kUsage =
    "Gather memory information about a process or set of processes\n"
    "Usage: heft [args] [proc/pid/snapfile [proc/pid/snapfile [...]]]\n"
    "\t-a, --all \t\t\t\ttarget all processes\n"
    "\t-j, --json <file> \t\t\tprint json output to a file\n"
    "\t-h, --help \t\t\t\tprint this output\n"
    "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)\n"
    "\t-x, --exclude [proc/pid] \t\texclude pid or process\n"
    "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean\n"
    "\t-v \t\t\t\t\tprint all regions and spanlist-like output of address space layout (default output is a "
    "summary)\n"
    "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)\n"
    "\t--sort <column> \t\t\tchange the column used for sorting (default: dirty)\n"
    "\t-w, --wide\t\t\t\tshow wide output with all columns and full paths (implies --swapped --wired)\n"
    "\t--swapped\t\t\t\tshow swapped/compressed column\n"
    "\t--wired\t\t\t\t\tshow wired column\n"
    "\t--vmObjectDirty\t\t\tinterpret dirty memory as viewed by VM objects in the kernel\n"
    "\t--unmapped\t\t\t\tsearch all processes for unmapped memory owned by the target processes\n";

constexpr const char* kNoProcesses =
    "Unable to find any processes matching the supplied process names or pids (try as root?)\n";
constexpr const char* kRedundant = "NOTICE: '--unmapped' is redundant when using -a/--all\n";
constexpr const char* kNoTarget = "Must specify at least one process or snapfile\n";

MATCHER_P(HoldsOnce, text, "holds \"" + std::string(text) + "\" once")
{
    size_t first = arg.find(text);
    return first != std::string::npos && arg.find(text, first + 1) == std::string::npos;
}

struct Run {
    std::vector<std::string> arguments;
    int status;
    testing::Matcher<const std::string&> standardError;
    testing::Matcher<const std::string&> standardOutput;
};

void expectRuns(const std::vector<Run>& runs, Outcome (*run)(std::vector<std::string>))
{
    for (const Run& expected : runs) {
        std::string command;
        for (const auto& argument : expected.arguments) command += " " + argument;
        SCOPED_TRACE("heft" + command);
        Outcome outcome = run(expected.arguments);
        EXPECT_EQ(outcome.status, expected.status);
        EXPECT_THAT(outcome.standardError, expected.standardError);
        EXPECT_THAT(outcome.standardOutput, expected.standardOutput);
    }
}

TEST(HTCommandLineE2ETest, RunsThatEndBeforeTheAnalysisPrintTheirMessages)
{
    // The messages of the argument parser are checked where it is tested;
    // here, that the program prints them on standard error, the usage after
    // them, and fails.
    // The option parser's own complaints are the C library's wording, one
    // line naming heft and the option.
    const auto parserMessage = AllOf(StartsWith("Unrecognized argument"), EndsWith(".\n"));
    const auto complaint = [](const char* option) {
        return AllOf(StartsWith("heft: "), HasSubstr(option), HoldsOnce("\n"));
    };
    expectRuns({{{"-h"}, 0, "", kUsage},
                // The usage names the default sort column, whatever --sort said.
                {{"--sort", "Regions", "--help"}, 0, "", kUsage},
                {{"--bogus"}, 1, complaint("'--bogus'"), kUsage},
                {{"1", "-j"}, 1, complaint("'j'"), kUsage},
                {{"-f", "bad", "1"}, 1, parserMessage, kUsage},
                {{"-y"}, 1, AllOf(StartsWith("WARNING: "), EndsWith(kNoTarget)), kUsage},
                {{"heft-e2e-no-such-process"},
                 1,
                 std::string("Unable to find pid for process matching 'heft-e2e-no-such-process'\n") + kNoProcesses,
                 ""}},
               runHeft);
}

TEST(HTCommandLineE2ETest, UnprivilegedRunsNeedingRootStop)
{
    if (geteuid() != 0) GTEST_SKIP() << "running heft as another user needs root";
    if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";
    if (!everyoneMayRun(kHeftBinary) || !everyoneMayRun(HEFT_LAYOUT_PROGRAM))
        GTEST_SKIP() << "the user nobody may not run the programs of this build tree";
    // A process it may not read is reported by pid; when heft tried to open
    // it, the reason follows, naming the process.
    const std::string unanalyzed = "Unable to analyze process with pid 1 (try as root?)\n";
    const std::string unreadable = unanalyzed + kNoProcesses;
    expectRuns({{{"-a"}, 1, "Must run as root.\n", ""},
                {{"--unmapped", "1"}, 1, "Must run as root.\n", ""},
                // The notice comes from parsing, before the privileges are checked.
                {{"-a", "--unmapped"}, 1, std::string(kRedundant) + "Must run as root.\n", ""},
                {{"1"},
                 1,
                 AnyOf(unreadable,
                       AllOf(StartsWith(unanalyzed), HasSubstr(" [1]: could not be opened: "), EndsWith(kNoProcesses))),
                 ""}},
               runHeftAsNobody);
}

TEST(HTCommandLineE2ETest, SelectingALiveProcessReportsItOnceAndWritesTheJSONFile)
{
    HTLayoutChild child({});  // lays out nothing, and waits
    ASSERT_TRUE(child.ready());
    const std::string pid = child.pidString();
    TempDir directory;
    // One process, reported once however often it was named.
    const auto reportedOnce = HoldsOnce(" [" + pid + "]: 64-bit\tHeft: ");
    expectRuns({{{pid}, 0, "", reportedOnce},
                {{"--pid", pid, "-p", pid, pid}, 0, "", reportedOnce},
                {{"--json", directory.file("out.json"), pid}, 0, "", reportedOnce},
                // A JSON file that cannot be created is reported before the
                // analysis, the text report is still written, and the run
                // fails; so does one whose writes fail.
                {{"-j", directory.path, pid},
                 1,
                 "Unable to open JSON output file '" + directory.path + "': Is a directory\n",
                 reportedOnce},
                {{"-j", "/dev/full", pid},
                 1,
                 "Unable to write JSON output file '/dev/full': No space left on device\n",
                 reportedOnce},
                // Excluding the only target leaves nothing to analyse.
                {{pid, "-x", pid}, 1, kNoProcesses, ""}},
               runHeft);
    EXPECT_TRUE(readFile(directory.file("out.json"))
                    .starts_with("{\"unit\":\"byte\",\"bytes per unit\":1,\"processes\":[{\"name\":"));
    EXPECT_EQ(directory.entries(), 1u) << "the temporary file the report was written to is left";

    // A report that cannot be written is said once, and the run fails.
    Outcome full = runProgram("/bin/sh", {"sh", "-c", std::string("exec ") + kHeftBinary + " " + pid + " > /dev/full"});
    EXPECT_EQ(full.status, 1);
    EXPECT_EQ(full.standardError, "Unable to write the report: No space left on device\n");
}

TEST(HTCommandLineE2ETest, KilledRunsLeaveTheEarlierJSONFileAndNoOther)
{
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    TempDir directory;
    const std::string path = directory.file("out.json");
    for (int signal : {SIGTERM, SIGHUP}) {
        SCOPED_TRACE(strsignal(signal));
        {
            std::ofstream earlier(path);
            earlier << "earlier report";
        }
        // The report goes to a small pipe that nobody reads: heft stops in
        // the middle of writing it, its JSON file not yet finished.
        int report[2];
        ASSERT_EQ(pipe2(report, O_CLOEXEC), 0);
        fcntl(report[1], F_SETPIPE_SZ, 4096);
        std::string arguments[] = {"heft", "-a", "-v", "-j", path};
        char* argv[] = {arguments[0].data(), arguments[1].data(), arguments[2].data(),
                        arguments[3].data(), arguments[4].data(), nullptr};
        pid_t heft = fork();
        if (heft == 0) {
            dup2(report[1], STDOUT_FILENO);
            int null = open("/dev/null", O_WRONLY);
            dup2(null, STDERR_FILENO);
            // As a user's shell starts it, whatever this test inherited.
            ::signal(SIGTERM, SIG_DFL);
            ::signal(SIGHUP, SIG_DFL);
            execv(kHeftBinary, argv);
            _exit(127);
        }
        ASSERT_GT(heft, 0);
        close(report[1]);
        for (int waited = 0; waited < 500 && directory.entries() < 2; ++waited) usleep(10 * 1000);
        EXPECT_EQ(directory.entries(), 2u) << "no temporary file beside the JSON file";
        kill(heft, signal);
        int status = 0;
        pid_t ended = 0;
        for (int waited = 0; waited < 500 && (ended = waitpid(heft, &status, WNOHANG)) == 0; ++waited)
            usleep(10 * 1000);
        if (ended == 0) {
            ADD_FAILURE() << "heft did not end on the signal";
            kill(heft, SIGKILL);
            waitpid(heft, &status, 0);
        }
        close(report[0]);
        EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == signal);
        EXPECT_EQ(readFile(path), "earlier report");
        EXPECT_EQ(directory.entries(), 1u);
    }
}

TEST(HTCommandLineE2ETest, HostileNamesAreEscapedInTheTextAndKeptInTheJSON)
{
    // Any user can name a program with a line feed, a tab and a terminal
    // escape, and run it for root's heft to report.
    TempDir directory;
    const std::string name = "evil\n\t\x1B[7mname";
    const std::string program = directory.path + "/" + name;
    std::error_code error;
    std::filesystem::copy_file(HEFT_LAYOUT_PROGRAM, program, error);
    ASSERT_FALSE(error) << error.message();
    HTLayoutChild child({}, HTLayoutChild::kSameUser, program);
    ASSERT_TRUE(child.ready());
    const pid_t pid = child.pid();
    const std::string json = directory.file("out.json");
    Outcome outcome = runHeft({"-v", "-j", json, std::to_string(pid)});

    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_EQ(outcome.standardOutput.find('\x1B'), std::string::npos);
    // The header stays one line. Paths come from the kernel with the line
    // feed already written as "\012"; the rest is escaped too.
    EXPECT_THAT(outcome.standardOutput,
                testing::HasSubstr("evil\\n\\t\\x1B[7mname [" + std::to_string(pid) + "]: 64-bit\tHeft: "));
    EXPECT_THAT(outcome.standardOutput, testing::HasSubstr("__TEXT .../evil\\012\\t\\x1B[7mname\n"));
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(json, report));
    EXPECT_EQ(nameOf(processIn(report, pid)), name);
}

}  // namespace
