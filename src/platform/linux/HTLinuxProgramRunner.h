#pragma once

#include "platform/HTProgramRun.h"

#include <sys/types.h>

#include <csignal>

#include <functional>
#include <map>
#include <string>
#include <vector>

// Runs a program as a child of heft, traced with ptrace so that it stops at
// its exit (PTRACE_O_TRACEEXIT) with its address space still whole. The
// caller looks at each held process in a callback and the runner then lets
// it go on to its end.
//
// The child waits on a pipe until heft has seized it, so that it is traced
// from its first instruction of the program; a second pipe, closed by its
// exec, tells whether the program could be started and, if not, why. With
// `followChildren` the processes it starts are traced too (fork, vfork and
// clone), each held at its own exit; threads are traced so that the
// processes they start are followed, and their own exits are let go.
//
// Every stop that is not an exit is passed on: signals are delivered as
// they would have been, and a stop signal stops the process until it is
// continued (PTRACE_LISTEN). Heft ignores the keyboard's interrupt and quit
// while the program runs, so that Ctrl-C reaches the program alone.
class HTLinuxProgramRunner {
public:
    // Called while `pid` is held at its exit; `didExec` says whether it ran
    // a program since it was started.
    using HoldCallback = std::function<void(pid_t pid, bool didExec)>;

    HTProgramEnd run(const std::vector<std::string>& arguments, bool followChildren, const HoldCallback& atExit);

private:
    struct Tracee {
        bool didExec = false;
        // Whether its first stop was seen: a process traced as it is
        // started begins with a stop of its own, which is not a stop
        // signal.
        bool started = false;
    };

    // Forks the child and seizes it; false when it could not be forked.
    bool start(const std::vector<std::string>& arguments, bool followChildren, HTProgramEnd& end);
    // Follows the traced processes until the program has ended.
    void follow(bool followChildren, const HoldCallback& atExit, HTProgramEnd& end);
    // Handles one stop of a traced process.
    void handleStop(pid_t pid, int status, bool followChildren, const HoldCallback& atExit, HTProgramEnd& end);
    // Handles a stop at an exit.
    void handleExit(pid_t pid, bool followChildren, const HoldCallback& atExit, HTProgramEnd& end);
    // Lets go of the traced processes still running after the program
    // ended; returns how many there were.
    int releaseRemaining();
    // Heft ignores the keyboard's interrupt and quit while the program runs.
    void ignoreKeyboardSignals();
    void restoreKeyboardSignals();
    // The errno the child wrote when its exec failed; 0 when it did not.
    int readStartError();

    pid_t program_ = -1;
    int startErrorFd_ = -1;
    std::map<pid_t, Tracee> tracees_;
    struct sigaction savedInterrupt_ {};
    struct sigaction savedQuit_ {};
};
