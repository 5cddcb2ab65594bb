// The built heft, run as a user runs it: its exact output on both streams
// and its exit status, for every way the command line can end a run before
// the analysis, and for a run that selects a live process.

#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include "e2e/HTE2ESupport.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

extern char** environ;

namespace {

using heft_e2e::kSetpriv;
using heft_e2e::Outcome;
using heft_e2e::runHeft;
using heft_e2e::runHeftAsNobody;

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

std::vector<char*> pointersTo(std::vector<std::string>& strings)
{
    std::vector<char*> pointers;
    for (auto& string : strings) pointers.push_back(string.data());
    pointers.push_back(nullptr);
    return pointers;
}

#define SKIP_UNLESS_ROOT_WITH_SETPRIV()                                                                 \
    do {                                                                                                \
        if (geteuid() != 0) GTEST_SKIP() << "running heft as another user needs root";                  \
        if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";   \
    } while (0)

// What this system's getopt_long writes for `arguments` (after "heft"):
// the wording is the C library's own, so the test asks it rather than
// guessing.
std::string optionParserDiagnostic(std::vector<std::string> arguments)
{
    arguments.insert(arguments.begin(), "heft");
    std::vector<char*> argv = pointersTo(arguments);
    const struct option longOptions[] = {
        {"json", required_argument, nullptr, 'j'},
        {"sort", required_argument, nullptr, 260},
        {nullptr, 0, nullptr, 0},
    };
    optind = 0;
    opterr = 1;
    testing::internal::CaptureStderr();
    while (getopt_long(static_cast<int>(arguments.size()), argv.data(), "aj:htp:x:svf:yw", longOptions, nullptr) !=
           -1) {
    }
    return testing::internal::GetCapturedStderr();
}

// A child process that waits until the test kills it.
class IdleChild {
public:
    IdleChild()
    {
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (;;) pause();
        }
    }
    ~IdleChild()
    {
        if (pid_ <= 0) return;
        kill(pid_, SIGKILL);
        while (waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {}
    }
    IdleChild(const IdleChild&) = delete;
    IdleChild& operator=(const IdleChild&) = delete;

    pid_t pid() const { return pid_; }

private:
    pid_t pid_ = -1;
};

TEST(HTCommandLineE2ETest, HelpPrintsTheUsageAndSucceeds)
{
    for (const char* help : {"-h", "--help"}) {
        Outcome outcome = runHeft({help});
        EXPECT_EQ(outcome.status, 0) << help;
        EXPECT_EQ(outcome.standardOutput, kUsage);
        EXPECT_EQ(outcome.standardError, "");
    }
    // The usage names the default sort column, whatever --sort said.
    Outcome outcome = runHeft({"--sort", "Regions", "-h"});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.standardOutput, kUsage);
}

TEST(HTCommandLineE2ETest, OptionParserErrorsPrintItsDiagnosticAndTheUsage)
{
    for (std::vector<std::string> arguments :
         {std::vector<std::string>{"--bogus"}, {"-q", "1"}, {"1", "-j"}, {"--sort"}}) {
        std::string diagnostic = optionParserDiagnostic(arguments);
        ASSERT_EQ(diagnostic.rfind("heft: ", 0), 0u) << diagnostic;
        Outcome outcome = runHeft(arguments);
        EXPECT_EQ(outcome.status, 1) << arguments[0];
        EXPECT_EQ(outcome.standardError, diagnostic);
        EXPECT_EQ(outcome.standardOutput, kUsage);
    }
    EXPECT_NE(optionParserDiagnostic({"--bogus"}).find("'--bogus'"), std::string::npos);
}

TEST(HTCommandLineE2ETest, BadOptionValuesPrintTheirMessageAndTheUsage)
{
    struct Case {
        std::vector<std::string> arguments;
        const char* message;
    };
    const Case cases[] = {
        {{"-f", "bad", "1"},
         "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n"},
        {{"--sort", "size", "1"},
         "Unrecognized argument 'size' to --sort.\n"
         "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category\n"},
        {{"--pid", "abc"},
         "'abc' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name.\n"},
    };
    for (const Case& c : cases) {
        Outcome outcome = runHeft(c.arguments);
        EXPECT_EQ(outcome.status, 1) << c.arguments[0];
        EXPECT_EQ(outcome.standardError, c.message);
        EXPECT_EQ(outcome.standardOutput, kUsage);
    }
}

TEST(HTCommandLineE2ETest, NoTargetPrintsItsMessageAfterTheWarnings)
{
    Outcome outcome = runHeft({});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError, "Must specify at least one process or snapfile\n");
    EXPECT_EQ(outcome.standardOutput, kUsage);

    // The deprecated options and the ignored --unmapped only warn: the run
    // goes on to the next failure.
    outcome = runHeft({"-y", "--physHeft", "--vmObjectDirty", "--unmapped"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n"
              "WARNING: --physHeft option is deprecated because it is the default mode\n"
              "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
              "support unmapped owned VM objects\n"
              "Must specify at least one process or snapfile\n");
    EXPECT_EQ(outcome.standardOutput, kUsage);
}

TEST(HTCommandLineE2ETest, UnknownProcessNameFindsNothing)
{
    Outcome outcome = runHeft({"heft-e2e-no-such-process"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError,
              std::string("Unable to find pid for process matching 'heft-e2e-no-such-process'\n") + kNoProcesses);
    EXPECT_EQ(outcome.standardOutput, "");
}

TEST(HTCommandLineE2ETest, AllProcessesAndUnmappedNeedRoot)
{
    SKIP_UNLESS_ROOT_WITH_SETPRIV();
    for (std::vector<std::string> arguments : {std::vector<std::string>{"-a"}, {"--unmapped", "1"}}) {
        Outcome outcome = runHeftAsNobody(arguments);
        EXPECT_EQ(outcome.status, 1) << arguments[0];
        EXPECT_EQ(outcome.standardError, "Must run as root.\n");
        EXPECT_EQ(outcome.standardOutput, "");
    }
    // The notice comes from parsing, before the privileges are checked.
    Outcome outcome = runHeftAsNobody({"-a", "--unmapped"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError, "NOTICE: '--unmapped' is redundant when using -a/--all\nMust run as root.\n");
    EXPECT_EQ(outcome.standardOutput, "");
}

TEST(HTCommandLineE2ETest, AllWithUnmappedRunsAsAllAlone)
{
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    Outcome outcome = runHeft({"-a", "--unmapped"});
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    // Processes that end while heft looks at them may add lines of their own.
    EXPECT_EQ(outcome.standardError.rfind("NOTICE: '--unmapped' is redundant when using -a/--all\n", 0), 0u)
        << outcome.standardError;
    // Every process is reported, so the summary across them follows.
    EXPECT_NE(outcome.standardOutput.find("\nSummary Heft: "), std::string::npos) << outcome.standardOutput;
}

TEST(HTCommandLineE2ETest, UnreadableProcessIsReportedByPid)
{
    SKIP_UNLESS_ROOT_WITH_SETPRIV();
    Outcome outcome = runHeftAsNobody({"1"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardOutput, "");
    // The failed task_for_pid writes its own diagnostic line first.
    const std::string tail = std::string("Unable to analyze process with pid 1 (try as root?)\n") + kNoProcesses;
    ASSERT_GE(outcome.standardError.size(), tail.size()) << outcome.standardError;
    std::string head = outcome.standardError.substr(0, outcome.standardError.size() - tail.size());
    EXPECT_EQ(outcome.standardError.substr(head.size()), tail);
    EXPECT_TRUE(head.empty() || (head.rfind("task_for_pid: ", 0) == 0 && head.find('\n') == head.size() - 1))
        << head;
}

TEST(HTCommandLineE2ETest, SelectingALiveProcessSucceeds)
{
    IdleChild child;
    ASSERT_GT(child.pid(), 0);
    std::string pid = std::to_string(child.pid());

    for (std::vector<std::string> arguments : {std::vector<std::string>{pid}, {"--pid", pid, "-p", pid, pid}}) {
        Outcome outcome = runHeft(arguments);
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        EXPECT_EQ(outcome.standardError, "");
        // One process, reported once however often it was named.
        std::string header = " [" + pid + "]: 64-bit\tHeft: ";
        size_t first = outcome.standardOutput.find(header);
        EXPECT_NE(first, std::string::npos) << outcome.standardOutput;
        EXPECT_EQ(outcome.standardOutput.find(header, first + 1), std::string::npos) << outcome.standardOutput;
    }

    // Excluding the only target leaves nothing to analyse.
    Outcome outcome = runHeft({pid, "-x", pid});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError, kNoProcesses);
    EXPECT_EQ(outcome.standardOutput, "");
}

}  // namespace

namespace {

// A JSON file that cannot be created is reported before the analysis, and
// the text report is still written; a writable one receives a document.
TEST(HTCommandLineE2ETest, JSONFileIsWrittenOrItsFailureReported)
{
    IdleChild child;
    ASSERT_GT(child.pid(), 0);
    std::string pid = std::to_string(child.pid());

    Outcome outcome = runHeft({"-j", "/nonexistent-heft-dir/out.json", pid});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.standardError,
              "Unable to open JSON output file '/nonexistent-heft-dir/out.json': No such file or directory\n");
    EXPECT_NE(outcome.standardOutput.find(" [" + pid + "]: 64-bit\tHeft: "), std::string::npos);

    char directory[] = "/tmp/heft-json-XXXXXX";
    ASSERT_NE(mkdtemp(directory), nullptr);
    std::string path = std::string(directory) + "/out.json";
    outcome = runHeft({"--json", path, pid});
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    FILE* file = std::fopen(path.c_str(), "r");
    ASSERT_NE(file, nullptr);
    char head[64] = {};
    size_t length = std::fread(head, 1, sizeof(head) - 1, file);
    std::fclose(file);
    EXPECT_EQ(std::string(head, length).rfind("{\"unit\":\"byte\",\"bytes per unit\":1,\"processes\":[{\"name\":", 0),
              0u)
        << head;
    std::remove(path.c_str());
    rmdir(directory);
}

}  // namespace
