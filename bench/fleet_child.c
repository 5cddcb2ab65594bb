/*
 * A fleet of processes with a realistic mix of memory, for timing heft on a
 * busy machine. Built and run by fleet.sh:
 *
 *   fleet_child COUNT DIR SWAP
 *
 * The leader (this process) makes COUNT - 1 more processes, in groups of one
 * group parent and up to four of its children. Every process
 *   - writes private anonymous memory of its own (1 to 4 MiB),
 *   - maps a shared-memory segment made by the leader and writes its own
 *     1 MiB slice of it, and reads the first 4 MiB that all of them share,
 *   - maps a data file in DIR shared and reads a part of it, and maps it
 *     privately and writes a few pages (copied on write from the file).
 * A group parent writes a 4 MiB buffer before forking; its children share
 * those pages copy-on-write and each overwrites a different part of them.
 * When SWAP is 1, every process pushes half of its private memory out to
 * swap with MADV_PAGEOUT.
 *
 * Once every process has laid out its memory, the leader writes the pids of
 * the whole fleet, one a line, to DIR/pids and then the empty file DIR/ready,
 * and everyone waits to be killed. Every process dies with its parent.
 */

#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/types.h>
#include <unistd.h>

#define MIB (1024UL * 1024UL)
#define SEGMENT_SIZE (64 * MIB)
#define SEGMENT_COMMON (4 * MIB)
#define FILE_SIZE (16 * MIB)
#define COW_SIZE (4 * MIB)
#define GROUP_SIZE 5

#ifndef MADV_PAGEOUT
#define MADV_PAGEOUT 21
#endif

static long page;
static int segmentFd = -1;
static int fileFd = -1;
static int readyPipe[2];
static int useSwap;

static void touch(char* start, size_t size, char value)
{
    for (size_t offset = 0; offset < size; offset += (size_t)page) start[offset] = value;
}

static unsigned long readPages(const char* start, size_t size)
{
    unsigned long sum = 0;
    for (size_t offset = 0; offset < size; offset += (size_t)page) sum += (unsigned char)start[offset];
    return sum;
}

static void* mapOrDie(size_t size, int protection, int flags, int fd)
{
    void* memory = mmap(NULL, size, protection, flags, fd, 0);
    if (memory == MAP_FAILED) {
        perror("fleet_child: mmap");
        _exit(1);
    }
    return memory;
}

/* The memory every process of the fleet lays out; `index` makes each one's
 * sizes and slices its own. */
static void layOutCommonMemory(unsigned index)
{
    unsigned seed = index * 2654435761u + 1;
    size_t privateSize = (1 + rand_r(&seed) % 4) * MIB;
    char* private = mapOrDie(privateSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1);
    touch(private, privateSize, (char)(index | 1));

    char* segment = mapOrDie(SEGMENT_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, segmentFd);
    size_t slices = (SEGMENT_SIZE - SEGMENT_COMMON) / MIB;
    touch(segment + SEGMENT_COMMON + (index % slices) * MIB, MIB, (char)index);
    volatile unsigned long sink = readPages(segment, SEGMENT_COMMON);

    char* shared = mapOrDie(FILE_SIZE, PROT_READ, MAP_SHARED, fileFd);
    size_t readSize = (1 + rand_r(&seed) % 16) * MIB;
    if (readSize > FILE_SIZE) readSize = FILE_SIZE;
    sink += readPages(shared, readSize);

    char* copied = mapOrDie(FILE_SIZE, PROT_READ | PROT_WRITE, MAP_PRIVATE, fileFd);
    touch(copied + (rand_r(&seed) % 64) * (size_t)page * 16, 16 * (size_t)page, 7);
    (void)sink;

    if (useSwap) madvise(private, privateSize / 2, MADV_PAGEOUT);
}

static void tellReady(void)
{
    pid_t self = getpid();
    if (write(readyPipe[1], &self, sizeof(self)) != (ssize_t)sizeof(self)) _exit(1);
}

static void waitForever(void)
{
    for (;;) pause();
}

static pid_t forkMember(void)
{
    pid_t pid = fork();
    if (pid < 0) {
        perror("fleet_child: fork");
        return pid;
    }
    if (pid == 0) prctl(PR_SET_PDEATHSIG, SIGKILL);
    return pid;
}

static void runGroup(unsigned first, unsigned members)
{
    char* cow = mapOrDie(COW_SIZE, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1);
    touch(cow, COW_SIZE, 3);
    for (unsigned child = 1; child < members; ++child) {
        pid_t pid = forkMember();
        if (pid == 0) {
            /* Each child overwrites its own quarter of the shared buffer and
             * keeps sharing the rest with its parent and siblings. */
            size_t quarter = COW_SIZE / 4;
            touch(cow + ((child - 1) % 4) * quarter, quarter, (char)child);
            layOutCommonMemory(first + child);
            tellReady();
            waitForever();
        }
    }
    layOutCommonMemory(first);
    tellReady();
    waitForever();
}

static int makeDataFile(const char* directory)
{
    char path[4096];
    snprintf(path, sizeof(path), "%s/data", directory);
    int fd = open(path, O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0 || ftruncate(fd, FILE_SIZE) != 0) return -1;
    char block[65536];
    for (size_t i = 0; i < sizeof(block); ++i) block[i] = (char)(i * 31);
    for (size_t offset = 0; offset < FILE_SIZE; offset += sizeof(block)) {
        if (pwrite(fd, block, sizeof(block), (off_t)offset) != (ssize_t)sizeof(block)) return -1;
    }
    /* The file stands for data that was on disk before the fleet started,
     * as a program's files usually are: written back, so that its pages sit
     * clean in the page cache rather than waiting for writeback. */
    if (fsync(fd) != 0) return -1;
    return fd;
}

int main(int argc, char** argv)
{
    if (argc != 4) {
        fprintf(stderr, "usage: fleet_child COUNT DIR SWAP\n");
        return 2;
    }
    unsigned count = (unsigned)strtoul(argv[1], NULL, 10);
    const char* directory = argv[2];
    useSwap = strcmp(argv[3], "1") == 0;
    page = sysconf(_SC_PAGESIZE);
    if (count < 1) count = 1;

    segmentFd = memfd_create("fleet-segment", MFD_CLOEXEC);
    if (segmentFd < 0 || ftruncate(segmentFd, SEGMENT_SIZE) != 0) {
        perror("fleet_child: shared segment");
        return 1;
    }
    fileFd = makeDataFile(directory);
    if (fileFd < 0) {
        perror("fleet_child: data file");
        return 1;
    }
    if (pipe(readyPipe) != 0) {
        perror("fleet_child: pipe");
        return 1;
    }

    unsigned others = count - 1;
    unsigned started = 0;
    while (started < others) {
        unsigned members = others - started < GROUP_SIZE ? others - started : GROUP_SIZE;
        pid_t pid = forkMember();
        if (pid == 0) {
            close(readyPipe[0]);
            runGroup(started + 1, members);
        }
        if (pid < 0) break;
        started += members;
    }
    close(readyPipe[1]);
    layOutCommonMemory(0);

    char path[4096];
    snprintf(path, sizeof(path), "%s/pids.part", directory);
    FILE* pids = fopen(path, "w");
    if (!pids) {
        perror("fleet_child: pid file");
        return 1;
    }
    fprintf(pids, "%d\n", (int)getpid());
    for (unsigned ready = 0; ready < started; ++ready) {
        pid_t pid;
        ssize_t got = read(readyPipe[0], &pid, sizeof(pid));
        if (got != (ssize_t)sizeof(pid)) {
            if (got < 0 && errno == EINTR) {
                --ready;
                continue;
            }
            fprintf(stderr, "fleet_child: only %u of %u processes laid out their memory\n", ready, started);
            return 1;
        }
        fprintf(pids, "%d\n", (int)pid);
    }
    fclose(pids);
    char finalPath[4096];
    snprintf(finalPath, sizeof(finalPath), "%s/pids", directory);
    rename(path, finalPath);
    snprintf(path, sizeof(path), "%s/ready", directory);
    close(open(path, O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    waitForever();
    return 0;
}
