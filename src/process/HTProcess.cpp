#include "process/HTProcess.h"

#include "model/HTAuxDataMap.h"

#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

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
    name_ = _nameForProcess(info);
    char display[512];
    std::snprintf(display, sizeof(display), "%s [%d]", name_.c_str(), pid_);
    displayString_ = display;
    if (!_populateTask()) return false;
    pageSize_ = _gatherPageSize();
    return true;
}

std::string HTProcess::_nameForProcess(const proc_bsdinfo& info) { return _nameForBsdInfo(*platform_, info); }

bool HTProcess::_populateTask() { return false; }

uint64_t HTProcess::_gatherPageSize() { return platform_->vm_kernel_page_size(); }

void HTProcess::gatherData() {}

bool HTProcess::_isAlive() { return false; }

std::shared_ptr<HTAuxDataMap> HTProcess::auxData() { return std::make_shared<HTAuxDataMap>(); }

const std::vector<std::shared_ptr<HTMemoryRegion>>& HTProcess::memoryRegions() const
{
    static const std::vector<std::shared_ptr<HTMemoryRegion>> none;
    return memoryRegions_ ? *memoryRegions_ : none;
}

void HTProcess::setMemoryRegions(std::optional<std::vector<std::shared_ptr<HTMemoryRegion>>> regions)
{
    memoryRegions_ = std::move(regions);
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

void HTProcess::_addGlobalError(std::string error)
{
    if (capturedErrors != nullptr)
        capturedErrors->push_back(std::move(error));
    else
        globalErrorList().push_back(std::move(error));
}

std::vector<std::string> HTProcess::globalErrors() { return globalErrorList(); }

void HTProcess::_clearGlobalErrors() { globalErrorList().clear(); }

std::vector<std::string>* HTProcess::_captureGlobalErrors(std::vector<std::string>* list)
{
    std::vector<std::string>* previous = capturedErrors;
    capturedErrors = list;
    return previous;
}
