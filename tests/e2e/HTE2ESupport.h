// Support for the tests that run the built heft on live processes: running a
// program and capturing its streams, child processes (alone, or a parent and
// the children it forked) that lay out known memory and then wait, temporary
// directories and swap that clean up after themselves, and what the kernel
// itself says about a process's memory.

#pragma once

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/swap.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

extern char** environ;

namespace heft_e2e {

inline constexpr const char* kHeftBinary = HEFT_BINARY;
inline constexpr const char* kSetpriv = "/usr/bin/setpriv";
inline constexpr uid_t kNobody = 65534;
inline constexpr uid_t kSameUser = static_cast<uid_t>(-1);
inline constexpr uint64_t kMiB = 1024 * 1024;

// The whole of a file; empty when it cannot be read.
inline std::string readFile(const std::string& path)
{
    std::ifstream file(path);
    std::ostringstream contents;
    contents << file.rdbuf();
    return contents.str();
}

inline std::vector<char*> argvOf(std::vector<std::string>& arguments)
{
    std::vector<char*> argv;
    for (auto& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    return argv;
}

struct Outcome {
    int status = -1;  // the exit status, or -1 when the program did not exit normally
    std::string standardOutput;
    std::string standardError;
};

// No run of heft in these tests takes more than seconds; one that takes
// minutes is stopped by an alarm (which survives exec) and reported rather
// than left to hang the suite.
inline constexpr unsigned kRunLimitSeconds = 180;

// Runs `program` with `arguments` (arguments[0] is the name the program sees
// itself called by), capturing both streams in memory files, which unlike
// pipes never fill up and stall the program. A non-zero `openFiles` is the
// program's open-file limit, soft and hard, so that it cannot raise it.
inline Outcome runProgram(const char* program, std::vector<std::string> arguments, rlim_t openFiles = 0)
{
    Outcome outcome;
    const int streams[2] = {memfd_create("heft-e2e-out", MFD_CLOEXEC), memfd_create("heft-e2e-err", MFD_CLOEXEC)};
    std::vector<char*> argv = argvOf(arguments);
    pid_t child = streams[0] < 0 || streams[1] < 0 ? -1 : fork();
    if (child == 0) {
        dup2(streams[0], STDOUT_FILENO);
        dup2(streams[1], STDERR_FILENO);
        // The program gets the streams and nothing else of the test's: under
        // a limit, every descriptor it may open is its own.
        const rlimit files{openFiles, openFiles};
        close_range(3, ~0U, 0);
        if (openFiles != 0 && setrlimit(RLIMIT_NOFILE, &files) != 0) _exit(126);
        alarm(kRunLimitSeconds);
        execve(program, argv.data(), environ);
        _exit(127);
    }
    int status = 0;
    if (child < 0) ADD_FAILURE() << "cannot run " << program << ": " << std::strerror(errno);
    while (child > 0 && waitpid(child, &status, 0) < 0 && errno == EINTR) {}
    outcome.status = child > 0 && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    EXPECT_FALSE(WIFSIGNALED(status) && WTERMSIG(status) == SIGALRM)
        << arguments[0] << " ran for more than " << kRunLimitSeconds << " s";
    outcome.standardOutput = readFile("/proc/self/fd/" + std::to_string(streams[0]));
    outcome.standardError = readFile("/proc/self/fd/" + std::to_string(streams[1]));
    for (int fd : streams) close(fd);
    return outcome;
}

inline Outcome runHeft(std::vector<std::string> arguments)
{
    arguments.insert(arguments.begin(), "heft");
    return runProgram(kHeftBinary, std::move(arguments));
}

// heft run by the unprivileged user nobody.
inline Outcome runHeftAsNobody(std::vector<std::string> arguments)
{
    std::string id = std::to_string(kNobody);
    arguments.insert(arguments.begin(), {"setpriv", "--reuid=" + id, "--regid=" + id, "--clear-groups", kHeftBinary});
    return runProgram(kSetpriv, std::move(arguments));
}

// A directory under /tmp, removed with everything in it.
struct TempDir {
    TempDir()
    {
        char pattern[] = "/tmp/heft-e2e-XXXXXX";
        if (mkdtemp(pattern) != nullptr) path = pattern;
    }
    ~TempDir()
    {
        std::error_code ignored;
        if (!path.empty()) std::filesystem::remove_all(path, ignored);
    }
    TempDir(const TempDir&) = delete;

    bool ok() const { return !path.empty(); }
    std::string file(const char* name) const { return path + "/" + name; }

    std::string path;
};

// The layout program (tests/e2e/layout.c, built with the tests), written back
// before the first child runs it: the children's code and data are then clean
// file pages, not dirty ones that all of them share until writeback comes.
inline const char* layoutProgram()
{
    static const bool writtenBack = [] {
        int fd = open(HEFT_LAYOUT_PROGRAM, O_RDONLY | O_CLOEXEC);
        return fd >= 0 && fsync(fd) == 0 && close(fd) == 0;
    }();
    EXPECT_TRUE(writtenBack) << HEFT_LAYOUT_PROGRAM;
    return HEFT_LAYOUT_PROGRAM;
}

// A child process running the layout program with `arguments`, as `user`
// when one is given; it dies with the test, and is killed and reaped with
// this object. `value(i)` is the i-th number it printed once laid out.
class LaidOutChild {
public:
    explicit LaidOutChild(std::vector<std::string> arguments, uid_t user = kSameUser)
    {
        arguments.insert(arguments.begin(), "heft-e2e-layout");
        std::vector<char*> argv = argvOf(arguments);
        const char* program = layoutProgram();
        int ready[2];
        if (pipe2(ready, O_CLOEXEC) != 0) return;
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(ready[1], STDOUT_FILENO);
            if (user != kSameUser && (setgroups(0, nullptr) != 0 || setgid(user) != 0 || setuid(user) != 0)) _exit(2);
            execv(program, argv.data());
            _exit(127);
        }
        close(ready[1]);
        std::string line;
        char byte = 0;
        while (pid_ > 0 && read(ready[0], &byte, 1) == 1 && byte != '\n') line += byte;
        close(ready[0]);
        ready_ = byte == '\n';
        std::istringstream numbers(line);
        for (uint64_t value; numbers >> value;) values_.push_back(value);
    }
    ~LaidOutChild()
    {
        if (pid_ <= 0) return;
        kill(pid_, SIGKILL);
        while (waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {}
    }
    LaidOutChild(const LaidOutChild&) = delete;
    LaidOutChild& operator=(const LaidOutChild&) = delete;

    bool ready() const { return ready_; }
    pid_t pid() const { return pid_; }
    std::string pidString() const { return std::to_string(pid_); }
    uint64_t value(size_t index) const { return index < values_.size() ? values_[index] : 0; }

private:
    pid_t pid_ = -1;
    bool ready_ = false;
    std::vector<uint64_t> values_;
};

// Swap for the tests that push pages out: the system's own when it has some
// (/proc/swaps lists one after its heading line), otherwise a 256 MiB swap
// file under /tmp, turned off and removed again with this object, also when
// the test fails.
class SwapArea {
public:
    SwapArea()
    {
        std::string swaps = readFile("/proc/swaps");
        available_ = swaps.find('\n') + 1 < swaps.size();
        if (available_) return;
        Outcome made = runProgram("/bin/sh",
                                  {"sh", "-ec",
                                   "f=$(mktemp /tmp/heft-e2e-swap-XXXXXX); echo \"$f\"\n"
                                   "fallocate -l 256M \"$f\"; mkswap \"$f\" >&2; swapon \"$f\""});
        path_ = made.standardOutput.substr(0, made.standardOutput.find('\n'));
        enabled_ = available_ = made.status == 0;
        reason_ = made.standardError;
    }
    ~SwapArea()
    {
        if (enabled_ && swapoff(path_.c_str()) != 0) ADD_FAILURE() << "swapoff " << path_ << ": " << strerror(errno);
        if (!path_.empty()) unlink(path_.c_str());
    }
    SwapArea(const SwapArea&) = delete;
    SwapArea& operator=(const SwapArea&) = delete;

    bool available() const { return available_; }
    const std::string& reason() const { return reason_; }

private:
    std::string path_;
    std::string reason_;
    bool enabled_ = false;
    bool available_ = false;
};

// What the prefork mode of the layout program lays out (see there): by
// default a parent and four children sharing 64 MiB.
struct PreforkLayout {
    uint64_t shared = 64 * kMiB;
    int children = 4;
    uint64_t slice = kMiB;
    uint64_t own = 8 * kMiB;
    uint64_t after = 16 * kMiB;
    uint64_t pagedOut = 0;
    std::string file = "-";
    std::string path = "-";
};

// A family laid out by the prefork mode: the parent is a laid-out child, its
// children are the pids it printed (once all of them were ready). Taken down
// children first, while the parent still holds their pids, so that no other
// process can have them.
class LaidOutFamily : public LaidOutChild {
public:
    explicit LaidOutFamily(const PreforkLayout& l, uid_t user = kSameUser)
        : LaidOutChild({"prefork", std::to_string(l.shared), std::to_string(l.children), std::to_string(l.slice),
                        std::to_string(l.own), std::to_string(l.after), std::to_string(l.pagedOut), l.file, l.path},
                       user)
    {
        for (int i = 0; i < l.children && value(4 + i) != 0; ++i) children_.push_back(static_cast<pid_t>(value(4 + i)));
        all_ = {children_.begin(), children_.end()};
        all_.insert(pid());
    }
    ~LaidOutFamily()
    {
        for (pid_t child : children_) kill(child, SIGKILL);
    }

    pid_t parent() const { return pid(); }
    const std::vector<pid_t>& children() const { return children_; }
    const std::set<int>& all() const { return all_; }
    uint64_t sharedAddress() const { return value(0); }
    uint64_t fileAddress() const { return value(1); }
    int pageoutError() const { return static_cast<int>(value(3)); }

private:
    std::vector<pid_t> children_;
    std::set<int> all_;
};

// A "Name:  123 kB" field of a /proc file's text, in bytes (every field the
// tests read is in kB); 0 when it is not there.
inline uint64_t kernelField(const std::string& text, const char* name)
{
    size_t at = text.find("\n" + std::string(name) + ":");
    return at == std::string::npos ? 0 : std::strtoull(text.c_str() + at + std::strlen(name) + 2, nullptr, 10) * 1024;
}

// The smaps entry, heading line first, of the mapping of `pid` that starts
// at `address`; empty when there is none.
inline std::string mappingAt(pid_t pid, uint64_t address)
{
    std::string smaps = "\n" + readFile("/proc/" + std::to_string(pid) + "/smaps");
    char heading[32];
    std::snprintf(heading, sizeof(heading), "\n%llx-", static_cast<unsigned long long>(address));
    size_t start = smaps.find(heading);
    // VmFlags is the last field of every entry.
    size_t end = start == std::string::npos ? start : smaps.find("\nVmFlags:", start);
    return end == std::string::npos ? std::string() : smaps.substr(start, end - start);
}

// What the kernel charges `pid` that it cannot take back: the written and
// swapped pages of all its mappings, and its page tables. `proportionally`
// divides each page among the processes that map it, so that summed over a
// set of processes each of their pages counts once. A non-zero `thread` is
// read instead of the main thread (which reads empty once it has exited).
inline uint64_t kernelHeft(pid_t pid, bool proportionally = false, pid_t thread = 0)
{
    std::string base = "/proc/" + std::to_string(pid) + (thread ? "/task/" + std::to_string(thread) : "");
    std::string rollup = readFile(base + "/smaps_rollup");
    std::string status = readFile(base + "/status");
    EXPECT_FALSE(rollup.empty() || status.empty()) << "cannot read the memory figures of " << pid;
    uint64_t pages = proportionally
        ? kernelField(rollup, "Pss_Dirty") + kernelField(rollup, "SwapPss")
        : kernelField(rollup, "Private_Dirty") + kernelField(rollup, "Shared_Dirty") + kernelField(rollup, "Swap");
    return pages + kernelField(status, "VmPTE");
}

}  // namespace heft_e2e
