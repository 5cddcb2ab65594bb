#include "platform/linux/HTProcStatParser.h"
#include "platform/HTPlatformTypes.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatusParser.h"

#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdio>
#include <fcntl.h>
#include <string>

namespace {

// A /proc file captured from a live system, kept under tests/data.
std::string capture(const char* name)
{
    HTProcBuffer file;
    EXPECT_TRUE(file.readFile(AT_FDCWD, (std::string(HEFT_TEST_DATA_DIR "/") + name).c_str())) << name;
    return std::string(file.view());
}

}  // namespace

TEST(HTProcStatParser, FieldsOfCapturedLinesAndOfAnyCommandName)
{
    // A process may call itself anything, parentheses and blanks included:
    // the name runs to the last parenthesis and no field after it shifts.
    // Each row: pid [comm] state ppid pgrp session tty_nr tpgid flags nice
    // starttime startstack, then K for a kernel thread.
    const std::pair<std::string, const char*> rows[] = {
        {capture("proc-stat-cat.txt"), "3892 [cat] R 3889 3889 2229 34816 3892 4194304 0 36232 140729907217280 -"},
        {capture("proc-stat-kthreadd.txt"), "2 [kthreadd] S 0 0 0 0 -1 2129984 0 18 0 K"},
        {"1234 ((a) b)) S 77 1234 1234 0 -1 4194560 0 0 0 0 0 0 0 0 39 19 1 0 500 0 0\n",
         "1234 [(a) b)] S 77 1234 1234 0 -1 4194560 19 500 0 -"},
        {"9 ( x  ) ) Z 1 9 9 0 -1 4 0 0 0 0 0 0 0 0 20 -5 1 0 7 0 0", "9 [ x  ) ] Z 1 9 9 0 -1 4 -5 7 0 -"},
        {"10 () S 1 10 10 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0", "10 [] S 1 10 10 0 -1 0 0 9 0 -"},
    };
    for (const auto& [line, expected] : rows) {
        auto stat = htParseProcStat(line);
        ASSERT_TRUE(stat) << line;
        char text[200];
        std::snprintf(text, sizeof(text), "%d [%.*s] %c %d %d %d %d %d %u %d %" PRIu64 " %" PRIu64 " %c", stat->pid,
                      static_cast<int>(stat->comm.size()), stat->comm.data(), stat->state, stat->ppid, stat->pgrp,
                      stat->session, stat->tty_nr, stat->tpgid, static_cast<unsigned>(stat->flags), stat->nice,
                      stat->starttime, stat->startstack, stat->isKernelThread() ? 'K' : '-');
        EXPECT_STREQ(text, expected) << line;
    }
}

TEST(HTProcStatParser, RejectsTruncatedAndMalformedInput)
{
    // A capture cut anywhere before the start time is refused, never misread.
    const std::string cat = capture("proc-stat-cat.txt");
    size_t startTime = cat.find(" 36232") + 1;
    for (size_t length = 0; length <= startTime; ++length)
        EXPECT_FALSE(htParseProcStat(std::string_view(cat).substr(0, length))) << "length " << length;
    // Garbage where numbers belong, no pid, no opening parenthesis.
    for (const char* line : {"\n", "3892 (cat) R x 3889 2229 34816 3892 4194304 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0",
                             "(cat) R 1 3889 2229 34816 3892 4194304 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0",
                             "3892 cat) R 1 3889 2229 34816 3892 4194304 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0"})
        EXPECT_FALSE(htParseProcStat(line)) << line;
}

TEST(HTProcStatParser, StateLettersMapToRecordStatus)
{
    const std::pair<char, uint32_t> rows[] = {{'R', SRUN},  {'S', SSLEEP}, {'D', SSLEEP}, {'I', SSLEEP},
                                              {'T', SSTOP}, {'t', SSTOP},  {'Z', SZOMB},  {'X', SZOMB}};
    for (auto [state, status] : rows) EXPECT_EQ(htProcStatusForState(state), status) << state;
}

TEST(HTProcStatusParser, MemoryFiguresOfLiveAndZombieProcesses)
{
    HTProcStatus status = htParseProcStatus(capture("proc-status-cat.txt"));
    ASSERT_TRUE(status.hasMemoryFigures());
    EXPECT_EQ(*status.rssAnon, 116u * 1024);
    EXPECT_EQ(*status.vmSwap, 8u * 1024);
    EXPECT_EQ(*status.vmPTE, 44u * 1024);
    EXPECT_EQ(*status.vmHWM, 1764u * 1024);
    // A zombie's address space is gone, and with it the memory lines.
    EXPECT_FALSE(htParseProcStatus(capture("proc-status-zombie.txt")).hasMemoryFigures());
    EXPECT_FALSE(htParseProcStatus("VmPTE:\n").vmPTE.has_value());
}
