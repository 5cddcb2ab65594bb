#include "cli/HTHeftMain.h"

#include "analysis/HTHeft.h"
#include "cli/HTHeftArgs.h"
#include "cli/HTUsage.h"

#include <cstdio>

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

}  // namespace

int heftMain(int argc, char** argv, const std::shared_ptr<HTPlatform>& platform)
{
    HTError error;
    std::unique_ptr<HTHeftArgs> args = HTHeftArgs::initWithArgc(argc, argv, &error);
    if (!args) return reportArgumentError(error);

    // The breakdown mode is the default; --vmObjectDirty leaves the kernel
    // setting as it found it.
    if (args->shouldGetPhysHeftBreakdown()) HTHeft::setBreakDownPhysHeft(*platform, true);

    if (needsRoot(*args) && platform->geteuid() != 0) {
        std::fprintf(stderr, "Must run as root.\n");
        return 1;
    }

    auto targets = args->targetProcessesAndError(platform, &error);
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

    // The analysis of the selected processes and the report attach here.
    return 0;
}
