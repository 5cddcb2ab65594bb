#include "process/HTProcessDiscovery.h"

#include "platform/HTWorkQueue.h"
#include "process/HTKernelProcess.h"
#include "process/HTUserProcess.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <unordered_set>

namespace {

// Threads for setting up the processes of a listing: one per core, and
// none for a handful of processes.
unsigned setupThreadCount(size_t processes)
{
    constexpr size_t kProcessesPerThread = 64;
    return static_cast<unsigned>(
        std::clamp<size_t>(processes / kProcessesPerThread, 1, HTWorkQueue::defaultThreadCount()));
}

// Every readable process record of the system, in the order the kernel
// lists them; nullopt when the list cannot be had.
std::optional<std::vector<proc_bsdinfo>> listAllProcesses(HTPlatform& platform)
{
    int count = platform.proc_listallpids(nullptr, 0);
    if (count < 0) return std::nullopt;
    // Room for processes started between the two calls.
    std::vector<int32_t> pids(static_cast<size_t>(count) + 20);
    int delivered = platform.proc_listallpids(pids.data(), static_cast<int>(pids.size() * sizeof(int32_t)));
    if (delivered < 0) return std::nullopt;

    // Each record is a read of the process's own files: thousands of them
    // are read side by side, and kept in the order of the list.
    const size_t listed = static_cast<size_t>(std::max(delivered, 0));
    std::vector<proc_bsdinfo> records(listed);
    std::vector<char> found(listed, 0);
    {
        HTWorkQueue queue(HTProcessDiscovery::kSetupQueueLabel, setupThreadCount(listed));
        queue.parallelFor(listed, [&](size_t index) {
            found[index] = platform.proc_pidinfo(pids[index], PROC_PIDTBSDINFO, 0, &records[index],
                                                 sizeof(proc_bsdinfo)) == sizeof(proc_bsdinfo);
        });
    }
    // Processes that exited in between drop out here.
    size_t kept = 0;
    for (size_t index = 0; index < listed; ++index)
        if (found[index]) records[kept++] = records[index];
    records.resize(kept);
    if (records.empty()) return std::nullopt;
    return records;
}

}  // namespace

HTProcessDiscovery::HTProcessDiscovery(std::shared_ptr<HTPlatform> platform, const HTSettings& settings)
    : platform_(std::move(platform)), settings_(settings)
{
}

std::shared_ptr<HTProcess> HTProcessDiscovery::processWithBsdInfo(const proc_bsdinfo& info) const
{
    std::shared_ptr<HTProcess> process;
    if (info.pbi_flags & PROC_FLAG_SYSTEM)
        process = std::make_shared<HTKernelProcess>(platform_);
    else
        process = std::make_shared<HTUserProcess>(platform_);
    process->setSettings(settings_);
    if (!process->initWithBsdInfo(info)) return nullptr;
    return process;
}

std::shared_ptr<HTProcess> HTProcessDiscovery::processWithPid(int32_t pid) const
{
    proc_bsdinfo info{};
    if (platform_->proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof(info)) != sizeof(info)) return nullptr;
    return processWithBsdInfo(info);
}

std::optional<HTProcess::ProcessMap>
HTProcessDiscovery::allProcessesExcludingPids(const std::set<int32_t>& excludedPids) const
{
    auto records = listAllProcesses(*platform_);
    if (!records) return std::nullopt;
    std::erase_if(*records, [&](const proc_bsdinfo& info) {
        return excludedPids.count(static_cast<int32_t>(info.pbi_pid)) != 0;
    });

    // Setting up a process reads several of its files; thousands of
    // processes are set up side by side, each touching only its own.
    std::vector<std::shared_ptr<HTProcess>> made(records->size());
    std::vector<std::vector<std::string>> errors(records->size());
    {
        HTWorkQueue queue(kSetupQueueLabel, setupThreadCount(records->size()));
        queue.parallelFor(records->size(), [&](size_t index) {
            HTProcess::_captureGlobalErrors(&errors[index]);
            made[index] = processWithBsdInfo((*records)[index]);
            HTProcess::_captureGlobalErrors(nullptr);
        });
    }
    HTProcess::ProcessMap processes;
    for (size_t index = 0; index < records->size(); ++index) {
        for (std::string& error : errors[index]) HTProcess::_addGlobalError(std::move(error));
        if (made[index]) processes.set(static_cast<int32_t>((*records)[index].pbi_pid), std::move(made[index]));
    }
    return processes;
}

std::optional<HTProcess::PidDescriptionMap>
HTProcessDiscovery::pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                              std::vector<std::string>* errors) const
{
    auto records = listAllProcesses(*platform_);
    if (!records) {
        if (errors) *errors = {"Unable to obtain system process list"};
        return std::nullopt;
    }
    // Each record is named once, however many descriptions there are.
    std::vector<std::string> names;
    names.reserve(records->size());
    for (const auto& info : *records) names.push_back(HTProcess::_nameForBsdInfo(*platform_, info));

    HTProcess::PidDescriptionMap pids;
    std::vector<std::string> collected;
    for (const auto& description : descriptions) {
        std::optional<int32_t> number = pidForText(description);
        bool matched = false;
        for (size_t i = 0; i < records->size(); ++i) {
            int32_t pid = static_cast<int32_t>((*records)[i].pbi_pid);
            if (names[i] == description) {
                pids.set(pid, description);
                matched = true;
            } else if (number && *number == pid) {
                pids.set(pid, std::nullopt);
                matched = true;
                break;
            }
        }
        if (!matched) collected.push_back("Unable to find pid for process matching '" + description + "'");
    }
    if (errors) *errors = collected;
    return pids;
}

std::optional<std::vector<int32_t>> HTProcessDiscovery::childPidsForPids(const std::vector<int32_t>& pids) const
{
    auto records = listAllProcesses(*platform_);
    if (!records) return std::nullopt;

    // The kernel is its own parent, so the walk remembers every pid it has
    // reached and never takes one twice.
    std::unordered_set<int32_t> visited(pids.begin(), pids.end());
    std::vector<int32_t> result;
    std::vector<int32_t> frontier = pids;
    while (!frontier.empty()) {
        std::unordered_set<int32_t> parents(frontier.begin(), frontier.end());
        std::vector<int32_t> next;
        for (const auto& info : *records) {
            int32_t pid = static_cast<int32_t>(info.pbi_pid);
            if (parents.count(static_cast<int32_t>(info.pbi_ppid)) && visited.insert(pid).second) next.push_back(pid);
        }
        result.insert(result.end(), frontier.begin(), frontier.end());
        frontier = std::move(next);
    }
    return result;
}

HTProcess::ProcessMap HTProcessDiscovery::removeIdleExitCleanProcessesFrom(const HTProcess::ProcessMap& processes)
{
    HTProcess::ProcessMap kept;
    for (const auto& [pid, process] : processes)
        if (process->idleExitStatus() != HTIdleExitStatusClean) kept.set(pid, process);
    return kept;
}

std::optional<int32_t> HTProcessDiscovery::pidForText(const std::string& text)
{
    // Leading blanks are allowed, as strtol allows them; anything after
    // the digits makes the text a name, not a pid.
    errno = 0;
    char* end = nullptr;
    long long value = std::strtoll(text.c_str(), &end, 10);
    if (end == text.c_str() || *end != '\0' || errno == ERANGE || value < 0 || value > INT32_MAX) return std::nullopt;
    return static_cast<int32_t>(value);
}
