#include "platform/HTSnapshotGraph.h"
#include "platform/HTSnapfileEdit.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

// The bytes this process has read so far ("rchar: N"), or 0.
uint64_t bytesRead()
{
    uint64_t count = 0;
    std::ifstream("/proc/self/io").ignore(6) >> count;
    return count;
}

// What opening the snapfile at `path` gives ("opened", or the error's code
// and description, and whether it read the file), as user and group `id`
// unless 0, in a child that an alarm ends should the open block.
std::string openedInChild(const std::string& path, uid_t id = 0)
{
    int said[2];
    if (pipe(said) != 0) return std::strerror(errno);
    const pid_t child = fork();
    if (child == 0) {
        alarm(10);
        if (id != 0 && (setresgid(id, id, id) != 0 || setresuid(id, id, id) != 0)) _exit(1);
        const uint64_t before = bytesRead();
        HTError error;
        std::string text = HTSnapshotGraph::openSnapshotFile(path, &error)
            ? "opened"
            : std::to_string(error.code) + ": " + error.description.value_or("");
        if (bytesRead() - before > 65536) text += ", after reading the file";
        _exit(write(said[1], text.data(), text.size()) == static_cast<ssize_t>(text.size()) ? 0 : 1);
    }
    close(said[1]);
    std::string text = contentsOf("/proc/self/fd/" + std::to_string(said[0]));
    close(said[0]);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFSIGNALED(status) ? std::string("ended by ") + strsignal(WTERMSIG(status)) : text;
}

// Files in a directory of their own that others may enter.
class HTSnapshotFileTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(chmod(directory_.c_str(), 0755), 0) << std::strerror(errno); }
    void TearDown() override { std::filesystem::remove_all(directory_); }

    std::string pattern_ = "/tmp/heft-snapfile-XXXXXX", directory_ = mkdtemp(pattern_.data()) ? pattern_ : "";
};

}  // namespace

// The base snapfile opens; each edit of data/snapfiles/defects.txt makes
// it fail as the row says.
TEST(HTSnapshotGraphTest, EachDefectIsDescribedWithWhereItLies)
{
    HTError error;
    const auto base = HTSnapshotGraph::openSnapshotGraph(editedSnapfile(""), &error);
    ASSERT_TRUE(base && base->regions.size() == 3 && base->regions[1].pages) << error.description.value_or("");
    EXPECT_EQ(base->snapshotProcessName + " [" + std::to_string(base->snapshotPid) + "]", "worker [4242]");
    EXPECT_EQ(base->regions[1].pages->front().identity, uint64_t{1} << 56);

    std::istringstream rows(contentsOf(HEFT_TEST_DATA_DIR "/snapfiles/defects.txt"));
    std::string edit;
    int count = 0;
    for (std::string line; std::getline(rows, line);) {
        if (!line.empty() && line[0] != '#' && line[0] != ' ') edit = line;
        if (line.empty() || line[0] != ' ') continue;
        error = HTError();
        EXPECT_FALSE(HTSnapshotGraph::openSnapshotGraph(editedSnapfile(edit), &error)) << edit;
        EXPECT_EQ(error.code, HTSnapshotGraph::ErrorCodeFormat) << edit;
        EXPECT_EQ(error.description.value_or(""), line.substr(line.find_first_not_of(' '))) << edit;
        ++count;
    }
    EXPECT_GT(count, 40);
}

TEST_F(HTSnapshotFileTest, WhatCannotBeASnapfileIsRefusedWithoutBlockingOrReadingIt)
{
    const std::string fifo = directory_ + "/fifo", large = directory_ + "/large";
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0) << std::strerror(errno);
    const int fd = open(large.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600);
    ASSERT_EQ(ftruncate(fd, off_t{2} << 30), 0) << std::strerror(errno);  // sparse: no disk used
    close(fd);
    EXPECT_EQ(openedInChild(directory_), "2: it is a directory");
    EXPECT_EQ(openedInChild(fifo), "2: it is not a regular file");
    EXPECT_EQ(openedInChild(large), "2: the file holds 2147483648 bytes, more than the 1073741824 a snapfile may hold");
    EXPECT_EQ(openedInChild(directory_ + "/missing"), "1: No such file or directory");
}

TEST_F(HTSnapshotFileTest, AFileItsReaderMayNotReadIsRefused)
{
    if (geteuid() != 0) GTEST_SKIP() << "reading as another user needs root";
    const std::string path = directory_ + "/unreadable.heftsnap";
    std::ofstream(path) << editedSnapfile("");
    ASSERT_EQ(chmod(path.c_str(), 0600), 0) << std::strerror(errno);
    // Root passes the permission checks; nobody does not.
    EXPECT_EQ(openedInChild(path), "opened");
    EXPECT_EQ(openedInChild(path, 65534), "1: Permission denied");
}
