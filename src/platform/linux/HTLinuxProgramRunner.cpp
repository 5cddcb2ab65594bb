#include "platform/linux/HTLinuxProgramRunner.h"

#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcText.h"

#include <fcntl.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <string_view>

namespace {

bool isStopSignal(int signal)
{
    return signal == SIGSTOP || signal == SIGTSTP || signal == SIGTTIN || signal == SIGTTOU;
}

// Whether the traced task is a thread of another process, not a process of
// its own: its Tgid differs from its id.
bool isThread(pid_t pid)
{
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/status", static_cast<int>(pid));
    thread_local HTProcBuffer status;
    if (!status.readFile(AT_FDCWD, path)) return false;
    std::string_view text = status.view();
    while (!text.empty()) {
        std::string_view line = htTakeLine(text);
        if (htTakeWord(line) == "Tgid:") return htNumber<pid_t>(htTakeWord(line)).value_or(pid) != pid;
    }
    return false;
}

// The child's side of the start: waits until heft has seized it, then runs
// the program; a failed exec writes its errno to `report` and ends with the
// shell's statuses. Only async-signal-safe calls here: the child of a
// threaded program may not allocate.
[[noreturn]] void execInChild(char* const* argv, int gate, int report, const sigset_t& mask)
{
    // Heft ignores SIGPIPE to report a reader that went away; the program
    // is to die of it as programs do.
    signal(SIGPIPE, SIG_DFL);
    sigprocmask(SIG_SETMASK, &mask, nullptr);
    char go = 0;
    while (read(gate, &go, 1) < 0 && errno == EINTR) {}
    execvp(argv[0], argv);
    int error = errno;
    (void)!write(report, &error, sizeof(error));
    _exit(error == ENOENT ? 127 : 126);
}

}  // namespace

HTProgramEnd HTLinuxProgramRunner::run(const std::vector<std::string>& arguments, bool followChildren,
                                       const HoldCallback& atExit)
{
    HTProgramEnd end;
    tracees_.clear();
    if (!start(arguments, followChildren, end)) return end;
    if (end.traceError != 0) {
        // Not traced: the program runs to its end unseen.
        while (waitpid(program_, &end.waitStatus, 0) < 0 && errno == EINTR) {}
        end.startError = readStartError();
    } else {
        follow(followChildren, atExit, end);
        end.leftRunning = releaseRemaining();
    }
    close(startErrorFd_);
    startErrorFd_ = -1;
    restoreKeyboardSignals();
    return end;
}

void HTLinuxProgramRunner::ignoreKeyboardSignals()
{
    struct sigaction ignore {};
    ignore.sa_handler = SIG_IGN;
    sigemptyset(&ignore.sa_mask);
    sigaction(SIGINT, &ignore, &savedInterrupt_);
    sigaction(SIGQUIT, &ignore, &savedQuit_);
}

void HTLinuxProgramRunner::restoreKeyboardSignals()
{
    sigaction(SIGINT, &savedInterrupt_, nullptr);
    sigaction(SIGQUIT, &savedQuit_, nullptr);
}

bool HTLinuxProgramRunner::start(const std::vector<std::string>& arguments, bool followChildren, HTProgramEnd& end)
{
    std::vector<char*> argv;
    for (const std::string& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);

    int gate[2];
    int report[2];
    if (pipe2(gate, O_CLOEXEC) != 0) {
        end.startError = errno;
        return false;
    }
    if (pipe2(report, O_CLOEXEC) != 0) {
        end.startError = errno;
        close(gate[0]);
        close(gate[1]);
        return false;
    }
    // What heft has written must not be written again by the child.
    std::fflush(nullptr);
    // Signals wait until heft ignores the keyboard's: the child keeps
    // heft's own dispositions, and a Ctrl-C in between is not lost on it.
    sigset_t all;
    sigset_t mask;
    sigfillset(&all);
    sigprocmask(SIG_SETMASK, &all, &mask);
    program_ = fork();
    if (program_ == 0) execInChild(argv.data(), gate[0], report[1], mask);
    const int forkError = errno;
    ignoreKeyboardSignals();
    sigprocmask(SIG_SETMASK, &mask, nullptr);
    close(gate[0]);
    close(report[1]);
    startErrorFd_ = report[0];
    if (program_ < 0) {
        end.startError = forkError;
        close(gate[1]);
        close(startErrorFd_);
        startErrorFd_ = -1;
        restoreKeyboardSignals();
        return false;
    }

    long options = PTRACE_O_TRACEEXIT | PTRACE_O_TRACEEXEC;
    if (followChildren) options |= PTRACE_O_TRACEFORK | PTRACE_O_TRACEVFORK | PTRACE_O_TRACECLONE;
    if (ptrace(PTRACE_SEIZE, program_, nullptr, options) != 0)
        end.traceError = errno;
    else
        tracees_[program_].started = true;
    // Lets the child go on to its exec; closing the gate without a byte
    // would too.
    (void)!write(gate[1], "x", 1);
    close(gate[1]);
    return true;
}

void HTLinuxProgramRunner::follow(bool followChildren, const HoldCallback& atExit, HTProgramEnd& end)
{
    for (;;) {
        int status = 0;
        pid_t pid = waitpid(-1, &status, __WALL);
        if (pid < 0) {
            if (errno == EINTR) continue;
            return;
        }
        if (WIFEXITED(status) || WIFSIGNALED(status)) {
            tracees_.erase(pid);
            if (pid != program_) continue;
            end.waitStatus = status;
            return;
        }
        if (WIFSTOPPED(status)) handleStop(pid, status, followChildren, atExit, end);
    }
}

void HTLinuxProgramRunner::handleStop(pid_t pid, int status, bool followChildren, const HoldCallback& atExit,
                                      HTProgramEnd& end)
{
    const int event = status >> 16;
    const int signal = WSTOPSIG(status);
    Tracee& tracee = tracees_[pid];
    if (!tracee.started) {
        // The first stop of a process or thread traced as it was started.
        tracee.started = true;
        ptrace(PTRACE_CONT, pid, nullptr, 0);
        return;
    }
    switch (event) {
    case PTRACE_EVENT_EXIT:
        handleExit(pid, followChildren, atExit, end);
        ptrace(PTRACE_CONT, pid, nullptr, 0);
        return;
    case PTRACE_EVENT_EXEC:
        tracee.didExec = true;
        ptrace(PTRACE_CONT, pid, nullptr, 0);
        return;
    case PTRACE_EVENT_STOP:
        // A stop signal stops the process until it is continued; any other
        // such stop is one heft did not ask for, and the process goes on.
        if (isStopSignal(signal))
            ptrace(PTRACE_LISTEN, pid, nullptr, 0);
        else
            ptrace(PTRACE_CONT, pid, nullptr, 0);
        return;
    case 0:
        // A signal on its way to the process: delivered as it was sent.
        ptrace(PTRACE_CONT, pid, nullptr, signal);
        return;
    default: {
        // A new process or thread is starting, traced already; it is known
        // from now on, so that it is let go at the end even when its first
        // stop has not yet been seen.
        unsigned long child = 0;
        if (ptrace(PTRACE_GETEVENTMSG, pid, nullptr, &child) == 0) tracees_.try_emplace(static_cast<pid_t>(child));
        ptrace(PTRACE_CONT, pid, nullptr, 0);
        return;
    }
    }
}

void HTLinuxProgramRunner::handleExit(pid_t pid, bool followChildren, const HoldCallback& atExit, HTProgramEnd& end)
{
    const bool didExec = tracees_[pid].didExec;
    if (pid == program_) {
        // Heft's own copy, whose exec failed, is no program to report.
        if (!didExec && (end.startError = readStartError()) != 0) return;
    } else if (!followChildren || isThread(pid)) {
        return;
    }
    atExit(pid, didExec);
}

int HTLinuxProgramRunner::readStartError()
{
    int error = 0;
    ssize_t length;
    while ((length = read(startErrorFd_, &error, sizeof(error))) < 0 && errno == EINTR) {}
    return length == static_cast<ssize_t>(sizeof(error)) ? error : 0;
}

int HTLinuxProgramRunner::releaseRemaining()
{
    int left = 0;
    for (const auto& [pid, tracee] : tracees_) {
        if (pid == program_) continue;
        // A traced process can only be let go while it is stopped: it is
        // interrupted, and let go at the stop that follows.
        if (ptrace(PTRACE_INTERRUPT, pid, nullptr, nullptr) != 0) continue;
        int status = 0;
        if (waitpid(pid, &status, __WALL) != pid || !WIFSTOPPED(status)) continue;
        if (!isThread(pid)) ++left;
        const bool signalStop = (status >> 16) == 0;
        ptrace(PTRACE_DETACH, pid, nullptr, signalStop ? WSTOPSIG(status) : 0);
    }
    tracees_.clear();
    return left;
}
