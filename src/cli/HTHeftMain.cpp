#include "cli/HTHeftMain.h"

#include "analysis/HTHeft.h"
#include "base/HTNoticeLog.h"
#include "base/HTOutputFile.h"
#include "cli/HTCancelHandler.h"
#include "cli/HTExecRun.h"
#include "cli/HTHeftArgs.h"
#include "cli/HTUsage.h"
#include "output/HTOutputFormatterJSON.h"
#include "output/HTOutputFormatterText.h"
#include "output/HTTerminalText.h"
#include "process/HTTargetSelection.h"

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

// A command line that could not be parsed: its message, if it has one (an
// unknown option was already reported by the option parser), then the
// usage. Asking for help is the one such outcome that succeeds.
int reportArgumentError(const HTError& error)
{
    if (error.description) std::fprintf(stderr, "%s\n", error.description->c_str());
    printUsage();
    bool askedForHelp = error.domain == HTHeftErrorDomain && error.code == HTHeftErrorCodeHelp;
    return askedForHelp ? 0 : 1;
}

// -a and --unmapped read every process of the system.
bool needsRoot(const HTHeftArgs& args) { return args.targetAll() || args.searchForUnmapped(); }

// The JSON file is opened before the analysis, so that a path that cannot
// be written is reported at once; the run then goes on without it.
std::shared_ptr<HTOutputFormatterJSON> openJSONFormatter(const HTHeftArgs& args, const HTSettings& settings,
                                                         HTPlatform& platform)
{
    if (!args.JSONOutputFile()) return nullptr;
    std::string errorText;
    auto formatter = HTOutputFormatterJSON::initWithPath(*args.JSONOutputFile(), settings.breakDownPhysHeft,
                                                         platform.vm_kernel_page_size(), &errorText);
    if (!formatter) std::fprintf(stderr, "%s\n", errorText.c_str());
    return formatter;
}

// Writes what befell the processes while they were set up and read, each
// story once. Their names come from the processes themselves and are
// escaped as in the report.
void tellNotices()
{
    for (const std::string& line : HTNoticeLog::standardError().take())
        std::fprintf(stderr, "%s\n", htTerminalSafe(line).c_str());
}

// Gathers every target; with standard output redirected, SIGINT stops the
// gathering early and the report of what was gathered still follows.
void gather(HTHeft& heft, HTPlatform& platform)
{
    auto source = installCancelHandler(platform, [&heft] {
        heft.cancel();
        std::fprintf(stderr, "Exiting early due to SIGINT\n");
    });
    heft.gatherData();
    // Cancelling restores SIGINT's default action: a second Ctrl-C while
    // printing ends the program at once.
    if (source) source->cancel();
    tellNotices();
}

// Checks that snapfiles can be written where --snapshot-dir says, and names
// the capture they will share.
bool prepareSnapshots(HTSettings& settings, HTPlatform& platform)
{
    if (auto problem = HTOutputFile::directoryProblem(settings.snapshotDirectory)) {
        std::fprintf(stderr, "Unable to save snapfiles in %s: %s\n", settings.snapshotDirectory.c_str(),
                     problem->c_str());
        return false;
    }
    const auto now = std::chrono::system_clock::now().time_since_epoch();
    char capture[64];
    std::snprintf(capture, sizeof(capture), "%llx-%d",
                  static_cast<unsigned long long>(std::chrono::duration_cast<std::chrono::nanoseconds>(now).count()),
                  platform.getpid());
    settings.snapshotCapture = capture;
    return true;
}

// Prints the report of what was gathered and returns `status`, or 1 when
// the report could not be written whole.
int printReport(HTHeft& heft, const HTSettings& settings, const std::shared_ptr<HTOutputFormatterJSON>& jsonFormatter,
                int status)
{
    heft.addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings));
    if (jsonFormatter) heft.addOutputFormatter(jsonFormatter);
    heft.printOutputVerbose(settings.verbose, settings.summarize);
    if (jsonFormatter && jsonFormatter->writeError()) {
        std::fprintf(stderr, "%s\n", jsonFormatter->writeError()->c_str());
        status = 1;
    }
    // The error of a failed write of the report is still in errno: after
    // it, the report is only written to, and every later write fails alike.
    if (std::fflush(stdout) != 0 || std::ferror(stdout)) {
        std::fprintf(stderr, "Unable to write the report: %s\n", std::strerror(errno != 0 ? errno : EIO));
        status = 1;
    }
    return status;
}

// Ends the run with `status`, when it is to end at once: the formatters
// finish their files, and nothing else is freed.
int finish(HTHeft& heft, std::shared_ptr<HTOutputFormatterJSON> jsonFormatter, int status, bool exitWhenDone)
{
    if (exitWhenDone) {
        heft.finishOutput();
        jsonFormatter.reset();
        std::fflush(nullptr);
        std::_Exit(status);
    }
    return status;
}

// heft --exec: runs the program, reports it as it was at its exit, and
// exits with its status, whatever became of the report.
int runProgram(const HTHeftArgs& args, const HTSettings& settings, const std::shared_ptr<HTPlatform>& platform,
               bool exitWhenDone, const char*& stage)
{
    auto jsonFormatter = openJSONFormatter(args, settings, *platform);
    stage = "running the program";
    HTExecRun execRun(platform, settings, args.targetRequest().skipIdleExitClean);
    const HTProgramEnd end = execRun.run(args.programArguments(), args.targetChildren());
    const int status = HTExecRun::exitStatus(end);
    tellNotices();
    const std::string problem = HTExecRun::problem(end, args.programArguments().front());
    if (!problem.empty()) std::fprintf(stderr, "%s\n", problem.c_str());
    if (end.leftRunning > 0)
        std::fprintf(stderr, "heft: %d process%s started by the program %s still running at its end; not reported\n",
                     end.leftRunning, end.leftRunning == 1 ? "" : "es", end.leftRunning == 1 ? "was" : "were");
    if (execRun.corpses().empty()) return status;
    stage = "writing the report";
    HTHeft heft(execRun.corpses(), settings);
    heft.analyzeGatheredData();
    printReport(heft, settings, jsonFormatter, status);
    return finish(heft, std::move(jsonFormatter), status, exitWhenDone);
}

// The run itself; `stage` says what it is doing, for a message if memory
// runs out.
int runHeft(int argc, char** argv, const std::shared_ptr<HTPlatform>& platform, bool exitWhenDone, const char*& stage)
{
    stage = "reading the command line";
    HTError error;
    std::unique_ptr<HTHeftArgs> args = HTHeftArgs::initWithArgc(argc, argv, &error);
    if (!args) return reportArgumentError(error);

    HTSettings settings = args->settings();

    if (needsRoot(*args) && platform->geteuid() != 0) {
        std::fprintf(stderr, "Must run as root.\n");
        return 1;
    }
    if (!settings.snapshotDirectory.empty() && !prepareSnapshots(settings, *platform)) return 1;
    if (args->runsProgram()) return runProgram(*args, settings, platform, exitWhenDone, stage);

    stage = "listing the processes";
    HTTargetSelection selection(platform, settings, args->targetRequest());
    auto targets = selection.targetProcessesAndError(&error);
    // With nothing to gather, what befell the processes is said now.
    if (!targets || targets->empty()) tellNotices();
    if (!targets) {
        if (error.description) std::fprintf(stderr, "%s\n", error.description->c_str());
        printUsage();
        return 1;
    }
    if (targets->empty()) {
        std::fprintf(stderr,
                     "Unable to find any processes matching the supplied process names or pids (try as root?)\n");
        return 1;
    }

    // Snapfiles read fix the analysis mode.
    settings.breakDownPhysHeft = selection.breakDownPhysHeft();
    auto jsonFormatter = openJSONFormatter(*args, settings, *platform);
    // A report that could not be written whole ends the run in failure.
    int status = args->JSONOutputFile() && !jsonFormatter ? 1 : 0;
    stage = "gathering the processes' memory";
    HTHeft heft(std::move(*targets), settings);
    gather(heft, *platform);
    stage = "writing the report";

    status = printReport(heft, settings, jsonFormatter, status);
    return finish(heft, std::move(jsonFormatter), status, exitWhenDone);
}

}  // namespace

int heftMain(int argc, char** argv, const std::shared_ptr<HTPlatform>& platform, bool exitWhenDone)
{
    const char* stage = "starting";
    try {
        return runHeft(argc, argv, platform, exitWhenDone, stage);
    } catch (const std::bad_alloc&) {
        // Whatever was built is freed on the way here, and a JSON file not
        // yet finished is removed with it.
        std::fflush(stdout);
        std::fprintf(stderr, "heft: out of memory while %s\n", stage);
        return 1;
    }
}
