#include "process/HTProcess.h"

#include "analysis/HTHeft.h"
#include "model/HTAuxDataMap.h"
#include "platform/HTWorkQueue.h"
#include "process/HTKernelProcess.h"
#include "process/HTUserProcess.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string_view>
#include <unordered_set>

namespace {

// The program-wide error list. Created on first use; written on the main
// thread only.
std::vector<std::string>& globalErrorList()
{
    static std::vector<std::string> list;
    return list;
}

// Where the errors of the process being set up on this thread go, when
// processes are set up side by side; the main thread adds them to the
// global list afterwards, in the order of the process list.
thread_local std::vector<std::string>* capturedErrors = nullptr;

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
        HTWorkQueue queue(HTProcess::kSetupQueueLabel, setupThreadCount(listed));
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

// A fixed-size, possibly unterminated name field of a record.
std::string boundedString(const char* field, size_t capacity) { return std::string(field, strnlen(field, capacity)); }

}  // namespace

HTProcess::HTProcess(std::shared_ptr<HTPlatform> platform) : platform_(std::move(platform)) {}

HTProcess::~HTProcess() = default;

bool HTProcess::initWithBsdInfo(const proc_bsdinfo& info)
{
    pid_ = static_cast<int32_t>(info.pbi_pid);
    is64bit_ = (info.pbi_flags & PROC_FLAG_LP64) != 0;
    // Named first, so that a process that cannot be opened is named in what
    // is said about it.
    name_ = _nameForBsdInfo(*platform_, info);
    char display[512];
    std::snprintf(display, sizeof(display), "%s [%d]", name_.c_str(), pid_);
    displayString_ = display;
    if (!_populateTask()) return false;
    pageSize_ = _gatherPageSize();
    return true;
}

bool HTProcess::_populateTask() { return false; }

uint64_t HTProcess::_gatherPageSize() { return platform_->vm_kernel_page_size(); }

void HTProcess::gatherData() {}

bool HTProcess::_isAlive() { return false; }

std::shared_ptr<HTAuxDataMap> HTProcess::auxData() { return std::make_shared<HTAuxDataMap>(); }

bool HTProcess::breakDownPhysHeft() { return HTHeft::breakDownPhysHeft(*platform_); }

const std::vector<std::shared_ptr<HTMemoryRegion>>& HTProcess::memoryRegions() const
{
    static const std::vector<std::shared_ptr<HTMemoryRegion>> none;
    return memoryRegions_ ? *memoryRegions_ : none;
}

void HTProcess::setMemoryRegions(std::optional<std::vector<std::shared_ptr<HTMemoryRegion>>> regions)
{
    memoryRegions_ = std::move(regions);
}

std::string HTProcess::description() const { return "HTProcess[" + std::to_string(pid_) + "]"; }

std::shared_ptr<HTProcess> HTProcess::processWithBsdInfo(const std::shared_ptr<HTPlatform>& platform,
                                                         const proc_bsdinfo& info)
{
    std::shared_ptr<HTProcess> process;
    if (info.pbi_flags & PROC_FLAG_SYSTEM)
        process = std::make_shared<HTKernelProcess>(platform);
    else
        process = std::make_shared<HTUserProcess>(platform);
    if (!process->initWithBsdInfo(info)) return nullptr;
    return process;
}

std::shared_ptr<HTProcess> HTProcess::processWithPid(const std::shared_ptr<HTPlatform>& platform, int32_t pid)
{
    proc_bsdinfo info{};
    if (platform->proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof(info)) != sizeof(info)) return nullptr;
    return processWithBsdInfo(platform, info);
}

std::string HTProcess::_nameForBsdInfo(HTPlatform& platform, const proc_bsdinfo& info)
{
    int32_t argmax = 0;
    size_t length = sizeof(argmax);
    int argmaxName[2] = {CTL_KERN, KERN_ARGMAX};
    if (platform.sysctl(argmaxName, 2, &argmax, &length, nullptr, 0) != 0 || argmax <= 0)
        return _nameForBsdInfoCommName(info);

    // One buffer per thread, reused: the argument area can be megabytes and
    // a listing names every process of the system.
    thread_local std::vector<char> area;
    if (area.size() < static_cast<size_t>(argmax)) area.resize(static_cast<size_t>(argmax));
    length = static_cast<size_t>(argmax);
    int argsName[3] = {CTL_KERN, KERN_PROCARGS2, static_cast<int>(info.pbi_pid)};
    if (platform.sysctl(argsName, 3, area.data(), &length, nullptr, 0) != 0 || length == 0)
        return _nameForBsdInfoCommName(info);
    area[length - 1] = '\0';

    // The area starts with the 32-bit argument count; the executable path
    // follows it, after any NUL padding. The count is skipped whole: its
    // bytes may themselves be NUL (256 arguments) or not.
    size_t position = sizeof(int32_t);
    while (position < length && area[position] == '\0') ++position;
    if (position >= length) return _nameForBsdInfoCommName(info);

    std::string_view path(&area[position]);
    size_t slash = path.rfind('/');
    return std::string(slash == std::string_view::npos ? path : path.substr(slash + 1));
}

std::string HTProcess::_nameForBsdInfoCommName(const proc_bsdinfo& info)
{
    if (info.pbi_name[0] != '\0') return boundedString(info.pbi_name, sizeof(info.pbi_name));
    if (info.pbi_comm[0] != '\0') return boundedString(info.pbi_comm, sizeof(info.pbi_comm));
    return "Unknown";
}

std::optional<HTProcess::ProcessMap> HTProcess::allProcessesExcludingPids(const std::shared_ptr<HTPlatform>& platform,
                                                                          const std::set<int32_t>& excludedPids)
{
    auto records = listAllProcesses(*platform);
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
            capturedErrors = &errors[index];
            made[index] = processWithBsdInfo(platform, (*records)[index]);
            capturedErrors = nullptr;
        });
    }
    ProcessMap processes;
    for (size_t index = 0; index < records->size(); ++index) {
        for (std::string& error : errors[index]) _addGlobalError(std::move(error));
        if (made[index]) processes.set(static_cast<int32_t>((*records)[index].pbi_pid), std::move(made[index]));
    }
    return processes;
}

std::optional<HTProcess::PidDescriptionMap>
HTProcess::pidsForStringDescriptions(HTPlatform& platform, const std::vector<std::string>& descriptions,
                                     std::vector<std::string>* errors)
{
    auto records = listAllProcesses(platform);
    if (!records) {
        if (errors) *errors = {"Unable to obtain system process list"};
        return std::nullopt;
    }
    // Each record is named once, however many descriptions there are.
    std::vector<std::string> names;
    names.reserve(records->size());
    for (const auto& info : *records) names.push_back(_nameForBsdInfo(platform, info));

    PidDescriptionMap pids;
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

std::optional<std::vector<int32_t>> HTProcess::childPidsForPids(HTPlatform& platform, const std::vector<int32_t>& pids)
{
    auto records = listAllProcesses(platform);
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

HTProcess::ProcessMap HTProcess::removeIdleExitCleanProcessesFrom(const ProcessMap& processes)
{
    ProcessMap kept;
    for (const auto& [pid, process] : processes)
        if (process->idleExitStatus() != HTIdleExitStatusClean) kept.set(pid, process);
    return kept;
}

std::optional<int32_t> HTProcess::pidForText(const std::string& text)
{
    // Leading blanks are allowed, as strtol allows them; anything after
    // the digits makes the text a name, not a pid.
    errno = 0;
    char* end = nullptr;
    long long value = std::strtoll(text.c_str(), &end, 10);
    if (end == text.c_str() || *end != '\0' || errno == ERANGE || value < 0 || value > INT32_MAX) return std::nullopt;
    return static_cast<int32_t>(value);
}

void HTProcess::_addGlobalError(std::string error)
{
    if (capturedErrors != nullptr)
        capturedErrors->push_back(std::move(error));
    else
        globalErrorList().push_back(std::move(error));
}

std::vector<std::string> HTProcess::globalErrors() { return globalErrorList(); }

void HTProcess::_clearGlobalErrors() { globalErrorList().clear(); }
