// Support for the tests that run the built heft on live processes: running
// a program and capturing its streams, child processes (alone, or a parent
// and the children it forked) that lay out known memory and then wait,
// temporary directories and swap files that remove themselves, and what the
// kernel itself says about a process's memory.

#pragma once

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/swap.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

extern char** environ;

namespace heft_e2e {

inline constexpr const char* kHeftBinary = HEFT_BINARY;
inline constexpr const char* kSetpriv = "/usr/bin/setpriv";
inline constexpr uid_t kNobody = 65534;
inline constexpr uint64_t kMiB = 1024 * 1024;

struct Outcome {
    int status = -1;  // the exit status, or -1 when the program did not exit normally
    bool timedOut = false;
    std::string standardOutput;
    std::string standardError;
};

// No run of heft in these tests takes more than seconds; one that takes
// minutes is stopped and reported rather than left to hang the suite.
inline constexpr int kRunLimitSeconds = 180;

// Reads both pipes to their end at once, so that neither fills up while the
// other is waited on; kills `child` when it runs past the limit.
inline void drain(int outputFd, int errorFd, pid_t child, Outcome& outcome)
{
    struct pollfd fds[2] = {{outputFd, POLLIN, 0}, {errorFd, POLLIN, 0}};
    std::string* sinks[2] = {&outcome.standardOutput, &outcome.standardError};
    int openStreams = 2;
    const time_t deadline = time(nullptr) + kRunLimitSeconds;
    while (openStreams > 0) {
        time_t now = time(nullptr);
        if (now >= deadline && !outcome.timedOut) {
            outcome.timedOut = true;
            kill(child, SIGKILL);
        }
        int ready = poll(fds, 2, outcome.timedOut ? -1 : static_cast<int>(deadline - now) * 1000);
        if (ready < 0) {
            if (errno == EINTR) continue;
            break;
        }
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || fds[i].revents == 0) continue;
            char buffer[65536];
            ssize_t count = read(fds[i].fd, buffer, sizeof(buffer));
            if (count > 0) {
                sinks[i]->append(buffer, static_cast<size_t>(count));
            } else if (count == 0 || errno != EINTR) {
                close(fds[i].fd);
                fds[i].fd = -1;
                --openStreams;
            }
        }
    }
}

// Runs `program` with `arguments` (arguments[0] is the name the program sees
// itself called by), capturing both streams and the exit status.
inline Outcome runProgram(const char* program, std::vector<std::string> arguments)
{
    Outcome outcome;
    int outputPipe[2];
    int errorPipe[2];
    if (pipe2(outputPipe, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "pipe2: " << std::strerror(errno);
        return outcome;
    }
    if (pipe2(errorPipe, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "pipe2: " << std::strerror(errno);
        close(outputPipe[0]);
        close(outputPipe[1]);
        return outcome;
    }
    std::vector<char*> argv;
    for (auto& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);

    pid_t child = fork();
    if (child == 0) {
        dup2(outputPipe[1], STDOUT_FILENO);
        dup2(errorPipe[1], STDERR_FILENO);
        execve(program, argv.data(), environ);
        _exit(127);
    }
    close(outputPipe[1]);
    close(errorPipe[1]);
    if (child < 0) {
        ADD_FAILURE() << "fork: " << std::strerror(errno);
        close(outputPipe[0]);
        close(errorPipe[0]);
        return outcome;
    }
    drain(outputPipe[0], errorPipe[0], child, outcome);
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {}
    outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    EXPECT_FALSE(outcome.timedOut) << arguments[0] << " ran for more than " << kRunLimitSeconds << " s";
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
    std::vector<std::string> command = {"setpriv", "--reuid=" + id, "--regid=" + id, "--clear-groups", kHeftBinary};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return runProgram(kSetpriv, std::move(command));
}

// A directory under /tmp, removed with everything in it.
class TempDir {
public:
    TempDir()
    {
        char pattern[] = "/tmp/heft-e2e-XXXXXX";
        if (mkdtemp(pattern) != nullptr) path_ = pattern;
    }
    ~TempDir()
    {
        std::error_code ignored;
        if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    bool ok() const { return !path_.empty(); }
    const std::string& path() const { return path_; }
    std::string file(const char* name) const { return path_ + "/" + name; }

private:
    std::string path_;
};

// The layout program the children run (tests/e2e/layout.c), built with the
// tests. Written back once before the first child runs: the children's code
// and data are then clean file pages, not dirty ones that every child shares
// until writeback comes round.
class LayoutProgram {
public:
    static const LayoutProgram& shared()
    {
        static LayoutProgram program;
        return program;
    }
    const std::string& path() const { return path_; }
    const std::string& reason() const { return reason_; }

private:
    LayoutProgram()
    {
        int fd = open(HEFT_LAYOUT_PROGRAM, O_RDONLY | O_CLOEXEC);
        if (fd < 0) {
            reason_ = std::string("no layout program at " HEFT_LAYOUT_PROGRAM ": ") + std::strerror(errno);
            return;
        }
        fsync(fd);
        close(fd);
        path_ = HEFT_LAYOUT_PROGRAM;
    }

    std::string path_;
    std::string reason_;
};

// A child process running the layout program with `arguments`, optionally
// as another user; it dies with the test, and is killed and reaped with this
// object. `value(i)` is the i-th number the program reported.
class LaidOutChild {
public:
    explicit LaidOutChild(std::vector<std::string> arguments, uid_t user = static_cast<uid_t>(-1))
    {
        const std::string& program = LayoutProgram::shared().path();
        if (program.empty()) return;
        arguments.insert(arguments.begin(), "heft-e2e-layout");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        argv.push_back(nullptr);
        int ready[2];
        int hold[2];
        if (pipe2(ready, O_CLOEXEC) != 0) return;
        if (pipe2(hold, O_CLOEXEC) != 0) {
            close(ready[0]);
            close(ready[1]);
            return;
        }
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(hold[0], STDIN_FILENO);
            dup2(ready[1], STDOUT_FILENO);
            if (user != static_cast<uid_t>(-1)) {
                if (setgroups(0, nullptr) != 0 || setgid(user) != 0 || setuid(user) != 0) _exit(2);
            }
            execv(program.c_str(), argv.data());
            _exit(127);
        }
        close(ready[1]);
        close(hold[0]);
        holdFd_ = hold[1];
        if (pid_ < 0) {
            close(ready[0]);
            return;
        }
        std::string line;
        char byte;
        for (;;) {
            ssize_t count = read(ready[0], &byte, 1);
            if (count < 0 && errno == EINTR) continue;
            if (count <= 0) break;
            if (byte == '\n') {
                ready_ = true;
                break;
            }
            line += byte;
        }
        close(ready[0]);
        std::istringstream numbers(line);
        uint64_t value;
        while (numbers >> value) values_.push_back(value);
    }
    ~LaidOutChild()
    {
        if (holdFd_ >= 0) close(holdFd_);
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
    int holdFd_ = -1;
    bool ready_ = false;
    std::vector<uint64_t> values_;
};

// A swap area for tests that push pages out. When the system already swaps,
// that is used and nothing is changed; otherwise a 256 MiB swap file is made
// under /tmp, and turned off and removed again with this object, also when
// the test fails.
class SwapArea {
public:
    SwapArea()
    {
        if (systemHasSwap()) {
            available_ = true;
            return;
        }
        char pattern[] = "/tmp/heft-e2e-swap-XXXXXX";
        int fd = mkstemp(pattern);
        if (fd < 0) {
            reason_ = std::string("cannot create a swap file: ") + std::strerror(errno);
            return;
        }
        path_ = pattern;
        int error = posix_fallocate(fd, 0, 256 * kMiB);
        fchmod(fd, 0600);
        close(fd);
        if (error != 0) {
            reason_ = std::string("cannot allocate a swap file: ") + std::strerror(error);
            return;
        }
        const char* mkswap = access("/sbin/mkswap", X_OK) == 0 ? "/sbin/mkswap" : "/usr/sbin/mkswap";
        Outcome made = runProgram(mkswap, {"mkswap", path_});
        if (made.status != 0) {
            reason_ = "mkswap failed: " + made.standardError;
            return;
        }
        if (swapon(path_.c_str(), 0) != 0) {
            reason_ = std::string("swapon failed: ") + std::strerror(errno);
            return;
        }
        enabled_ = true;
        available_ = true;
    }
    ~SwapArea()
    {
        if (enabled_ && swapoff(path_.c_str()) != 0) {
            ADD_FAILURE() << "swapoff " << path_ << ": " << std::strerror(errno);
        }
        if (!path_.empty()) unlink(path_.c_str());
    }
    SwapArea(const SwapArea&) = delete;
    SwapArea& operator=(const SwapArea&) = delete;

    bool available() const { return available_; }
    const std::string& reason() const { return reason_; }

    static bool systemHasSwap()
    {
        std::string swaps;
        if (!readWholeFile("/proc/swaps", swaps)) return false;
        // A heading line, then one line per active swap area.
        size_t firstLineEnd = swaps.find('\n');
        return firstLineEnd != std::string::npos && firstLineEnd + 1 < swaps.size();
    }

    static bool readWholeFile(const std::string& path, std::string& contents)
    {
        contents.clear();
        int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) return false;
        char buffer[65536];
        for (;;) {
            ssize_t count = read(fd, buffer, sizeof(buffer));
            if (count < 0 && errno == EINTR) continue;
            if (count <= 0) break;
            contents.append(buffer, static_cast<size_t>(count));
        }
        close(fd);
        return true;
    }

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

// Whether `pid` still runs: a child that died with its parent waits, dead,
// for init to reap it.
inline bool processRunning(pid_t pid)
{
    std::string stat;
    if (!SwapArea::readWholeFile("/proc/" + std::to_string(pid) + "/stat", stat)) return false;
    size_t state = stat.rfind(") ");
    return state != std::string::npos && state + 2 < stat.size() && stat[state + 2] != 'Z' && stat[state + 2] != 'X';
}

// A family laid out by the prefork mode: the parent is a laid-out child, its
// children are the pids it reported. Taking the family down kills the
// parent; a child that does not die with it is a failure, and killed.
class LaidOutFamily {
public:
    explicit LaidOutFamily(const PreforkLayout& layout, uid_t user = static_cast<uid_t>(-1))
    {
        auto number = [](uint64_t value) { return std::to_string(value); };
        parent_ = std::make_unique<LaidOutChild>(
            std::vector<std::string>{"prefork", number(layout.shared), number(layout.children), number(layout.slice),
                                     number(layout.own), number(layout.after), number(layout.pagedOut), layout.file,
                                     layout.path},
            user);
        for (int i = 0; i < layout.children && parent_->value(4 + i) != 0; ++i)
            children_.push_back(static_cast<pid_t>(parent_->value(4 + i)));
        ready_ = parent_->ready() && children_.size() == static_cast<size_t>(layout.children);
        all_.insert(children_.begin(), children_.end());
        all_.insert(parent_->pid());
    }
    ~LaidOutFamily()
    {
        parent_.reset();
        for (pid_t child : children_) {
            for (int wait = 0; processRunning(child) && wait < 500; ++wait) usleep(10000);
            if (!processRunning(child)) continue;
            ADD_FAILURE() << "child " << child << " outlived its parent";
            kill(child, SIGKILL);
        }
    }

    bool ready() const { return ready_; }
    pid_t parent() const { return parent_->pid(); }
    const std::vector<pid_t>& children() const { return children_; }
    const std::set<int>& all() const { return all_; }
    uint64_t sharedAddress() const { return parent_->value(0); }
    uint64_t fileAddress() const { return parent_->value(1); }
    int pageoutError() const { return static_cast<int>(parent_->value(3)); }

private:
    std::unique_ptr<LaidOutChild> parent_;
    std::vector<pid_t> children_;
    std::set<int> all_;
    bool ready_ = false;
};

// The "Name: value kB" lines of a /proc file section, in bytes (the numbers
// of lines without a kB unit are kept as they are).
inline std::map<std::string, uint64_t> parseKernelFields(std::string_view text)
{
    std::map<std::string, uint64_t> fields;
    while (!text.empty()) {
        size_t end = text.find('\n');
        std::string_view line = text.substr(0, end);
        text = end == std::string_view::npos ? std::string_view() : text.substr(end + 1);
        size_t colon = line.find(':');
        if (colon == std::string_view::npos) continue;
        std::string_view rest = line.substr(colon + 1);
        size_t digits = rest.find_first_of("0123456789");
        if (digits == std::string_view::npos) continue;
        uint64_t value = 0;
        auto parsed = std::from_chars(rest.data() + digits, rest.data() + rest.size(), value);
        if (parsed.ec != std::errc()) continue;
        if (std::string_view(parsed.ptr, rest.data() + rest.size()).find("kB") != std::string_view::npos) {
            value *= 1024;
        }
        fields[std::string(line.substr(0, colon))] = value;
    }
    return fields;
}

// The smaps fields of the mapping of `pid` that starts at `address`; empty
// when there is none.
inline std::map<std::string, uint64_t> smapsOfMappingAt(pid_t pid, uint64_t address)
{
    std::string smaps;
    if (!SwapArea::readWholeFile("/proc/" + std::to_string(pid) + "/smaps", smaps)) return {};
    char start[32];
    std::snprintf(start, sizeof(start), "%llx-", static_cast<unsigned long long>(address));
    size_t at = smaps.rfind(std::string("\n") + start);
    if (smaps.rfind(start, 0) == 0) {
        at = 0;
    } else if (at == std::string::npos) {
        return {};
    } else {
        ++at;
    }
    size_t bodyStart = smaps.find('\n', at);
    if (bodyStart == std::string::npos) return {};
    ++bodyStart;
    // The next mapping's header is the first line that does not hold a colon
    // before its first blank.
    size_t bodyEnd = bodyStart;
    while (bodyEnd < smaps.size()) {
        size_t lineEnd = smaps.find('\n', bodyEnd);
        if (lineEnd == std::string::npos) lineEnd = smaps.size();
        std::string_view line(smaps.data() + bodyEnd, lineEnd - bodyEnd);
        size_t blank = line.find(' ');
        size_t colon = line.find(':');
        if (colon == std::string_view::npos || (blank != std::string_view::npos && blank < colon)) break;
        bodyEnd = lineEnd + 1;
    }
    return parseKernelFields(std::string_view(smaps.data() + bodyStart, bodyEnd - bodyStart));
}

// What the kernel charges `pid` that it cannot take back: written and swapped
// pages of every mapping, and the page tables.
inline uint64_t kernelHeft(pid_t pid)
{
    std::string rollup;
    std::string status;
    std::string base = "/proc/" + std::to_string(pid);
    if (!SwapArea::readWholeFile(base + "/smaps_rollup", rollup) ||
        !SwapArea::readWholeFile(base + "/status", status)) {
        ADD_FAILURE() << "cannot read the memory figures of " << pid;
        return 0;
    }
    auto rollupFields = parseKernelFields(rollup);
    auto statusFields = parseKernelFields(status);
    return rollupFields["Private_Dirty"] + rollupFields["Shared_Dirty"] + rollupFields["Swap"] +
           statusFields["VmPTE"];
}

// The kernel's share of `pid` in what cannot be taken back: each written or
// swapped page divided among the processes that map it, and the page
// tables. Summed over a set of processes it counts each of their pages once.
inline uint64_t kernelShareOfHeft(pid_t pid)
{
    std::string rollup;
    std::string status;
    std::string base = "/proc/" + std::to_string(pid);
    if (!SwapArea::readWholeFile(base + "/smaps_rollup", rollup) ||
        !SwapArea::readWholeFile(base + "/status", status)) {
        ADD_FAILURE() << "cannot read the memory figures of " << pid;
        return 0;
    }
    auto rollupFields = parseKernelFields(rollup);
    return rollupFields["Pss_Dirty"] + rollupFields["SwapPss"] + parseKernelFields(status)["VmPTE"];
}

}  // namespace heft_e2e
