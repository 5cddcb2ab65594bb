#include "platform/HTPlatformTypes.h"
#include "platform/linux/HTDeletedMark.h"
#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTPreadFully.h"
#include "platform/linux/HTProcArgs.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatParser.h"
#include "platform/linux/HTProcStatusParser.h"
#include "platform/linux/HTShmemParsers.h"

#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <string>
#include <unistd.h>

using namespace std::string_literals;

namespace {

// A /proc file captured from a live system, kept under tests/data.
std::string capture(const char* name)
{
    HTProcBuffer file;
    EXPECT_TRUE(file.readFile(AT_FDCWD, (std::string(HEFT_TEST_DATA_DIR "/") + name).c_str())) << name;
    return std::string(file.view());
}

}  // namespace

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
        // A process that rewrote its arguments may leave the last one unterminated; the area terminates it.
        {"/bin/d", "daemon: idle", 1, 16, "/bin/d\0\0\0\0\0\0daemon: idle\0"s},
        // 4 + 4 + NUL = 9: the NUL alone takes the header to a second 8 bytes.
        {"/b/d", "d\0"s, 1, 16, "/b/d\0\0\0\0\0\0\0\0d\0"s},
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

    // A file larger than a fresh buffer is read to the end, also where a short read could end a /proc file.
    // htPreadFully reads short at the end, and a failing first read is -1 with its errno, not an endless retry.
    char path[] = "/tmp/heft-procbuffer-XXXXXX";
    HTFileDescriptor fd(::mkstemp(path));
    ASSERT_TRUE(fd.isOpen());
    ::unlink(path);
    const std::string text = "0123456789" + std::string(3 * 4096 + 90, 'x');
    ASSERT_EQ(::write(fd.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
    ASSERT_EQ(::lseek(fd.get(), 0, SEEK_SET), 0);
    HTProcBuffer fresh;
    ASSERT_TRUE(fresh.readDescriptor(fd.get(), HTProcBuffer::End::ShortRead));
    EXPECT_EQ(fresh.view(), text);
    char bytes[16] = {};
    EXPECT_EQ(htPreadFully(fd.get(), bytes, 4, 3), 4);
    EXPECT_EQ(std::string(bytes, 4), "3456");
    EXPECT_EQ(htPreadFully(fd.get(), bytes, sizeof(bytes), static_cast<off_t>(text.size() - 2)), 2);
    EXPECT_EQ(htPreadFully(fd.get(), bytes, sizeof(bytes), static_cast<off_t>(text.size())), 0);
    HTFileDescriptor directory(::open("/tmp", O_RDONLY | O_DIRECTORY));
    errno = 0;
    EXPECT_EQ(htPreadFully(directory.get(), bytes, sizeof(bytes), 0), -1);
    EXPECT_EQ(errno, EISDIR);
}

TEST(HTProcStatParser, FieldsOfAnyCommandNameStatesAndRefusedLines)
{
    std::ifstream file(HEFT_TEST_DATA_DIR "/proc-stat-lines.txt");
    int rows = 0;
    for (std::string row; std::getline(file, row);) {
        if (row.empty() || row[0] == '#') continue;
        ++rows;
        const size_t arrow = row.rfind("=> ");
        std::string line = row.substr(0, arrow == 0 ? 0 : arrow - 1);
        if (line.starts_with("<")) line = capture(line.c_str() + 1);
        for (const std::string& text : {line, line + "\n"}) {
            auto stat = htParseProcStat(text);
            char fields[200] = "refused";
            if (stat)
                std::snprintf(fields, sizeof(fields), "%d [%.*s] %c %d %d %d %d %d %u %d %" PRIu64 " %" PRIu64 " %c",
                              stat->pid, static_cast<int>(stat->comm.size()), stat->comm.data(), stat->state,
                              stat->ppid, stat->pgrp, stat->session, stat->tty_nr, stat->tpgid,
                              static_cast<unsigned>(stat->flags), stat->nice, stat->starttime, stat->startstack,
                              stat->isKernelThread() ? 'K' : '-');
            EXPECT_EQ(fields, row.substr(arrow + 3)) << text;
        }
    }
    EXPECT_EQ(rows, 10);
    // A capture cut anywhere before the start time is refused, never misread.
    const std::string cat = capture("proc-stat-cat.txt");
    for (size_t length = 0; length <= cat.find(" 36232") + 1; ++length)
        EXPECT_FALSE(htParseProcStat(std::string_view(cat).substr(0, length))) << "length " << length;
    // State letters and the record status they map to.
    const std::pair<char, uint32_t> states[] = {{'R', SRUN},  {'S', SSLEEP}, {'D', SSLEEP}, {'I', SSLEEP},
                                                {'T', SSTOP}, {'t', SSTOP},  {'Z', SZOMB},  {'X', SZOMB}};
    for (auto [state, status] : states) EXPECT_EQ(htProcStatusForState(state), status) << state;
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

TEST(HTShmemParsers, SystemVSegmentsAndTmpfsMounts)
{
    // The heading, a segment, a line cut short, a line with a word for a number, and a last line without its end.
    const char* shm =
        "       key      shmid perms                  size  cpid  lpid nattch   uid   gid  cuid  cgid      "
        "atime      dtime      ctime                   rss                  swap\n"
        "         0          3   600               8388608  4242  4243      0     0     0     0     0 "
        "1700000000 1700000001 1700000002               4194304               4194304\n"
        "         0          4   600 8388608 4242\n"
        "         0          x   600 1 2 3 0 0 0 0 0 0 0 0 0 0\n"
        "  1 0 600 4096 1 1 2 0 0 0 0 0 0 0 4096 0";
    const std::vector<HTSysvSegment> segments = htParseSysvShm(shm);
    ASSERT_EQ(segments.size(), 2u);
    EXPECT_EQ(segments[0].shmid, 3);
    EXPECT_EQ(segments[0].size, 8388608u);
    EXPECT_EQ(segments[0].cpid, 4242);
    EXPECT_EQ(segments[0].nattch, 0u);
    EXPECT_EQ(segments[0].rss, 4194304u);
    EXPECT_EQ(segments[0].swap, 4194304u);
    EXPECT_EQ(segments[1].shmid, 0);
    EXPECT_EQ(segments[1].nattch, 2u);
    EXPECT_EQ(segments[1].rss, 4096u);

    // The type follows the separator, after optional tags; a device that is no pair of numbers is skipped.
    const char* mounts = "24 27 0:6 / /dev rw,relatime - devtmpfs devtmpfs rw\n"
                         "25 24 0:23 / /dev/shm rw,relatime shared:4 - tmpfs tmpfs rw\n"
                         "26 24 0:x / /run rw - tmpfs tmpfs rw\n"
                         "27 24 259:1 / /tmp rw master:1 - tmpfs none rw";
    const std::vector<HTTmpfsMount> tmpfs = htParseTmpfsMounts(mounts);
    ASSERT_EQ(tmpfs.size(), 2u);
    EXPECT_EQ(tmpfs[0].device, std::make_pair(0u, 23u));
    EXPECT_EQ(tmpfs[0].mountPoint, "/dev/shm");
    EXPECT_EQ(tmpfs[1].device, std::make_pair(259u, 1u));
    EXPECT_EQ(tmpfs[1].mountPoint, "/tmp");

    // A maps line names its file by a hexadecimal device and a decimal inode; anonymous memory names none.
    const auto file = htParseMapsFileLine("7f00a000-7f00b000 rw-s 00000000 00:1b 68     /dev/shm/x (deleted)");
    ASSERT_TRUE(file.has_value());
    EXPECT_EQ(file->range, "7f00a000-7f00b000");
    EXPECT_EQ(file->device, std::make_pair(0u, 27u));
    EXPECT_EQ(file->inode, 68u);
    EXPECT_FALSE(htParseMapsFileLine("7f00c000-7f00d000 rw-p 00000000 00:00 0 ").has_value());
    EXPECT_FALSE(htParseMapsFileLine("7f00c000-7f00d000 rw-p 00000000 0x:00 5 /f").has_value());
}
