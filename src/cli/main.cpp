#include "cli/HTHeftMain.h"
#include "platform/linux/HTLinuxPlatform.h"

#include <csignal>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <unistd.h>

namespace {

// heft builds tens of megabytes of small objects and touches each of their
// pages once, so a run costs a page fault for every four kilobytes it
// holds; where faults are dear (under hypervisors that shadow page
// tables) they cost more than the analysis itself. glibc backs its heaps
// with transparent huge pages, a fault for every two megabytes, when its
// tunable says so, and reads the tunable only as a program starts: heft
// sets it and starts itself once more. The heaps of the gathering threads
// then grow by 8 MiB at a time rather than by the default 128 KiB, each
// step a system call of its own (thousands of them in a run over every
// process); more would raise heft's peak memory for little gain. A user's
// own choice is kept, and where heft cannot restart it runs on as it is.
// The restarted heft puts the caller's environment back, so that a program
// it runs (--exec) inherits what the caller had: glibc has read the
// tunable by then.
void restartWithHugePageHeaps(char** argv)
{
    constexpr const char* kName = "GLIBC_TUNABLES";
    constexpr const char* kTunable = "glibc.malloc.hugetlb";
    constexpr const char* kSettings = "glibc.malloc.hugetlb=1:glibc.malloc.top_pad=8388608";
    // The caller's value, "=" and the value, or "" when it had none.
    constexpr const char* kCallersValue = "HEFT_CALLERS_GLIBC_TUNABLES";
    if (const char* callers = std::getenv(kCallersValue)) {
        if (*callers == '=')
            ::setenv(kName, callers + 1, 1);
        else
            ::unsetenv(kName);
        ::unsetenv(kCallersValue);
        return;
    }
    const char* current = std::getenv(kName);
    if (current != nullptr && std::strstr(current, kTunable) != nullptr) return;
    const std::string previous = current != nullptr ? current : "";
    const std::string value = (previous.empty() ? "" : previous + ":") + kSettings;
    const std::string callers = current != nullptr ? "=" + previous : "";
    if (::setenv(kName, value.c_str(), 1) != 0 || ::setenv(kCallersValue, callers.c_str(), 1) != 0) return;
    ::execv("/proc/self/exe", argv);
    ::unsetenv(kCallersValue);
    if (current != nullptr)
        ::setenv(kName, previous.c_str(), 1);
    else
        ::unsetenv(kName);
}

}  // namespace

int main(int argc, char** argv)
{
    restartWithHugePageHeaps(argv);
    // A reader that closes the pipe of the report (`heft -a -j f | head`)
    // must not end the run before the JSON file is written: the failed
    // write is reported instead.
    std::signal(SIGPIPE, SIG_IGN);
    return heftMain(argc, argv, std::make_shared<HTLinuxPlatform>(), true);
}
