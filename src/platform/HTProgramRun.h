#pragma once

#include "platform/HTTaskPort.h"

#include <cstdint>
#include <memory>
#include <optional>

// A process of a program heft runs, held at its exit: it has called exit or
// been killed, but its address space is still whole, and stays so until
// the call that reported it returns.
struct HTHeldExit {
    int32_t pid = 0;
    // A task handle on the held process, read as a live one is; null when
    // it could not be opened.
    std::shared_ptr<HTTaskPort> corpse;
    // The kernel's process flags (P_LP64, P_CONTROLT, P_EXEC...).
    uint32_t procFlags = 0;
    // The idle-exit flags, as proc_get_dirty reports them.
    uint32_t dirtyFlags = 0;
    // The bytes of its page tables, read while it was held.
    std::optional<uint64_t> pageTableBytes;
};

// How a program heft ran ended.
struct HTProgramEnd {
    // Why the program could not be started (ENOENT, EACCES...); 0 when it
    // ran.
    int startError = 0;
    // Why it could not be held at its exit (EPERM...); 0 when it was.
    int traceError = 0;
    // The program's wait status, when it ran.
    int waitStatus = 0;
    // Processes it started that were still running when it ended, and are
    // left to run without being followed.
    int leftRunning = 0;
};
