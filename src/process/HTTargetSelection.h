#pragma once

#include "base/HTError.h"
#include "base/HTSettings.h"
#include "platform/HTPlatform.h"
#include "process/HTProcess.h"
#include "process/HTProcessDiscovery.h"
#include "process/HTSnapfileProcess.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

// Turns the pids, names and exclusions a command line gives into the
// processes to analyse, with -t, -a, --unmapped and -s applied.
class HTTargetSelection {
public:
    using ProcessList = std::vector<std::shared_ptr<HTProcess>>;

    // What the command line asks for.
    struct Request {
        // Pid to the name it was found by, or nullopt when given as a pid.
        HTProcess::PidDescriptionMap targetPids;
        // Operands and -p values: names or pids, in the order given.
        std::vector<std::string> potentialTargetProcesses;
        // -x values: names or pids.
        std::vector<std::string> excludedPidsOrProcesses;
        bool targetAll = false;
        bool targetChildren = false;
        bool searchForUnmapped = false;
        bool skipIdleExitClean = false;
        bool excludeSelf = true;
        // The analysis mode, and whether the command line or a snapfile has
        // fixed it: every snapfile must then have been gathered in it.
        bool breakDownPhysHeft = true;
        bool modeFixed = false;
    };

    HTTargetSelection(std::shared_ptr<HTPlatform> platform, const HTSettings& settings, Request request);

    // The processes to analyse. nullopt and an error when the request names
    // nothing to analyse; an empty list when nothing could be opened.
    // Updates targetPids.
    std::optional<ProcessList> targetProcessesAndError(HTError* error);

    // The pids named, after the names were resolved, the exclusions taken
    // out and the descendants added.
    const HTProcess::PidDescriptionMap& targetPids() const { return request_.targetPids; }
    // The analysis mode once the snapfiles are open: theirs, if any fixed
    // it.
    bool breakDownPhysHeft() const { return request_.breakDownPhysHeft; }

private:
    // Target selection, in the order it runs.
    bool _openSnapfiles(HTError* error);
    std::set<int32_t> _excludedPids() const;
    void _resolvePotentialTargets();
    void _addDescendantsOfTargets();
    HTProcess::ProcessMap _hiddenProcessesForUnmapped(const std::set<int32_t>& excluded) const;
    void _addTargetProcesses(HTProcess::ProcessMap& result) const;
    void _addSnapfileProcesses(HTProcess::ProcessMap& result) const;

    std::shared_ptr<HTPlatform> platform_;
    HTSettings settings_;
    HTProcessDiscovery discovery_;
    Request request_;
    // The snapfiles opened, in the order given, with their paths.
    std::vector<std::pair<std::string, std::shared_ptr<HTSnapfileProcess>>> snapfiles_;
};
