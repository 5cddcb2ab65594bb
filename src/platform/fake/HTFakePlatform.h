#pragma once

// A platform whose every answer a test scripts: processes with their
// records, paths and flags, sysctl values, files that exist, and who the
// caller is. Calls that were not scripted fail the way the real kernel
// fails for something that is not there.

#include "platform/HTPlatform.h"

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

class HTFakePlatform : public HTPlatform {
public:
    struct Process {
        proc_bsdinfo info{};
        // The executable path of the process's argument area; nullopt makes
        // the argument-area read fail.
        std::optional<std::string> executablePath;
        std::vector<std::string> arguments;
        // proc_get_dirty: the flags, or the errno it fails with.
        uint32_t dirtyFlags = 0;
        int dirtyErrno = ENOTSUP;
        // task_for_pid's answer.
        kern_return_t taskResult = KERN_SUCCESS;
    };

    // Adds a process with the given identity; returns it for further
    // scripting. `comm` fills both pbi_comm and pbi_name (truncated to fit).
    Process& addProcess(int32_t pid, int32_t ppid, const std::string& comm,
                        std::optional<std::string> executablePath = std::nullopt, uint32_t flags = PROC_FLAG_LP64);
    void removeProcess(int32_t pid);
    Process* process(int32_t pid);

    // Scripted state, public for tests to set.
    int listErrno = 0;                  // non-zero: proc_listallpids fails with it
    int32_t argmax = 256 * 1024;        // KERN_ARGMAX
    uint64_t pageSize = 4096;
    int32_t ownPid = 99999;
    uint32_t euid = 0;
    std::set<int> terminals;            // descriptors that are terminals
    std::set<std::string> existingFiles;
    std::map<std::string, int32_t> sysctlValues;  // sysctlbyname integers; absent: ENOENT
    std::vector<std::string> machErrors;          // what mach_error wrote

    int proc_listallpids(int32_t* buffer, int bufferSize) override;
    int proc_pidinfo(int32_t pid, int flavor, uint64_t arg, void* buffer, int bufferSize) override;
    int proc_get_dirty(int32_t pid, uint32_t* flags) override;
    int sysctl(const int* name, unsigned nameLength, void* oldp, size_t* oldlenp, const void* newp,
               size_t newlen) override;
    int sysctlbyname(const char* name, void* oldp, size_t* oldlenp, const void* newp, size_t newlen) override;
    uint64_t vm_kernel_page_size() override { return pageSize; }
    kern_return_t task_for_pid(int32_t pid, std::shared_ptr<HTTaskPort>* task) override;
    std::string mach_error_string(kern_return_t code) override;
    void mach_error(const char* label, kern_return_t code) override;
    int32_t getpid() override { return ownPid; }
    uint32_t geteuid() override { return euid; }
    bool isatty(int fd) override { return terminals.count(fd) != 0; }
    bool stat(const char* path) override { return existingFiles.count(path) != 0; }

private:
    // In the order added: the listing order.
    std::vector<int32_t> order_;
    std::map<int32_t, Process> processes_;
};
