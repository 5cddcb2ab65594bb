/* The layout program: the one program the tests run when they need a real
 * process with known memory. It is plain C, built without sanitizers, so that
 * no sanitizer runtime (whose shadow memory would dwarf and blur what is being
 * measured) comes with it, also when the tests themselves are sanitized.
 *
 * Its arguments are directives, done in order; each prints one line of
 * numbers. Then it prints "ready" and waits, its memory exactly as laid out,
 * until it is killed. Every process it starts is in its process group.
 *
 *   anon SIZE          written private anonymous memory: ADDRESS 0
 *   free SIZE          the same, then MADV_FREE'd: ADDRESS ERRNO
 *   lock SIZE          the same, then mlocked: ADDRESS ERRNO
 *   pageout SIZE       the same, then pushed to swap (MADV_PAGEOUT): ADDRESS ERRNO
 *   file PATH SIZE N   PATH mapped shared, its first N bytes written: ADDRESS
 *   private PATH HOW   PATH mapped privately; HOW "written": writable, its first
 *                      half written, the rest read; "read": read-only, its first
 *                      and third quarter read: ADDRESS
 *   mappings COUNT     COUNT one-page mappings that cannot merge: ADDRESS
 *   fork COUNT SLICE OWN   COUNT children; child i writes slice i, counted from
 *                      the end, of the first directive's memory and OWN bytes
 *                      of its own, and waits: their pids, once all are ready
 *   tree               a child with two children, the first with a child of
 *                      its own: FIRST SECOND GRANDCHILD
 *   churn              children that write memory and exit, for ever: 0
 *   exit               exits at once, with status 0
 *   exit-main          the main thread exits; a worker thread goes on, and
 *                      prints its thread id once the main thread is a zombie
 *
 * Anonymous memory lies between two inaccessible pages, so that the kernel
 * cannot merge it with a neighbour: it is one mapping of exactly SIZE. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#ifndef MADV_PAGEOUT
#define MADV_PAGEOUT 21
#endif

static size_t page;

static void touch(char* start, size_t size)
{
    for (size_t offset = 0; offset < size; offset += page) start[offset] = (char)(1 + (offset / page) % 255);
}

static void readPages(const char* start, size_t size)
{
    for (size_t offset = 0; offset < size; offset += page) (void)*(volatile const char*)(start + offset);
}

static char* mapWritten(size_t size)
{
    char* base = mmap(NULL, size + 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (base == MAP_FAILED) exit(3);
    mprotect(base, page, PROT_NONE);
    mprotect(base + page + size, page, PROT_NONE);
    touch(base + page, size);
    return base + page;
}

static char* mapFile(const char* path, size_t size, int flags, int writable)
{
    int fd = open(path, writable ? O_RDWR : O_RDONLY);
    struct stat status;
    if (fd < 0 || fstat(fd, &status) != 0) exit(3);
    if (size == 0) size = (size_t)status.st_size;
    char* pages = mmap(NULL, size, writable ? PROT_READ | PROT_WRITE : PROT_READ, flags, fd, 0);
    if (pages == MAP_FAILED) exit(3);
    close(fd);
    return pages;
}

/* A forked child that dies with its parent, also when the parent died first. */
static pid_t forkChild(void)
{
    pid_t parent = getpid(), pid = fork();
    if (pid < 0) exit(3);
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
    }
    return pid;
}

static void forkFamily(int count, size_t slice, size_t own, char* first, size_t firstSize)
{
    int ready[2];
    if (pipe(ready) != 0) exit(3);
    pid_t* children = calloc((size_t)count, sizeof(pid_t));
    for (int i = 0; i < count; ++i) {
        if ((children[i] = forkChild()) > 0) continue;
        touch(first + firstSize - (size_t)(i + 1) * slice, slice);
        mapWritten(own);
        if (write(ready[1], "", 1) != 1) _exit(3);
        for (;;) pause();
    }
    close(ready[1]);
    char byte;
    for (int i = 0; i < count; ++i)
        if (read(ready[0], &byte, 1) != 1) exit(5); /* a child died on the way */
    for (int i = 0; i < count; ++i) printf("%d%c", (int)children[i], i + 1 < count ? ' ' : '\n');
    free(children);
}

static pid_t pauseInChild(void)
{
    pid_t pid = forkChild();
    if (pid == 0)
        for (;;) pause();
    return pid;
}

static void tree(void)
{
    int report[2];
    if (pipe(report) != 0) exit(3);
    pid_t first = forkChild();
    if (first == 0) {
        pid_t grandchild = pauseInChild();
        if (write(report[1], &grandchild, sizeof(grandchild)) != sizeof(grandchild)) _exit(3);
        for (;;) pause();
    }
    pid_t second = pauseInChild(), grandchild;
    if (read(report[0], &grandchild, sizeof(grandchild)) != sizeof(grandchild)) exit(5);
    printf("%d %d %d\n", (int)first, (int)second, (int)grandchild);
}

static void churn(void)
{
    unsigned seed = (unsigned)getpid();
    int alive = 0;
    for (;;) {
        while (waitpid(-1, NULL, alive >= 16 ? 0 : WNOHANG) > 0) --alive;
        if (forkChild() == 0) {
            mapWritten((1 + rand_r(&seed) % 8) << 20);
            usleep(rand_r(&seed) % 20000);
            _exit(0);
        }
        ++alive;
        usleep(2000);
    }
}

static char mainThreadState(void)
{
    char path[64], line[512];
    snprintf(path, sizeof(path), "/proc/%d/stat", (int)getpid());
    int fd = open(path, O_RDONLY);
    ssize_t length = fd < 0 ? -1 : read(fd, line, sizeof(line) - 1);
    if (fd >= 0) close(fd);
    if (length <= 0) return '?';
    line[length] = '\0';
    char* end = strrchr(line, ')');
    return end != NULL && end[1] == ' ' ? end[2] : '?';
}

static void* worker(void* unused)
{
    while (mainThreadState() != 'Z') usleep(1000);
    printf("%d\nready\n", (int)gettid());
    fflush(stdout);
    for (;;) pause();
    return unused;
}

#define IS(name) (strcmp(directive, name) == 0)

int main(int argc, char** argv)
{
    page = (size_t)sysconf(_SC_PAGESIZE);
    prctl(PR_SET_DUMPABLE, 1);
    setpgid(0, 0);
    char* first = NULL;
    size_t firstSize = 0;
    for (int i = 1; i < argc; ++i) {
        const char* directive = argv[i];
        size_t size = i + 1 < argc ? strtoull(argv[i + 1], NULL, 10) : 0;
        char* pages = NULL;
        int error = 0;
        if (IS("anon") || IS("free") || IS("lock") || IS("pageout")) {
            pages = mapWritten(size);
            if (IS("free")) error = madvise(pages, size, MADV_FREE) ? errno : 0;
            if (IS("lock")) error = mlock(pages, size) ? errno : 0;
            if (IS("pageout")) error = madvise(pages, size, MADV_PAGEOUT) ? errno : 0;
            printf("%lu %d\n", (unsigned long)pages, error);
            ++i;
        } else if (IS("file") && i + 3 < argc) {
            size = strtoull(argv[i + 2], NULL, 10);
            pages = mapFile(argv[i + 1], size, MAP_SHARED, 1);
            touch(pages, strtoull(argv[i + 3], NULL, 10));
            printf("%lu\n", (unsigned long)pages);
            i += 3;
        } else if (IS("private") && i + 2 < argc) {
            int written = strcmp(argv[i + 2], "written") == 0;
            pages = mapFile(argv[i + 1], 0, MAP_PRIVATE, written);
            struct stat status;
            size = stat(argv[i + 1], &status) == 0 ? (size_t)status.st_size : 0;
            size_t quarter = size / page / 4 * page;
            if (written) {
                touch(pages, 2 * quarter);
                readPages(pages + 2 * quarter, size - 2 * quarter);
            } else {
                readPages(pages, quarter);
                readPages(pages + 2 * quarter, quarter);
            }
            printf("%lu\n", (unsigned long)pages);
            i += 2;
        } else if (IS("mappings")) {
            /* Every other page inaccessible: no two mappings can merge. */
            pages = mmap(NULL, 2 * size * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
            if (pages == MAP_FAILED) return 3;
            for (size_t m = 0; m < size; ++m)
                if (mprotect(pages + 2 * m * page, page, PROT_READ) != 0) return 3;
            printf("%lu\n", (unsigned long)pages);
            ++i;
        } else if (IS("fork") && i + 3 < argc && first != NULL) {
            forkFamily((int)size, strtoull(argv[i + 2], NULL, 10), strtoull(argv[i + 3], NULL, 10), first, firstSize);
            i += 3;
        } else if (IS("tree")) {
            tree();
        } else if (IS("churn")) {
            printf("0\nready\n");
            fflush(stdout);
            churn();
        } else if (IS("exit")) {
            return 0;
        } else if (IS("exit-main")) {
            fflush(stdout);
            pthread_t thread;
            if (pthread_create(&thread, NULL, worker, NULL) != 0) return 3;
            pthread_exit(NULL);
        } else {
            fprintf(stderr, "layout: cannot lay out '%s'\n", directive);
            return 2;
        }
        if (first == NULL && pages != NULL) first = pages, firstSize = size;
        fflush(stdout);
    }
    printf("ready\n");
    fflush(stdout);
    for (;;) pause();
}
