#include "platform/linux/HTPreadFully.h"

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

// The pagemap, kpageflags and ELF readers all go through this one loop: a
// read past the end is short, and a failing first read is -1 with its errno
// rather than a retry (which, for a descriptor that can never be read, would
// never end).
TEST(HTPreadFully, ShortAtTheEndAndFailingWithTheFirstReadsError)
{
    char path[] = "/tmp/heft-pread-XXXXXX";
    int fd = mkstemp(path);
    ASSERT_GE(fd, 0);
    unlink(path);
    const char text[] = "0123456789";
    ASSERT_EQ(write(fd, text, 10), 10);
    char buffer[16] = {};
    EXPECT_EQ(htPreadFully(fd, buffer, 4, 3), 4);
    EXPECT_EQ(std::memcmp(buffer, "3456", 4), 0);
    EXPECT_EQ(htPreadFully(fd, buffer, sizeof(buffer), 8), 2);
    EXPECT_EQ(htPreadFully(fd, buffer, sizeof(buffer), 10), 0);
    close(fd);

    int directory = open("/tmp", O_RDONLY | O_DIRECTORY);
    ASSERT_GE(directory, 0);
    errno = 0;
    EXPECT_EQ(htPreadFully(directory, buffer, sizeof(buffer), 0), -1);
    EXPECT_EQ(errno, EISDIR);
    close(directory);
}
