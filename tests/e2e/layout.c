/* The program the end-to-end tests run in their children to lay out known
 * memory. It is plain C, built without sanitizers, so that the children carry
 * no sanitizer runtime (whose shadow memory would dwarf and blur the memory
 * being measured). It prints the numbers the test needs on one line, then
 * sleeps until it is killed, its memory exactly as laid out.
 *
 * "anonymous WRITTEN FREED LOCKED PAGEDOUT" lays out four mappings, each
 * written and then left, MADV_FREE'd, mlocked or MADV_PAGEOUT'd, and prints
 * the first three addresses, mlock's errno, the fourth address and madvise's
 * errno; "file PATH SIZE" maps PATH shared, writes it and prints its address;
 * "prefork" lays out a family (below); "churn" forks short-lived children for
 * ever; "leader-exit SIZE" leaves a worker thread holding SIZE written bytes
 * after the main thread has exited, and prints their address and the
 * worker's thread id.
 */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
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

/* Written private anonymous memory between two inaccessible pages: the kernel
 * cannot merge it with a neighbour, so it is one mapping of exactly `size`. */
static char* mapWritten(size_t size)
{
    char* base = mmap(NULL, size + 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (base == MAP_FAILED) exit(3);
    mprotect(base, page, PROT_NONE);
    mprotect(base + page + size, page, PROT_NONE);
    touch(base + page, size);
    return base + page;
}

static void churn(void)
{
    unsigned seed = (unsigned)getpid();
    int alive = 0;
    for (;;) {
        while (waitpid(-1, NULL, alive >= 16 ? 0 : WNOHANG) > 0) --alive;
        pid_t pid = fork();
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            mapWritten((1 + rand_r(&seed) % 8) << 20);
            usleep(rand_r(&seed) % 20000);
            _exit(0);
        }
        if (pid > 0) ++alive;
        usleep(500);
    }
}

/* Maps `path` privately. "written": writable, the first half of its pages
 * written (the process's own copies) and the second half read (the file's
 * pages); "read": read-only, its first and third quarter read, two runs of
 * pages with a gap between them. */
static char* mapFilePrivately(const char* how, const char* path)
{
    int fd = open(path, O_RDONLY);
    struct stat status;
    if (fd < 0 || fstat(fd, &status) != 0) exit(3);
    size_t size = (size_t)status.st_size, quarter = size / page / 4 * page;
    int writable = strcmp(how, "written") == 0;
    char* pages = mmap(NULL, size, writable ? PROT_READ | PROT_WRITE : PROT_READ, MAP_PRIVATE, fd, 0);
    if (pages == MAP_FAILED) exit(3);
    close(fd);
    if (writable) {
        touch(pages, 2 * quarter);
        readPages(pages + 2 * quarter, size - 2 * quarter);
    } else {
        readPages(pages, quarter);
        readPages(pages + 2 * quarter, quarter);
    }
    return pages;
}

/* prefork SHARED COUNT SLICE OWN AFTER PAGEDOUT HOW PATH: the parent writes
 * one mapping of SHARED bytes, pushes its first PAGEDOUT bytes to swap and
 * maps PATH privately as HOW says (not when HOW is "-"), then forks COUNT
 * children. Child i overwrites slice i of the shared mapping, counted from
 * its end, writes OWN bytes of new memory, tells the parent and waits; once
 * all have, the parent writes AFTER bytes of new memory. Printed: the shared
 * mapping, the file mapping (0 for none), the parent's new memory, the
 * MADV_PAGEOUT errno, then the children's pids. */
static void prefork(size_t shared, int count, size_t slice, size_t own, size_t after, size_t pagedOut, const char* how,
                    const char* path)
{
    char* pages = mapWritten(shared);
    int pageoutError = pagedOut > 0 && madvise(pages, pagedOut, MADV_PAGEOUT) != 0 ? errno : 0;
    char* file = strcmp(how, "-") == 0 ? NULL : mapFilePrivately(how, path);
    int ready[2];
    if (pipe(ready) != 0) exit(3);
    pid_t parent = getpid();
    pid_t* children = calloc((size_t)count, sizeof(pid_t));
    for (int i = 0; i < count; ++i) {
        children[i] = fork();
        if (children[i] < 0) exit(3);
        if (children[i] > 0) continue;
        /* The children go with the parent, also when it died before this. */
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        touch(pages + shared - (size_t)(i + 1) * slice, slice);
        mapWritten(own);
        if (write(ready[1], "", 1) != 1) _exit(3);
        for (;;) pause();
    }
    close(ready[1]);
    /* A child that died on the way would leave the parent waiting for ever:
     * the others keep the pipe open. */
    for (int i = 0; i < count;) {
        struct pollfd wait = {ready[0], POLLIN, 0};
        char byte;
        if (poll(&wait, 1, 100) == 1 && read(ready[0], &byte, 1) == 1)
            ++i;
        else if (waitpid(-1, NULL, WNOHANG) > 0)
            exit(5);
    }
    char* extra = mapWritten(after);
    printf("%lu %lu %lu %d", (unsigned long)pages, (unsigned long)file, (unsigned long)extra, pageoutError);
    for (int i = 0; i < count; ++i) printf(" %d", (int)children[i]);
    printf("\n");
}

/* The state letter of this process's main thread, from its stat line. */
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

/* The worker of "leader-exit": writes its memory, waits until the main thread
 * has exited (the kernel keeps it as a zombie while the process lives on),
 * then prints the memory's address and its own thread id, and stays. */
static void* leaderExitWorker(void* size)
{
    char* pages = mapWritten((size_t)size);
    while (mainThreadState() != 'Z') usleep(1000);
    printf("%lu %d\n", (unsigned long)pages, (int)gettid());
    fflush(stdout);
    for (;;) pause();
    return NULL;
}

int main(int argc, char** argv)
{
    page = (size_t)sysconf(_SC_PAGESIZE);
    prctl(PR_SET_DUMPABLE, 1);
    const char* mode = argc > 1 ? argv[1] : "";
    size_t size[8] = {0};
    for (int i = 2; i < argc && i < 10; ++i) size[i - 2] = strtoull(argv[i], NULL, 10);
    if (strcmp(mode, "anonymous") == 0 && argc == 6) {
        char* written = mapWritten(size[0]);
        char* freed = mapWritten(size[1]);
        if (madvise(freed, size[1], MADV_FREE) != 0) return 4;
        char* locked = mapWritten(size[2]);
        int lockError = mlock(locked, size[2]) == 0 ? 0 : errno;
        char* out = mapWritten(size[3]);
        int pageoutError = madvise(out, size[3], MADV_PAGEOUT) == 0 ? 0 : errno;
        printf("%lu %lu %lu %d %lu %d\n", (unsigned long)written, (unsigned long)freed, (unsigned long)locked,
               lockError, (unsigned long)out, pageoutError);
    } else if (strcmp(mode, "file") == 0 && argc == 4) {
        int fd = open(argv[2], O_RDWR);
        char* pages = fd < 0 ? MAP_FAILED : mmap(NULL, size[1], PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        if (pages == MAP_FAILED) return 3;
        touch(pages, size[1]);
        printf("%lu\n", (unsigned long)pages);
    } else if (strcmp(mode, "prefork") == 0 && argc == 10) {
        prefork(size[0], (int)size[1], size[2], size[3], size[4], size[5], argv[8], argv[9]);
    } else if (strcmp(mode, "leader-exit") == 0 && argc == 3) {
        pthread_t worker;
        if (pthread_create(&worker, NULL, leaderExitWorker, (void*)size[0]) != 0) return 3;
        pthread_exit(NULL);
    } else if (strcmp(mode, "churn") == 0) {
        printf("0\n");
        fflush(stdout);
        churn();
    } else {
        return 2;
    }
    fflush(stdout);
    for (;;) pause();
}
