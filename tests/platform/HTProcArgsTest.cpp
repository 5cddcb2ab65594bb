#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTProcBuffer.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <string>
#include <unistd.h>

using namespace std::string_literals;

namespace {

int32_t argcOf(const std::string& area)
{
    int32_t argc;
    std::memcpy(&argc, area.data(), sizeof(argc));
    return argc;
}

std::string build(std::string_view path, std::string_view cmdline)
{
    std::string area(htBuildProcArgs(path, cmdline, nullptr, 0), 'x');
    EXPECT_EQ(htBuildProcArgs(path, cmdline, area.data(), area.size()), area.size());
    return area;
}

}  // namespace

TEST(HTProcArgs, LaysOutCountPathPaddingAndArguments)
{
    std::string area = build("/usr/bin/tool", "tool\0-v\0file\0"s);
    EXPECT_EQ(argcOf(area), 3);
    // 4 + 13 + NUL = 18, padded to 24.
    ASSERT_EQ(area.size(), 24u + 13u);
    EXPECT_EQ(area.substr(4, 14), "/usr/bin/tool\0"s);
    EXPECT_EQ(area.substr(18, 6), std::string(6, '\0'));
    EXPECT_EQ(area.substr(24), "tool\0-v\0file\0"s);

    // A process that rewrote its arguments may leave the last one
    // unterminated; the area terminates it.
    std::string rewritten = build("/bin/d", "daemon: idle");
    EXPECT_EQ(argcOf(rewritten), 1);
    EXPECT_EQ(rewritten.substr(htProcArgsHeaderSize("/bin/d")), "daemon: idle\0"s);

    // No arguments at all (a process that is exiting).
    std::string bare = build("/bin/d", "");
    EXPECT_EQ(argcOf(bare), 0);
    EXPECT_EQ(bare.size(), htProcArgsHeaderSize("/bin/d"));
}

TEST(HTProcArgs, ShortBufferKeepsTheBeginningAndNeverOverruns)
{
    std::string path = "/opt/app/bin/server";
    std::string cmdline = "server\0--port\0"
                          "8080\0"s;
    std::string whole = build(path, cmdline);
    for (size_t capacity = 1; capacity < whole.size(); ++capacity) {
        std::string buffer(capacity + 8, '#');
        EXPECT_EQ(htBuildProcArgs(path, cmdline, buffer.data(), capacity), whole.size());
        EXPECT_EQ(buffer.substr(0, capacity), whole.substr(0, capacity)) << capacity;
        EXPECT_EQ(buffer.substr(capacity), std::string(8, '#')) << capacity;
    }
}

TEST(HTProcArgs, DeletedExecutableKeepsItsPath)
{
    EXPECT_EQ(htPathWithoutDeletedMark("/usr/lib/app/worker (deleted)"), "/usr/lib/app/worker");
    EXPECT_EQ(htPathWithoutDeletedMark("/usr/bin/worker"), "/usr/bin/worker");
    EXPECT_EQ(htPathWithoutDeletedMark("/tmp/a (deleted) (deleted)"), "/tmp/a (deleted)");
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
    int fd = ::mkstemp(path);
    ASSERT_GE(fd, 0);
    ::unlink(path);
    std::string text(3 * 4096 + 100, 'x');
    ASSERT_EQ(::write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    ASSERT_EQ(::lseek(fd, 0, SEEK_SET), 0);
    HTProcBuffer fresh;
    ASSERT_TRUE(fresh.readDescriptor(fd, HTProcBuffer::End::ShortRead));
    ::close(fd);
    EXPECT_EQ(fresh.view(), text);
}
