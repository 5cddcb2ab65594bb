#pragma once

#include "base/HTError.h"
#include "base/HTPidMap.h"
#include "base/HTSettings.h"
#include "cli/HTOrderedStringSet.h"
#include "process/HTProcess.h"
#include "process/HTTargetSelection.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

// Everything the command line says: which processes to analyse and which
// to leave out, the analysis mode and the report options. Parsing only
// records what was written; HTTargetSelection later turns the pids, names
// and files into process objects.
class HTHeftArgs {
public:
    // The defaults of a command line without options.
    HTHeftArgs() = default;

    // Parses argv[1...] with getopt_long. Returns null on failure, with the
    // error in *error when an error slot was passed (help is the failure
    // with code 1). Warnings and the parser's own diagnostics go to
    // standard error.
    static std::unique_ptr<HTHeftArgs> initWithArgc(int argc, char** argv, HTError* error);

    // The columns a report can be sorted by, in their stored capitalisation.
    static const std::vector<std::string>& sortColumns();
    static const std::string& defaultSortColumn();

    // The settings of the run the command line asks for.
    HTSettings settings() const;
    // The processes the command line names, for target selection.
    HTTargetSelection::Request targetRequest() const;

    // --- what was written, for the checks before the analysis -------------
    bool targetAll() const { return targetAll_; }
    bool searchForUnmapped() const { return searchForUnmapped_; }
    const std::optional<std::string>& JSONOutputFile() const { return JSONOutputFile_; }
    bool targetChildren() const { return targetChildren_; }
    // --exec: the program to run and report at its exit, with its arguments.
    bool runsProgram() const { return runsProgram_; }
    const std::vector<std::string>& programArguments() const { return programArguments_; }

private:
    // One option as getopt_long reported it; false with *error filled when
    // the option or its argument is bad.
    bool _applyOption(int option, const char* argument, HTError* error);
    bool _applyPid(const char* argument, HTError* error);
    bool _applySort(const char* argument, HTError* error);
    bool _applyFormat(const char* argument, HTError* error);
    // Resolves the conflicts of --unmapped with the other modes.
    void _settleUnmapped();
    // A program run takes no other targets; false with *error filled.
    bool _checkProgramRun(HTError* error) const;

    bool targetChildren_ = false;
    bool targetAll_ = false;
    bool skipIdleExitClean_ = false;
    bool spanlistLikeOutput_ = false;
    bool summarize_ = true;
    bool shouldGetPhysHeftBreakdown_ = true;
    bool didSetShouldGetPhysHeftBreakdown_ = false;
    bool searchForUnmapped_ = false;
    int64_t summaryFormat_ = HTTextFormatFormatted;
    int64_t textOptions_ = 0;
    std::string textSort_ = defaultSortColumn();
    std::optional<std::string> JSONOutputFile_;
    // --snapshot-dir: empty when not given.
    std::string snapshotDirectory_;
    bool runsProgram_ = false;
    std::vector<std::string> programArguments_;
    HTProcess::PidDescriptionMap targetPids_;
    HTOrderedStringSet potentialTargetProcesses_;
    HTOrderedStringSet excludedPidsOrProcesses_;
};
