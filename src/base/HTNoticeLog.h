#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

// What heft has to tell on standard error about the processes it reads.
// Processes are read side by side, and on a busy machine hundreds of them
// may exit meanwhile, each with the same story: the notices are collected
// here while the processes are read and written out once, at the end, each
// distinct text once with the processes it concerns. The lines come in a
// fixed order (by text, then by pid) whatever the threads did, so the same
// events give the same output.
class HTNoticeLog {
public:
    // How many processes a line names before it says how many more there are.
    static constexpr size_t kNamedProcesses = 5;

    // Adds the notice `text` about `process` (its display name, for `pid`).
    // `text` holds "%s" once, where the process goes. Safe from any thread;
    // a notice added twice for one process is told once.
    void add(const std::string& text, int32_t pid, const std::string& process);

    // One line a notice, and the log emptied. About one process: the text
    // with it. About several: the text with the first kNamedProcesses of
    // them, "and N more" when there are others, then " (N processes)".
    std::vector<std::string> take();

    // The run's log for standard error.
    static HTNoticeLog& standardError();

private:
    std::mutex lock_;
    std::map<std::string, std::map<int32_t, std::string>> notices_;
};
