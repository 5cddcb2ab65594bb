#include "cli/HTHeftArgs.h"

#include "base/HTStringFormat.h"
#include "process/HTProcessDiscovery.h"

#include <getopt.h>
#include <strings.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

constexpr const char* kShortOptions = "aj:htp:x:svf:yw";

// Values getopt_long reports for long options without a short letter; they
// lie above every character value so that they cannot clash with one.
enum : int {
    OptionPhysHeft = 256,
    OptionVmObjectDirty = 257,
    OptionSwapped = 258,
    OptionWired = 259,
    OptionSort = 260,
    OptionUnmapped = 261,
    OptionSnapshotDir = 262,
    OptionExec = 263,
};

constexpr const char* kExecUsage = "heft [options] --exec -- PROGRAM [ARGS...]";

// Where "--exec" stands among the arguments, before any "--" that ends
// heft's options; argc when it does not.
int execOptionIndex(int argc, char** argv)
{
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--") == 0) break;
        if (std::strcmp(argv[i], "--exec") == 0) return i;
    }
    return argc;
}

// Fills the caller's error slot, if any, and reports failure.
bool fail(HTError* error, int64_t code, std::optional<std::string> description = std::nullopt)
{
    if (error) *error = HTError(HTHeftErrorDomain, code, std::move(description));
    return false;
}

// The sort columns in lower case, joined by ", ", for the --sort error.
std::string lowerCaseSortColumnList()
{
    std::string list;
    for (const auto& column : HTHeftArgs::sortColumns()) {
        if (!list.empty()) list += ", ";
        for (char c : column) list.push_back(static_cast<char>(std::tolower(static_cast<unsigned char>(c))));
    }
    return list;
}

// getopt keeps its position in globals, and a process may parse more than
// one command line (the tests do). glibc has no optreset: setting optind to
// 0 instead of 1 makes its next call reinitialise everything, including the
// position inside a group of short options and the permutation state, and
// start again at argv[1].
void resetOptionParser()
{
    optind = 0;
    optarg = nullptr;
    // The parser writes its own diagnostic for unknown options and missing
    // arguments; the caller only prints the usage text after it.
    opterr = 1;
}

}  // namespace

const std::vector<std::string>& HTHeftArgs::sortColumns()
{
    static const std::vector<std::string> columns = {"Dirty", "Swapped", "Clean",   "Reclaimable",
                                                     "Wired", "Regions", "Category"};
    return columns;
}

const std::string& HTHeftArgs::defaultSortColumn() { return sortColumns().front(); }

std::unique_ptr<HTHeftArgs> HTHeftArgs::initWithArgc(int argc, char** argv, HTError* error)
{
    if (error) *error = HTError();
    auto args = std::make_unique<HTHeftArgs>();

    // --proc and --pid report through flags rather than a value: getopt_long
    // returns 0 and sets one of these.
    int procFlag = 0;
    int pidFlag = 0;
    const struct option longOptions[] = {
        {"all", no_argument, nullptr, 'a'},
        {"json", required_argument, nullptr, 'j'},
        {"help", no_argument, nullptr, 'h'},
        {"targetChildren", no_argument, nullptr, 't'},
        {"proc", required_argument, &procFlag, 1},
        {"exclude", required_argument, nullptr, 'x'},
        {"pid", required_argument, &pidFlag, 1},
        {"skip", no_argument, nullptr, 's'},
        {"format", required_argument, nullptr, 'f'},
        {"sort", required_argument, nullptr, OptionSort},
        {"summary", no_argument, nullptr, 'y'},
        {"physHeft", no_argument, nullptr, OptionPhysHeft},
        {"vmObjectDirty", no_argument, nullptr, OptionVmObjectDirty},
        {"wide", no_argument, nullptr, 'w'},
        {"swapped", no_argument, nullptr, OptionSwapped},
        {"wired", no_argument, nullptr, OptionWired},
        {"unmapped", no_argument, nullptr, OptionUnmapped},
        {"snapshot-dir", required_argument, nullptr, OptionSnapshotDir},
        {"exec", no_argument, nullptr, OptionExec},
        {nullptr, 0, nullptr, 0},
    };

    // What follows --exec is the program's command line, options and all:
    // heft parses only what comes before it.
    const int execIndex = execOptionIndex(argc, argv);
    if (execIndex < argc) {
        args->runsProgram_ = true;
        int first = execIndex + 1;
        if (first < argc && std::strcmp(argv[first], "--") == 0) ++first;
        args->programArguments_.assign(argv + first, argv + argc);
        argc = execIndex;
    }

    resetOptionParser();
    int option;
    while ((option = getopt_long(argc, argv, kShortOptions, longOptions, nullptr)) != -1) {
        if (option == 0) {
            if (procFlag) {
                procFlag = 0;
                args->potentialTargetProcesses_.add(optarg);
            } else if (pidFlag) {
                pidFlag = 0;
                if (!args->_applyPid(optarg, error)) return nullptr;
            }
            continue;
        }
        if (!args->_applyOption(option, optarg, error)) return nullptr;
    }
    args->_settleUnmapped();

    // Operands are told apart (pid, name, snapfile) only at target selection.
    for (int i = optind; i < argc; ++i) args->potentialTargetProcesses_.add(argv[i]);
    if (args->runsProgram_ && !args->_checkProgramRun(error)) return nullptr;
    return args;
}

bool HTHeftArgs::_checkProgramRun(HTError* error) const
{
    if (programArguments_.empty())
        return fail(error, HTHeftErrorCodeOption, htStringWithFormat("--exec needs a program to run: %s", kExecUsage));
    const bool otherTargets = targetAll_ || searchForUnmapped_ || !targetPids_.empty() ||
        !potentialTargetProcesses_.empty() || !excludedPidsOrProcesses_.empty();
    if (otherTargets)
        return fail(error, HTHeftErrorCodeOption,
                    "--exec reports the program it runs (and with -t the processes it starts): it takes no "
                    "-a, -p, --pid, -x, --unmapped or other targets");
    if (!snapshotDirectory_.empty())
        return fail(error, HTHeftErrorCodeOption, "--snapshot-dir saves live processes: it cannot be used with --exec");
    return true;
}

bool HTHeftArgs::_applyOption(int option, const char* argument, HTError* error)
{
    switch (option) {
    case 'a':
        targetAll_ = true;
        break;
    case 'j':
        JSONOutputFile_ = argument;
        break;
    case 'h':
        return fail(error, HTHeftErrorCodeHelp);
    case 't':
        targetChildren_ = true;
        break;
    case 'p':
        potentialTargetProcesses_.add(argument);
        break;
    case 'x':
        excludedPidsOrProcesses_.add(argument);
        break;
    case 's':
        skipIdleExitClean_ = true;
        break;
    case 'v':
        // The full listing replaces the summary; no option brings it back.
        spanlistLikeOutput_ = true;
        summarize_ = false;
        break;
    case 'f':
        return _applyFormat(argument, error);
    case OptionSort:
        return _applySort(argument, error);
    case 'y':
        std::fprintf(stderr, "WARNING: -y/--summary options are deprecated because summary is the default mode\n");
        break;
    case OptionPhysHeft:
        std::fprintf(stderr, "WARNING: --physHeft option is deprecated because it is the default mode\n");
        break;
    case OptionVmObjectDirty:
        shouldGetPhysHeftBreakdown_ = false;
        didSetShouldGetPhysHeftBreakdown_ = true;
        break;
    case 'w':
        textOptions_ |= HTTextOptionWired | HTTextOptionSwapped | HTTextOptionWide;
        break;
    case OptionSwapped:
        textOptions_ |= HTTextOptionSwapped;
        break;
    case OptionWired:
        textOptions_ |= HTTextOptionWired;
        break;
    case OptionUnmapped:
        searchForUnmapped_ = true;
        break;
    case OptionExec:
        // Only an abbreviation reaches here: the full word was split off.
        return fail(error, HTHeftErrorCodeOption,
                    htStringWithFormat("--exec is written out in full, after heft's own options: %s", kExecUsage));
    case OptionSnapshotDir:
        if (*argument == '\0') return fail(error, HTHeftErrorCodeOption, "--snapshot-dir needs a directory");
        snapshotDirectory_ = argument;
        break;
    default:
        // An unknown option or a missing argument: getopt_long has already
        // said which.
        return fail(error, HTHeftErrorCodeOption);
    }
    return true;
}

bool HTHeftArgs::_applyPid(const char* argument, HTError* error)
{
    // A pid is a whole number within the range of pids: "12abc" or a value
    // that would wrap to another pid names no process.
    std::optional<int32_t> pid = HTProcessDiscovery::pidForText(argument);
    if (!pid)
        return fail(error, HTHeftErrorCodePid,
                    htStringWithFormat("'%s' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to "
                                       "specify a process name.",
                                       argument));
    targetPids_.set(*pid, std::nullopt);
    return true;
}

bool HTHeftArgs::_applySort(const char* argument, HTError* error)
{
    for (const auto& column : sortColumns()) {
        if (strcasecmp(argument, column.c_str()) == 0) {
            textSort_ = column;
            return true;
        }
    }
    return fail(error, HTHeftErrorCodeSort,
                htStringWithFormat("Unrecognized argument '%s' to --sort.\nAccepted arguments: %s", argument,
                                   lowerCaseSortColumnList().c_str()));
}

bool HTHeftArgs::_applyFormat(const char* argument, HTError* error)
{
    static const char* const formats[] = {"bytes", "formatted", "pages"};
    for (int64_t format = HTTextFormatBytes; format <= HTTextFormatPages; ++format) {
        if (std::strcmp(argument, formats[format]) == 0) {
            summaryFormat_ = format;
            return true;
        }
    }
    return fail(error, HTHeftErrorCodeFormat,
                "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
}

void HTHeftArgs::_settleUnmapped()
{
    if (!searchForUnmapped_) return;
    if (!shouldGetPhysHeftBreakdown_) {
        // Owners of VM objects are only known in the breakdown mode.
        std::fprintf(stderr,
                     "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' "
                     "does not support unmapped owned VM objects\n");
        searchForUnmapped_ = false;
    } else if (targetAll_) {
        // -a analyses every process anyway.
        std::fprintf(stderr, "NOTICE: '--unmapped' is redundant when using -a/--all\n");
        searchForUnmapped_ = false;
    }
}

HTSettings HTHeftArgs::settings() const
{
    HTSettings settings;
    settings.breakDownPhysHeft = shouldGetPhysHeftBreakdown_;
    settings.summaryFormat = summaryFormat_;
    settings.textOptions = textOptions_;
    settings.textSort = textSort_;
    settings.verbose = spanlistLikeOutput_;
    settings.summarize = summarize_;
    settings.snapshotDirectory = snapshotDirectory_;
    return settings;
}

HTTargetSelection::Request HTHeftArgs::targetRequest() const
{
    HTTargetSelection::Request request;
    request.targetPids = targetPids_;
    request.potentialTargetProcesses = potentialTargetProcesses_.values();
    request.excludedPidsOrProcesses = excludedPidsOrProcesses_.values();
    request.targetAll = targetAll_;
    request.targetChildren = targetChildren_;
    request.searchForUnmapped = searchForUnmapped_;
    request.skipIdleExitClean = skipIdleExitClean_;
    request.breakDownPhysHeft = shouldGetPhysHeftBreakdown_;
    request.modeFixed = didSetShouldGetPhysHeftBreakdown_;
    return request;
}
