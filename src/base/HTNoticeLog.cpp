#include "base/HTNoticeLog.h"

void HTNoticeLog::add(const std::string& text, int32_t pid, const std::string& process)
{
    std::lock_guard<std::mutex> guard(lock_);
    notices_[text].emplace(pid, process);
}

std::vector<std::string> HTNoticeLog::take()
{
    std::lock_guard<std::mutex> guard(lock_);
    std::vector<std::string> lines;
    for (const auto& [text, processes] : notices_) {
        std::string named;
        size_t count = 0;
        for (const auto& entry : processes) {
            if (count == kNamedProcesses) break;
            if (count++ != 0) named += ", ";
            named += entry.second;
        }
        if (processes.size() > kNamedProcesses)
            named += " and " + std::to_string(processes.size() - kNamedProcesses) + " more";

        // The text is not a format: only its first "%s" is the process's.
        std::string line = text;
        const size_t slot = line.find("%s");
        if (slot != std::string::npos) line.replace(slot, 2, named);
        if (processes.size() > 1) line += " (" + std::to_string(processes.size()) + " processes)";
        lines.push_back(std::move(line));
    }
    notices_.clear();
    return lines;
}

HTNoticeLog& HTNoticeLog::standardError()
{
    static HTNoticeLog log;
    return log;
}
