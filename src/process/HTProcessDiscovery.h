#pragma once

#include "base/HTSettings.h"
#include "platform/HTPlatform.h"
#include "process/HTProcess.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

// Finds the processes of the running system and makes their process
// objects: the kernel and user processes, each with the run's settings.
class HTProcessDiscovery {
public:
    // Labels the threads that set up the processes of a listing.
    static constexpr const char* kSetupQueueLabel = "heft.setup";

    HTProcessDiscovery(std::shared_ptr<HTPlatform> platform, const HTSettings& settings);

    // The process of the record, opened; null when it cannot be read.
    std::shared_ptr<HTProcess> processWithBsdInfo(const proc_bsdinfo& info) const;
    std::shared_ptr<HTProcess> processWithPid(int32_t pid) const;
    // nullopt when the system process list cannot be read.
    std::optional<HTProcess::ProcessMap> allProcessesExcludingPids(const std::set<int32_t>& excludedPids) const;
    // The pids that the descriptions (names or pids) name; an error for each
    // description that names nothing.
    std::optional<HTProcess::PidDescriptionMap> pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                                                          std::vector<std::string>* errors) const;
    // The pids and all their descendants.
    std::optional<std::vector<int32_t>> childPidsForPids(const std::vector<int32_t>& pids) const;
    static HTProcess::ProcessMap removeIdleExitCleanProcessesFrom(const HTProcess::ProcessMap& processes);

    // The pid a command line names: a whole decimal number, leading blanks
    // allowed, within the range of pids; nullopt for anything else.
    static std::optional<int32_t> pidForText(const std::string& text);

private:
    std::shared_ptr<HTPlatform> platform_;
    HTSettings settings_;
};
