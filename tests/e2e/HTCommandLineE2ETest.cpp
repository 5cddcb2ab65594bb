// The built heft run as a user runs it: its exact output on both streams, and its exit status.

#include "e2e/HTE2ESupport.h"

namespace {

using namespace heft_e2e;
using testing::AllOf, testing::AnyOf, testing::EndsWith, testing::HasSubstr, testing::Not, testing::StartsWith;

constexpr const char* kNoProcesses =
    "Unable to find any processes matching the supplied process names or pids (try as root?)\n";

struct Run {
    std::vector<std::string> arguments;
    int status;
    testing::Matcher<const std::string&> standardError, standardOutput;
};

void expectRuns(const std::vector<Run>& runs, Outcome (*run)(std::vector<std::string>))
{
    for (const Run& expected : runs) {
        SCOPED_TRACE(testing::PrintToString(expected.arguments));
        Outcome outcome = run(expected.arguments);
        EXPECT_EQ(outcome.status, expected.status);
        EXPECT_THAT(outcome.standardError, expected.standardError);
        EXPECT_THAT(outcome.standardOutput, expected.standardOutput);
    }
}

TEST(HTCommandLineE2ETest, RunsThatEndBeforeTheAnalysisPrintTheirMessages)
{
    // Messages on standard error, the usage in full after them; the C library's name heft and the option in a line.
    const std::string usage = readFile(std::string(HEFT_TEST_DATA_DIR) + "/usage.txt");
    auto complaint = [](const char* option) { return AllOf(StartsWith("heft: "), HasSubstr(option), HoldsOnce("\n")); };
    const auto noTarget = AllOf(StartsWith("WARNING: "), EndsWith("Must specify at least one process or snapfile\n"));
    const std::string noSuchProcess = "Unable to find pid for process matching 'heft-e2e-no-such-process'\n";
    expectRuns({{{"-h"}, 0, "", usage},
                // The usage names the default sort column, whatever --sort said.
                {{"--sort", "Regions", "--help"}, 0, "", usage},
                {{"--bogus"}, 1, complaint("'--bogus'"), usage},
                {{"1", "-j"}, 1, complaint("'j'"), usage},
                {{"-f", "bad", "1"}, 1, AllOf(StartsWith("Unrecognized argument"), EndsWith(".\n")), usage},
                {{"-y"}, 1, noTarget, usage},
                // A file that is no snapfile, and no process's name.
                {{"/dev/null"}, 1, "Error opening snapfile /dev/null: it is not a regular file\n", usage},
                {{"heft-e2e-no-such-process"}, 1, noSuchProcess + kNoProcesses, ""}},
               runHeft);
}

TEST(HTCommandLineE2ETest, UnprivilegedRunsNeedingRootStop)
{
    if (std::string why = whyNobodyCannotRun(); !why.empty()) GTEST_SKIP() << why;
    // An unreadable process is named by pid, with the reason if heft tried it; the notice comes before the check.
    const std::string unread = "Unable to analyze process with pid 1 (try as root?)\n", root = "Must run as root.\n";
    const auto unopened = AllOf(StartsWith(unread), HasSubstr(" [1]: could not be opened: "), EndsWith(kNoProcesses));
    expectRuns({{{"-a"}, 1, root, ""},
                {{"--unmapped", "1"}, 1, root, ""},
                {{"-a", "--unmapped"}, 1, "NOTICE: '--unmapped' is redundant when using -a/--all\n" + root, ""},
                {{"1"}, 1, AnyOf(unread + kNoProcesses, unopened), ""}},
               runHeftAsNobody);
}

TEST(HTCommandLineE2ETest, SelectingALiveProcessReportsItOnceEscapesItsNameAndWritesTheJSONFile)
{
    // Any user can name a program with a line feed, a tab and a terminal escape, for root's heft to report.
    TempDir directory;
    const std::string name = "evil\n\t\x1B[7mname", json = directory.file("out.json");
    std::error_code error;
    std::filesystem::copy_file(HEFT_LAYOUT_PROGRAM, directory.path + "/" + name, error);
    ASSERT_FALSE(error) << error.message();
    HTLayoutChild child({}, HTLayoutChild::kSameUser, directory.path + "/" + name);  // lays out nothing, and waits
    ASSERT_TRUE(child.ready());
    const std::string pid = child.pidString();
    // Reported once however often named, its header one line; the kernel writes a line feed in a path as "\012".
    const auto reportedOnce = HoldsOnce(" [" + pid + "]: 64-bit\tHeft: ");
    const auto escaped = AllOf(reportedOnce, Not(HasSubstr("\x1B")), HasSubstr("__TEXT .../evil\\012\\t\\x1B[7mname\n"),
                               HasSubstr("evil\\n\\t\\x1B[7mname [" + pid + "]: 64-bit\tHeft: "));
    // A JSON file that cannot be created or written fails the run, after the text report.
    const std::string unopened = "Unable to open JSON output file '" + directory.path + "': Is a directory\n",
                      unwritten = "Unable to write JSON output file '/dev/full': No space left on device\n";
    expectRuns({{{pid}, 0, "", reportedOnce},
                {{"--pid", pid, "-p", pid, pid}, 0, "", reportedOnce},
                {{"-v", "--json", json, pid}, 0, "", escaped},
                {{"-j", directory.path, pid}, 1, unopened, reportedOnce},
                {{"-j", "/dev/full", pid}, 1, unwritten, reportedOnce},
                {{pid, "-x", pid}, 1, kNoProcesses, ""}},  // nothing left to analyse
               runHeft);
    EXPECT_TRUE(readFile(json).starts_with("{\"unit\":\"byte\",\"bytes per unit\":1,\"processes\":[{\"name\":"));
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(json, report));
    EXPECT_EQ(nameOf(processIn(report, child.pid())), name);
    EXPECT_EQ(directory.entries(), 2u) << "besides the program and the report, a temporary file is left";

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
        std::ofstream(path) << "earlier report";
        // The report goes to a small pipe nobody reads: heft stops in the middle, its JSON file unfinished.
        int report[2];
        ASSERT_EQ(pipe2(report, O_CLOEXEC), 0);
        fcntl(report[1], F_SETPIPE_SZ, 4096);
        pid_t heft = fork();
        if (heft == 0) {
            dup2(report[1], STDOUT_FILENO);
            dup2(open("/dev/null", O_WRONLY), STDERR_FILENO);
            ::signal(SIGTERM, SIG_DFL);  // as a user's shell starts it, whatever this test inherited
            ::signal(SIGHUP, SIG_DFL);
            const char* argv[] = {"heft", "-a", "-v", "-j", path.c_str(), nullptr};
            execv(kHeftBinary, const_cast<char**>(argv));
            _exit(127);
        }
        ASSERT_GT(heft, 0);
        close(report[1]);
        int status = 0, ended = 0;
        for (int waited = 0; waited < 500 && directory.entries() < 2; ++waited) usleep(10 * 1000);
        EXPECT_EQ(directory.entries(), 2u) << "no temporary file beside the JSON file";
        kill(heft, signal);
        for (int waited = 0; waited < 500 && !(ended = waitpid(heft, &status, WNOHANG)); ++waited) usleep(10 * 1000);
        EXPECT_EQ(ended, heft) << "heft did not end on the signal";
        if (ended == 0) kill(heft, SIGKILL), waitpid(heft, &status, 0);
        close(report[0]);
        EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == signal);
        EXPECT_EQ(readFile(path), "earlier report");
        EXPECT_EQ(directory.entries(), 1u);
    }
}

}  // namespace
