#include "platform/linux/HTProcStatParser.h"
#include "platform/HTPlatformTypes.h"

#include <gtest/gtest.h>

#include <string>

namespace {

// Captured from a live system.
constexpr std::string_view kCatStat =
    R"(3892 (cat) R 3889 3889 2229 34816 3892 4194304 100 0 0 0 0 0 0 0 20 0 1 0 36232 3133440 388 18446744073709551615 94234603823104 94234603842985 140729907217280 0 0 0 0 0 0 0 0 0 17 1 0 0 0 0 0 94234603858992 94234603860608 94235401744384 140729907222983 140729907223003 140729907223003 140729907224555 0
)";
constexpr std::string_view kKthreaddStat =
    R"(2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 0 0 0 20 0 1 0 18 0 0 18446744073709551615 0 0 0 0 0 0 0 2147483647 0 1 0 0 0 1 0 0 0 0 0 0 0 0 0 0 0 0 0
)";

}  // namespace

TEST(HTProcStatParser, ReadsTheFieldsOfACapturedLine)
{
    auto stat = htParseProcStat(kCatStat);
    ASSERT_TRUE(stat);
    EXPECT_EQ(stat->pid, 3892);
    EXPECT_EQ(stat->comm, "cat");
    EXPECT_EQ(stat->state, 'R');
    EXPECT_EQ(stat->ppid, 3889);
    EXPECT_EQ(stat->pgrp, 3889);
    EXPECT_EQ(stat->session, 2229);
    EXPECT_EQ(stat->tty_nr, 34816);
    EXPECT_EQ(stat->tpgid, 3892);
    EXPECT_EQ(stat->flags, 4194304u);
    EXPECT_EQ(stat->nice, 0);
    EXPECT_EQ(stat->starttime, 36232u);
    EXPECT_EQ(stat->startstack, 140729907217280u);
    EXPECT_FALSE(stat->isKernelThread());

    auto kthreadd = htParseProcStat(kKthreaddStat);
    ASSERT_TRUE(kthreadd);
    EXPECT_TRUE(kthreadd->isKernelThread());
    EXPECT_EQ(kthreadd->ppid, 0);
    EXPECT_EQ(kthreadd->tpgid, -1);
}

TEST(HTProcStatParser, CommRunsToTheLastParenthesis)
{
    // A process may call itself anything, parentheses and blanks included;
    // the fields after the name must not shift. The last line stops before
    // the stack address.
    struct Row {
        const char* line;
        const char* comm;
        char state;
        int32_t ppid, nice;
        uint64_t starttime;
    };
    const Row rows[] = {
        {"1234 ((a) b)) S 77 1234 1234 0 -1 4194560 0 0 0 0 0 0 0 0 39 19 1 0 500 0 0\n", "(a) b)", 'S', 77, 19, 500},
        {"9 ( x  ) ) Z 1 9 9 0 -1 4 0 0 0 0 0 0 0 0 20 -5 1 0 7 0 0", " x  ) ", 'Z', 1, -5, 7},
        {"10 () S 1 10 10 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0", "", 'S', 1, 0, 9},
    };
    for (const Row& row : rows) {
        auto stat = htParseProcStat(row.line);
        ASSERT_TRUE(stat) << row.line;
        EXPECT_EQ(stat->comm, row.comm);
        EXPECT_EQ(stat->state, row.state);
        EXPECT_EQ(stat->ppid, row.ppid);
        EXPECT_EQ(stat->nice, row.nice);
        EXPECT_EQ(stat->starttime, row.starttime);
        EXPECT_EQ(stat->startstack, 0u);
    }
}

TEST(HTProcStatParser, RejectsTruncatedAndMalformedInput)
{
    // A capture cut anywhere before the start time is refused, never misread.
    size_t startTime = kCatStat.find(" 36232") + 1;
    for (size_t length = 0; length <= startTime; ++length)
        EXPECT_FALSE(htParseProcStat(kCatStat.substr(0, length))) << "length " << length;
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
