#pragma once

#include "base/HTSettings.h"
#include "platform/HTPlatform.h"

#include <memory>
#include <string>
#include <vector>

class HTProcess;
struct HTHeldExit;

// heft --exec: runs a program, and gathers it as a corpse at the moment it
// exits, while its address space is still whole; with children followed,
// every process it starts is gathered at its own exit. The report is made
// once the program has ended, from what was gathered.
class HTExecRun {
public:
    HTExecRun(std::shared_ptr<HTPlatform> platform, const HTSettings& settings, bool skipIdleExitClean);

    // Runs the program to its end.
    HTProgramEnd run(const std::vector<std::string>& arguments, bool followChildren);
    // The processes gathered, in the order they exited.
    const std::vector<std::shared_ptr<HTProcess>>& corpses() const { return corpses_; }

    // The status heft exits with for how the program ended: its own exit
    // status, 128 + the signal that killed it, or the shell's 127 (not
    // found) and 126 (not runnable) when it could not be started.
    static int exitStatus(const HTProgramEnd& end);
    // What standard error says of a program that could not be started or
    // followed; empty when it was.
    static std::string problem(const HTProgramEnd& end, const std::string& program);

private:
    // Gathers the held process, unless it cannot be read or is skipped.
    void _gatherCorpse(const HTHeldExit& held);

    std::shared_ptr<HTPlatform> platform_;
    HTSettings settings_;
    bool skipIdleExitClean_;
    std::vector<std::shared_ptr<HTProcess>> corpses_;
};
