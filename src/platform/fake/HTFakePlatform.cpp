#include "platform/fake/HTFakePlatform.h"

#include "platform/HTMachErrorText.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace {

class HTFakeTaskPort : public HTTaskPort {
public:
    explicit HTFakeTaskPort(int32_t pid) : pid_(pid) {}
    int32_t pid() const override { return pid_; }

private:
    int32_t pid_;
};

// The argument area: a 32-bit argument count, the executable path, NUL
// padding, then the arguments, each NUL-terminated.
std::string buildProcargs(const std::string& path, const std::vector<std::string>& arguments)
{
    int32_t argc = static_cast<int32_t>(arguments.size());
    std::string area(reinterpret_cast<const char*>(&argc), sizeof(argc));
    area += path;
    area.append(4, '\0');
    for (const auto& argument : arguments) {
        area += argument;
        area.push_back('\0');
    }
    return area;
}

}  // namespace

HTFakePlatform::Process& HTFakePlatform::addProcess(int32_t pid, int32_t ppid, const std::string& comm,
                                                   std::optional<std::string> executablePath, uint32_t flags)
{
    if (processes_.count(pid) == 0) order_.push_back(pid);
    Process& process = processes_[pid];
    process = Process{};
    process.info.pbi_pid = static_cast<uint32_t>(pid);
    process.info.pbi_ppid = static_cast<uint32_t>(ppid);
    process.info.pbi_flags = flags;
    process.info.pbi_status = SRUN;
    std::memcpy(process.info.pbi_comm, comm.data(), std::min(comm.size(), sizeof(process.info.pbi_comm)));
    std::memcpy(process.info.pbi_name, comm.data(), std::min(comm.size(), sizeof(process.info.pbi_name)));
    process.executablePath = std::move(executablePath);
    return process;
}

void HTFakePlatform::removeProcess(int32_t pid)
{
    processes_.erase(pid);
    order_.erase(std::remove(order_.begin(), order_.end(), pid), order_.end());
}

HTFakePlatform::Process* HTFakePlatform::process(int32_t pid)
{
    auto found = processes_.find(pid);
    return found == processes_.end() ? nullptr : &found->second;
}

int HTFakePlatform::proc_listallpids(int32_t* buffer, int bufferSize)
{
    if (listErrno != 0) {
        errno = listErrno;
        return -1;
    }
    if (buffer == nullptr) return static_cast<int>(order_.size());
    size_t capacity = static_cast<size_t>(bufferSize) / sizeof(int32_t);
    size_t count = std::min(capacity, order_.size());
    std::copy_n(order_.begin(), count, buffer);
    return static_cast<int>(count);
}

int HTFakePlatform::proc_pidinfo(int32_t pid, int flavor, uint64_t, void* buffer, int bufferSize)
{
    Process* found = process(pid);
    if (found == nullptr) {
        errno = ESRCH;
        return 0;
    }
    if (flavor == PROC_PIDTBSDINFO && bufferSize >= static_cast<int>(sizeof(proc_bsdinfo))) {
        std::memcpy(buffer, &found->info, sizeof(proc_bsdinfo));
        return sizeof(proc_bsdinfo);
    }
    if (flavor == PROC_PIDT_SHORTBSDINFO && bufferSize >= static_cast<int>(sizeof(proc_bsdshortinfo))) {
        proc_bsdshortinfo shortInfo{};
        shortInfo.pbsi_pid = found->info.pbi_pid;
        shortInfo.pbsi_ppid = found->info.pbi_ppid;
        shortInfo.pbsi_status = found->info.pbi_status;
        std::memcpy(shortInfo.pbsi_comm, found->info.pbi_comm, sizeof(shortInfo.pbsi_comm));
        shortInfo.pbsi_flags = found->info.pbi_flags;
        std::memcpy(buffer, &shortInfo, sizeof(shortInfo));
        return sizeof(proc_bsdshortinfo);
    }
    errno = EINVAL;
    return 0;
}

int HTFakePlatform::proc_get_dirty(int32_t pid, uint32_t* flags)
{
    Process* found = process(pid);
    if (found == nullptr) return ESRCH;
    if (found->dirtyErrno != 0) return found->dirtyErrno;
    *flags = found->dirtyFlags;
    return 0;
}

int HTFakePlatform::sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void*, size_t)
{
    if (nameLength == 2 && name[0] == CTL_KERN && name[1] == KERN_ARGMAX) {
        if (oldp == nullptr || oldlenp == nullptr || *oldlenp < sizeof(int32_t)) {
            errno = EINVAL;
            return -1;
        }
        std::memcpy(oldp, &argmax, sizeof(int32_t));
        *oldlenp = sizeof(int32_t);
        return 0;
    }
    if (nameLength == 3 && name[0] == CTL_KERN && name[1] == KERN_PROCARGS2) {
        Process* found = process(name[2]);
        if (found == nullptr || !found->executablePath) {
            errno = found == nullptr ? ESRCH : EPERM;
            return -1;
        }
        std::string area = buildProcargs(*found->executablePath, found->arguments);
        if (oldp == nullptr || oldlenp == nullptr || *oldlenp < area.size()) {
            errno = ENOMEM;
            return -1;
        }
        std::memcpy(oldp, area.data(), area.size());
        *oldlenp = area.size();
        return 0;
    }
    errno = ENOENT;
    return -1;
}

int HTFakePlatform::sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen)
{
    auto found = sysctlValues.find(name);
    if (found == sysctlValues.end()) {
        errno = ENOENT;
        return -1;
    }
    if (oldp != nullptr && oldlenp != nullptr) {
        if (*oldlenp < sizeof(int32_t)) {
            errno = ENOMEM;
            return -1;
        }
        std::memcpy(oldp, &found->second, sizeof(int32_t));
        *oldlenp = sizeof(int32_t);
    }
    if (newp != nullptr) {
        if (newlen != sizeof(int32_t)) {
            errno = EINVAL;
            return -1;
        }
        std::memcpy(&found->second, newp, sizeof(int32_t));
    }
    return 0;
}

kern_return_t HTFakePlatform::task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task)
{
    Process* found = process(pid);
    if (found == nullptr) return HT_KERN_ERRNO_BASE | ESRCH;
    if (found->taskResult != KERN_SUCCESS) return found->taskResult;
    *task = std::make_shared<HTFakeTaskPort>(pid);
    return KERN_SUCCESS;
}

std::string HTFakePlatform::mach_error_string(kern_return_t code)
{
    return htMachErrorString(code);
}

void HTFakePlatform::mach_error(const char* label, kern_return_t code)
{
    machErrors.push_back(std::string(label) + ": " + mach_error_string(code));
}
