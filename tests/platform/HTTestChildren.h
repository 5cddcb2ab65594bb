#pragma once

// Child processes for tests that look at real processes. Every child is
// killed and reaped when its owner goes out of scope, also when an
// assertion has failed on the way.

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <spawn.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

class HTTestChild {
public:
    HTTestChild() = default;
    explicit HTTestChild(pid_t pid) : pid_(pid) {}
    HTTestChild(HTTestChild&& other) noexcept : pid_(std::exchange(other.pid_, -1)) {}
    HTTestChild& operator=(HTTestChild&& other) noexcept
    {
        if (this != &other) {
            reap();
            pid_ = std::exchange(other.pid_, -1);
        }
        return *this;
    }
    ~HTTestChild() { reap(); }

    pid_t pid() const { return pid_; }
    bool valid() const { return pid_ > 0; }

    // Kills and reaps the child: afterwards its pid names no process.
    void reap()
    {
        if (pid_ <= 0) return;
        ::kill(pid_, SIGKILL);
        while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {}
        pid_ = -1;
    }

    // Waits for the child to exit without reaping it: it stays a zombie
    // until reap().
    bool waitForZombie()
    {
        siginfo_t info{};
        return ::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT) == 0;
    }

    // Starts the program at `path`; returns once exec has succeeded (the C
    // library's posix_spawn resumes the caller only after the child's exec),
    // so the child already shows the new program in /proc. Invalid on failure.
    static HTTestChild exec(const std::string& path, const std::vector<std::string>& arguments)
    {
        std::vector<char*> argv;
        for (const auto& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
        argv.push_back(nullptr);
        pid_t pid = -1;
        if (::posix_spawn(&pid, path.c_str(), nullptr, nullptr, argv.data(), environ) != 0) return HTTestChild();
        return HTTestChild(pid);
    }

    // Forks a child that runs `body` and exits with its result.
    static HTTestChild fork(const std::function<int()>& body)
    {
        pid_t pid = ::fork();
        if (pid == 0) ::_exit(body());
        return HTTestChild(pid);
    }

private:
    pid_t pid_ = -1;
};

// A copy of a small system program under a name of its own in a fresh
// temporary directory, so that the processes started from it are the only
// ones of that name. Removed with the object.
class HTTestProgramCopy {
public:
    explicit HTTestProgramCopy(const std::string& original, const std::string& nameStem)
    {
        char pattern[] = "/tmp/heft-test-XXXXXX";
        if (::mkdtemp(pattern) == nullptr) return;
        directory_ = pattern;
        name_ = nameStem + "-" + std::to_string(::getpid());
        std::error_code error;
        std::filesystem::copy_file(original, path(), error);
        if (error) return;
        std::filesystem::permissions(path(), std::filesystem::perms::owner_all, error);
        ready_ = !error;
    }
    ~HTTestProgramCopy()
    {
        if (directory_.empty()) return;
        std::error_code error;
        std::filesystem::remove_all(directory_, error);
    }
    HTTestProgramCopy(const HTTestProgramCopy&) = delete;
    HTTestProgramCopy& operator=(const HTTestProgramCopy&) = delete;

    bool ready() const { return ready_; }
    const std::string& name() const { return name_; }
    std::string path() const { return directory_ + "/" + name_; }

private:
    std::string directory_;
    std::string name_;
    bool ready_ = false;
};

// A pid that named a process of this test a moment ago and names none now.
inline pid_t htReapedPid()
{
    HTTestChild child = HTTestChild::fork([] { return 0; });
    pid_t pid = child.pid();
    child.reap();
    return pid;
}
