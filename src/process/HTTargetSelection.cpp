#include "process/HTTargetSelection.h"

#include <algorithm>
#include <cstdio>

HTTargetSelection::HTTargetSelection(std::shared_ptr<HTPlatform> platform, const HTSettings& settings, Request request)
    : platform_(std::move(platform)), settings_(settings), discovery_(platform_, settings), request_(std::move(request))
{
    // Until something fixes it, the mode is the run's.
    if (!request_.modeFixed) request_.breakDownPhysHeft = settings_.breakDownPhysHeft;
}

std::optional<HTTargetSelection::ProcessList> HTTargetSelection::targetProcessesAndError(HTError* error)
{
    if (error) *error = HTError();
    HTProcess::ProcessMap result;

    if (!_openSnapfiles(error)) return std::nullopt;
    // Live processes are read in the mode the snapfiles were gathered in.
    if (settings_.breakDownPhysHeft != request_.breakDownPhysHeft) {
        settings_.breakDownPhysHeft = request_.breakDownPhysHeft;
        discovery_ = HTProcessDiscovery(platform_, settings_);
    }
    if (request_.targetPids.empty() && request_.potentialTargetProcesses.empty() && snapfiles_.empty() &&
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
        // The search for unmapped memory reads live processes only.
        if (request_.searchForUnmapped) result = _hiddenProcessesForUnmapped(excluded);
        _addTargetProcesses(result);
        if (!request_.searchForUnmapped) _addSnapfileProcesses(result);
    }
    if (request_.skipIdleExitClean) result = HTProcessDiscovery::removeIdleExitCleanProcessesFrom(result);

    std::vector<std::shared_ptr<HTProcess>> processes;
    processes.reserve(result.size());
    for (const auto& entry : result) processes.push_back(entry.second);
    return processes;
}

// Operands that name existing files are opened as snapfiles before anything
// else; a file that is no snapfile may still be a process's name.
bool HTTargetSelection::_openSnapfiles(HTError* error)
{
    std::vector<std::string> remaining;
    for (const std::string& operand : request_.potentialTargetProcesses) {
        if (!platform_->stat(operand.c_str())) {
            remaining.push_back(operand);
            continue;
        }
        HTError snapfileError;
        auto process = HTSnapfileProcess::processWithSnapfile(platform_, settings_, operand, &snapfileError);
        if (process) {
            if (request_.modeFixed && request_.breakDownPhysHeft != process->breakDownPhysHeft()) {
                if (error)
                    *error = HTError(HTHeftErrorDomain, HTHeftErrorCodeSnapfileMode,
                                     "Snapfile was gathered with an analysis mode that conflicts with other "
                                     "snapfiles or command line arguments: " +
                                         operand);
                return false;
            }
            request_.breakDownPhysHeft = process->breakDownPhysHeft();
            request_.modeFixed = true;
            snapfiles_.emplace_back(operand, std::move(process));
            continue;
        }
        auto pids = discovery_.pidsForStringDescriptions({operand}, nullptr);
        if (!pids || pids->empty()) {
            if (error)
                *error = HTError(HTHeftErrorDomain, HTHeftErrorCodeSnapfileOpen,
                                 "Error opening snapfile " + operand + ": " + snapfileError.description.value_or(""));
            return false;
        }
        const auto& [pid, name] = *pids->begin();
        request_.targetPids.set(pid, name);
    }
    request_.potentialTargetProcesses = std::move(remaining);
    return true;
}

// Snapfiles join the live targets. The analysis knows a process by its pid:
// a snapfile whose pid another target has already is left out, and pages
// shared after a fork are matched only between snapfiles of one capture.
void HTTargetSelection::_addSnapfileProcesses(HTProcess::ProcessMap& result) const
{
    std::set<std::string> captures;
    for (const auto& entry : snapfiles_) captures.insert(entry.second->capture());
    if (captures.size() > 1)
        std::fprintf(stderr,
                     "The snapfiles come from %zu captures: pages shared after a fork are told apart only "
                     "within one, and counted as each process's own\n",
                     captures.size());
    // In the order of their pids, as a run over every live process takes
    // them (a shell's glob sorts "a.10000" before "a.9999").
    auto sorted = snapfiles_;
    std::stable_sort(sorted.begin(), sorted.end(),
                     [](const auto& a, const auto& b) { return a.second->pid() < b.second->pid(); });
    for (const auto& [path, process] : sorted) {
        if (const auto* other = result.find(process->pid())) {
            std::fprintf(stderr,
                         "Leaving out snapfile %s: its process has pid %d, as %s has; analyse them in "
                         "separate runs\n",
                         path.c_str(), process->pid(), (*other)->displayString().c_str());
            continue;
        }
        process->setIgnoresPageIdentities(captures.size() > 1);
        result.set(process->pid(), process);
    }
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
