#include "process/HTTargetSelection.h"

#include <cstdio>

HTTargetSelection::HTTargetSelection(std::shared_ptr<HTPlatform> platform, const HTSettings& settings, Request request)
    : platform_(std::move(platform)), discovery_(platform_, settings), request_(std::move(request))
{
}

std::optional<HTTargetSelection::ProcessList> HTTargetSelection::targetProcessesAndError(HTError* error)
{
    if (error) *error = HTError();
    HTProcess::ProcessMap result;

    // Snapfile pass: operands that name existing files are opened as
    // snapfiles before anything else, and their processes enter `result`.
    // Until heft reads snapfiles, every operand goes on to process discovery.

    if (request_.targetPids.empty() && request_.potentialTargetProcesses.empty() && result.empty() &&
        !request_.targetAll) {
        if (error)
            *error =
                HTError(HTHeftErrorDomain, HTHeftErrorCodeNoTarget, "Must specify at least one process or snapfile");
        return std::nullopt;
    }

    std::set<int32_t> excluded = _excludedPids();
    if (request_.targetAll) {
        // Every live process but the excluded ones; the operands and any
        // snapfiles are not used.
        result = discovery_.allProcessesExcludingPids(excluded).value_or(HTProcess::ProcessMap());
    } else {
        _resolvePotentialTargets();
        for (int32_t pid : excluded) request_.targetPids.erase(pid);
        // After the exclusions on purpose: -t reaches every descendant, even
        // an excluded one.
        if (request_.targetChildren) _addDescendantsOfTargets();
        if (request_.searchForUnmapped) result = _hiddenProcessesForUnmapped(excluded);
        _addTargetProcesses(result);
    }
    if (request_.skipIdleExitClean) result = HTProcessDiscovery::removeIdleExitCleanProcessesFrom(result);

    std::vector<std::shared_ptr<HTProcess>> processes;
    processes.reserve(result.size());
    for (const auto& entry : result) processes.push_back(entry.second);
    return processes;
}

std::set<int32_t> HTTargetSelection::_excludedPids() const
{
    std::set<int32_t> excluded;
    if (request_.excludeSelf) excluded.insert(platform_->getpid());
    if (!request_.excludedPidsOrProcesses.empty()) {
        // Exclusions that match nothing are not worth a message.
        auto pids = discovery_.pidsForStringDescriptions(request_.excludedPidsOrProcesses, nullptr);
        if (pids)
            for (const auto& entry : *pids) excluded.insert(entry.first);
    }
    return excluded;
}

void HTTargetSelection::_resolvePotentialTargets()
{
    if (request_.potentialTargetProcesses.empty()) return;
    std::vector<std::string> errors;
    auto pids = discovery_.pidsForStringDescriptions(request_.potentialTargetProcesses, &errors);
    if (pids)
        for (const auto& [pid, name] : *pids) request_.targetPids.set(pid, name);
    // An operand that matches nothing does not stop the others.
    for (const auto& message : errors) std::fprintf(stderr, "%s\n", message.c_str());
}

void HTTargetSelection::_addDescendantsOfTargets()
{
    auto pids = discovery_.childPidsForPids(request_.targetPids.keys());
    if (!pids) return;
    // Targets found by name lose their name here: from now on they are
    // reported by pid, like the descendants.
    for (int32_t pid : *pids) request_.targetPids.set(pid, std::nullopt);
}

HTProcess::ProcessMap HTTargetSelection::_hiddenProcessesForUnmapped(const std::set<int32_t>& excluded) const
{
    // Every other process is analysed for memory that a target owns without
    // mapping it; those processes are not reported themselves. The kernel
    // owns nothing a user process could have unmapped, so it stays out.
    std::set<int32_t> skipped = excluded;
    for (int32_t pid : request_.targetPids.keys()) skipped.insert(pid);
    skipped.insert(0);
    auto others = discovery_.allProcessesExcludingPids(skipped);
    if (!others) return {};
    for (const auto& entry : *others) entry.second->setHiddenFromDisplay(true);
    return std::move(*others);
}

void HTTargetSelection::_addTargetProcesses(HTProcess::ProcessMap& result) const
{
    for (const auto& [pid, name] : request_.targetPids) {
        if (auto process = discovery_.processWithPid(pid)) {
            result.set(pid, std::move(process));
        } else if (name) {
            std::fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", name->c_str(),
                         static_cast<long>(pid));
        } else {
            std::fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", static_cast<long>(pid));
        }
    }
}
