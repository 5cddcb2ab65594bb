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
    // Pid to the name it was found by, or nullopt when it was given as a pid.
    using PidMap = HTProcess::PidDescriptionMap;

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

    // --- fields ----------------------------------------------------------
    bool targetChildren() const { return targetChildren_; }
    void setTargetChildren(bool value) { targetChildren_ = value; }
    bool targetAll() const { return targetAll_; }
    void setTargetAll(bool value) { targetAll_ = value; }
    bool skipIdleExitClean() const { return skipIdleExitClean_; }
    void setSkipIdleExitClean(bool value) { skipIdleExitClean_ = value; }
    bool spanlistLikeOutput() const { return spanlistLikeOutput_; }
    void setSpanlistLikeOutput(bool value) { spanlistLikeOutput_ = value; }
    bool summarize() const { return summarize_; }
    void setSummarize(bool value) { summarize_ = value; }
    bool shouldGetPhysHeftBreakdown() const { return shouldGetPhysHeftBreakdown_; }
    void setShouldGetPhysHeftBreakdown(bool value) { shouldGetPhysHeftBreakdown_ = value; }
    bool didSetShouldGetPhysHeftBreakdown() const { return didSetShouldGetPhysHeftBreakdown_; }
    void setDidSetShouldGetPhysHeftBreakdown(bool value) { didSetShouldGetPhysHeftBreakdown_ = value; }
    bool searchForUnmapped() const { return searchForUnmapped_; }
    void setSearchForUnmapped(bool value) { searchForUnmapped_ = value; }
    bool excludeSelf() const { return excludeSelf_; }
    void setExcludeSelf(bool value) { excludeSelf_ = value; }
    int64_t summaryFormat() const { return summaryFormat_; }
    void setSummaryFormat(int64_t value) { summaryFormat_ = value; }
    int64_t textOptions() const { return textOptions_; }
    void setTextOptions(int64_t value) { textOptions_ = value; }
    const std::string& textSort() const { return textSort_; }
    void setTextSort(std::string value) { textSort_ = std::move(value); }
    const std::optional<std::string>& JSONOutputFile() const { return JSONOutputFile_; }
    void setJSONOutputFile(std::optional<std::string> value) { JSONOutputFile_ = std::move(value); }
    const PidMap& targetPids() const { return targetPids_; }
    void setTargetPids(PidMap value) { targetPids_ = std::move(value); }
    const HTOrderedStringSet& potentialTargetProcesses() const { return potentialTargetProcesses_; }
    void setPotentialTargetProcesses(HTOrderedStringSet value) { potentialTargetProcesses_ = std::move(value); }
    const HTOrderedStringSet& excludedPidsOrProcesses() const { return excludedPidsOrProcesses_; }
    void setExcludedPidsOrProcesses(HTOrderedStringSet value) { excludedPidsOrProcesses_ = std::move(value); }

private:
    // One option as getopt_long reported it; false with *error filled when
    // the option or its argument is bad.
    bool _applyOption(int option, const char* argument, HTError* error);
    bool _applyPid(const char* argument, HTError* error);
    bool _applySort(const char* argument, HTError* error);
    bool _applyFormat(const char* argument, HTError* error);
    // Resolves the conflicts of --unmapped with the other modes.
    void _settleUnmapped();

    bool targetChildren_ = false;
    bool targetAll_ = false;
    bool skipIdleExitClean_ = false;
    bool spanlistLikeOutput_ = false;
    bool summarize_ = true;
    bool shouldGetPhysHeftBreakdown_ = true;
    bool didSetShouldGetPhysHeftBreakdown_ = false;
    bool searchForUnmapped_ = false;
    bool excludeSelf_ = true;
    int64_t summaryFormat_ = HTTextFormatFormatted;
    int64_t textOptions_ = 0;
    std::string textSort_ = defaultSortColumn();
    std::optional<std::string> JSONOutputFile_;
    PidMap targetPids_;
    HTOrderedStringSet potentialTargetProcesses_;
    HTOrderedStringSet excludedPidsOrProcesses_;
};
