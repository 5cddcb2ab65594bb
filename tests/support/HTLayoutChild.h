// The layout program (layout.c) run until it has laid out its memory, then killed with all it started and reaped.

#pragma once

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

class HTLayoutChild {
public:
    static constexpr uid_t kSameUser = static_cast<uid_t>(-1);

    // `program` may be a copy of the layout program under another name.
    explicit HTLayoutChild(std::vector<std::string> directives, uid_t user = kSameUser,
                           const std::string& program = HEFT_LAYOUT_PROGRAM)
    {
        prctl(PR_SET_CHILD_SUBREAPER, 1);  // what it forks comes to the test to reap, not to init
        // Written back before the first child runs it, so that its code and data are clean file pages.
        [[maybe_unused]] static const int synced = [] {
            int fd = open(HEFT_LAYOUT_PROGRAM, O_RDONLY | O_CLOEXEC);
            return fd >= 0 && fsync(fd) == 0 ? close(fd) : -1;
        }();
        directives.insert(directives.begin(), "heft-layout");
        std::vector<char*> argv(directives.size() + 1);
        std::ranges::transform(directives, argv.begin(), [](auto& directive) { return directive.data(); });
        int ready[2];
        if (pipe2(ready, O_CLOEXEC) != 0) return;
        if ((pid_ = fork()) == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(ready[1], STDOUT_FILENO);
            if (user != kSameUser && (setgroups(0, nullptr) != 0 || setgid(user) != 0 || setuid(user) != 0)) _exit(2);
            execv(program.c_str(), argv.data());
            _exit(127);
        }
        close(ready[1]);
        std::string text;
        char buffer[256];
        for (ssize_t got; pid_ > 0 && !text.ends_with("ready\n") && (got = read(ready[0], buffer, sizeof(buffer))) > 0;)
            text.append(buffer, static_cast<size_t>(got));
        close(ready[0]);
        ready_ = text.ends_with("ready\n");
        std::istringstream lines(text);
        for (std::string line; std::getline(lines, line) && line != "ready";) {
            std::istringstream numbers(line);
            lines_.emplace_back(std::istream_iterator<uint64_t>(numbers), std::istream_iterator<uint64_t>());
        }
    }
    ~HTLayoutChild() { reap(); }
    HTLayoutChild(const HTLayoutChild&) = delete;
    HTLayoutChild& operator=(const HTLayoutChild&) = delete;

    bool ready() const { return ready_; }
    pid_t pid() const { return pid_; }
    std::string pidString() const { return std::to_string(pid_); }
    // The numbers the directive `index` printed; 0 for one it did not print.
    const std::vector<uint64_t>& line(size_t index) const
    {
        static const std::vector<uint64_t> none;
        return index < lines_.size() ? lines_[index] : none;
    }
    uint64_t value(size_t index, size_t at = 0) const { return at < line(index).size() ? line(index)[at] : 0; }

    // Waits for the child to exit and leaves it a zombie until reap().
    bool waitForExit()
    {
        siginfo_t info{};
        return pid_ > 0 && waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT) == 0;
    }

    // Kills the child's process group and reaps it all: afterwards none of their pids names a process.
    void reap()
    {
        if (pid_ <= 0) return;
        kill(-pid_, SIGKILL);
        kill(pid_, SIGKILL);
        while (waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {}
        while (waitpid(-pid_, nullptr, 0) > 0 || errno == EINTR) {}
        pid_ = -1;
    }

    // A pid that named a process of this test a moment ago and names none now.
    static pid_t reapedPid()
    {
        HTLayoutChild child({"exit"});
        pid_t pid = child.pid();
        child.reap();
        return pid;
    }

private:
    pid_t pid_ = -1;
    bool ready_ = false;
    std::vector<std::vector<uint64_t>> lines_;
};
