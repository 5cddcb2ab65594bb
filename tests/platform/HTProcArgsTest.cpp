#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTProcBuffer.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <string>
#include <unistd.h>

using namespace std::string_literals;

TEST(HTProcArgs, LaysOutCountPathPaddingAndArguments)
{
    struct Row {
        std::string path, cmdline;
        int32_t argc;
        size_t header;         // count, path and padding
        std::string expected;  // after the count
    };
    const Row rows[] = {
        // 4 + 13 + NUL = 18, padded to 24.
        {"/usr/bin/tool", "tool\0-v\0file\0"s, 3, 24, "/usr/bin/tool\0\0\0\0\0\0\0tool\0-v\0file\0"s},
        // A process that rewrote its arguments may leave the last one
        // unterminated; the area terminates it.
        {"/bin/d", "daemon: idle", 1, 16, "/bin/d\0\0\0\0\0\0daemon: idle\0"s},
        // No arguments at all (a process that is exiting).
        {"/bin/d", "", 0, 16, "/bin/d\0\0\0\0\0\0"s},
    };
    for (const Row& row : rows) {
        std::string area(htBuildProcArgs(row.path, row.cmdline, nullptr, 0), 'x');
        ASSERT_EQ(htBuildProcArgs(row.path, row.cmdline, area.data(), area.size()), area.size());
        int32_t argc;
        std::memcpy(&argc, area.data(), sizeof(argc));
        EXPECT_EQ(argc, row.argc) << row.path;
        EXPECT_EQ(area.substr(4), row.expected) << row.path;
        EXPECT_EQ(htProcArgsHeaderSize(row.path), row.header) << row.path;
        // A short buffer keeps the beginning and is never overrun.
        for (size_t capacity = 1; capacity < area.size(); ++capacity) {
            std::string buffer(capacity + 8, '#');
            EXPECT_EQ(htBuildProcArgs(row.path, row.cmdline, buffer.data(), capacity), area.size());
            EXPECT_EQ(buffer, area.substr(0, capacity) + std::string(8, '#')) << capacity;
        }
    }
}

TEST(HTDeletedMark, OneTrailingMarkOfARealPathIsDropped)
{
    const std::pair<const char*, const char*> rows[] = {
        {"/usr/lib/app/worker (deleted)", "/usr/lib/app/worker"},   {"/usr/bin/worker", "/usr/bin/worker"},
        {"/tmp/a (deleted) (deleted)", "/tmp/a (deleted)"},         {" (deleted)", " (deleted)"},
        {"/tmp/file with blank (deleted)", "/tmp/file with blank"},
    };
    for (auto [path, expected] : rows) {
        EXPECT_EQ(htPathWithoutDeletedMark(path), expected) << path;
        EXPECT_EQ(htHasDeletedMark(path), std::string_view(path) != expected) << path;
    }
}

TEST(HTProcBuffer, ReadsWholeFilesOfAnySizeIntoOneBuffer)
{
    HTProcBuffer buffer;
    // smaps of this test program runs to many kilobytes and reports size 0.
    ASSERT_TRUE(buffer.readFile(AT_FDCWD, "/proc/self/smaps"));
    EXPECT_GT(buffer.size(), 16384u);
    EXPECT_EQ(buffer.view().back(), '\n');
    size_t grown = buffer.capacity();
    // status is written whole: its last line arrives in the first read.
    ASSERT_TRUE(buffer.readFile(AT_FDCWD, "/proc/self/status", HTProcBuffer::End::ShortRead));
    EXPECT_EQ(buffer.view().find("Name:"), 0u);
    EXPECT_NE(buffer.view().find("\nnonvoluntary_ctxt_switches:"), std::string_view::npos);
    EXPECT_EQ(buffer.capacity(), grown);
    errno = 0;
    EXPECT_FALSE(buffer.readFile(AT_FDCWD, "/proc/self/no-such-file"));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_EQ(buffer.size(), 0u);

    // A file larger than a fresh buffer fills it, grows it and goes on to
    // the end, also where a short read could end a /proc file.
    char path[] = "/tmp/heft-procbuffer-XXXXXX";
    HTFileDescriptor fd(::mkstemp(path));
    ASSERT_TRUE(fd.isOpen());
    ::unlink(path);
    std::string text(3 * 4096 + 100, 'x');
    ASSERT_EQ(::write(fd.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
    ASSERT_EQ(::lseek(fd.get(), 0, SEEK_SET), 0);
    HTProcBuffer fresh;
    ASSERT_TRUE(fresh.readDescriptor(fd.get(), HTProcBuffer::End::ShortRead));
    EXPECT_EQ(fresh.view(), text);
}
