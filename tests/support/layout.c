/* The layout program: a real process with known memory for the tests, plain C
 * built without sanitizers, whose shadow memory would blur it. Each directive
 * prints a line of numbers; then "ready", and it waits as laid out until killed,
 * with all it started in its process group. A failed call exits with status 3.
 *
 *   anon|free|lock|pageout SIZE  written private anonymous memory between two
 *       inaccessible pages, left so, MADV_FREE'd, mlocked or paged out: ADDRESS ERRNO
 *   file PATH SIZE N    PATH mapped shared, its first N bytes written: ADDRESS
 *   private PATH written|read    PATH mapped privately (see below): ADDRESS
 *   mappings COUNT      COUNT one-page mappings that cannot merge: ADDRESS
 *   fork COUNT SLICE OWN   children, child i writing slice i from the end of the
 *       first directive's memory and OWN bytes of its own: their pids, once ready
 *   tree                a child with two, the first with one: FIRST SECOND GRANDCHILD
 *   churn               children that write memory and exit, for ever: 0
 *   exit                exits at once, with status 0
 *   exit-main           the main thread exits; a worker prints its id once it is a zombie
 *   memfd SIZE OUT      a memfd of SIZE written bytes, the first OUT paged out, then unmapped and held: FD
 *   sysv SIZE           a System V segment of SIZE written bytes, then detached: SHMID
 *   tmpfile PATH SIZE   PATH created with SIZE bytes written, then deleted and held open: FD
 *   heldfile PATH SIZE  PATH created with SIZE bytes written through a shared mapping, held open and mapped: FD */
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
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#ifndef MADV_PAGEOUT
#define MADV_PAGEOUT 21
#endif

static size_t page;

static void need(int ok, const char* what)
{
    if (!ok) perror(what), exit(3);
}

/* Writes, or reads, a byte of every page. */
static void touch(char* start, size_t size, int write)
{
    for (size_t at = 0; at < size; at += page)
        write ? (void)(start[at] = (char)(1 + (at / page) % 255)) : (void)*(volatile const char*)(start + at);
}

static char* mapWritten(size_t size)
{
    char* base = mmap(NULL, size + 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    need(base != MAP_FAILED, "mmap");
    mprotect(base, page, PROT_NONE);
    mprotect(base + page + size, page, PROT_NONE);
    touch(base + page, size, 1);
    return base + page;
}

/* A forked child that dies with its parent, also when the parent died first. */
static pid_t forkChild(void)
{
    pid_t parent = getpid(), pid = fork();
    need(pid >= 0, "fork");
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
    }
    return pid;
}

static void waitForEver(void)
{
    for (;;) pause();
}

static void sendPid(int fd, pid_t pid) { need(write(fd, &pid, sizeof(pid)) == sizeof(pid), "write"); }

static pid_t receivePid(int fd)
{
    pid_t pid;
    need(read(fd, &pid, sizeof(pid)) == sizeof(pid), "a child died on the way");
    return pid;
}

static void forkFamily(int count, size_t slice, size_t own, char* first, size_t firstSize)
{
    int ready[2];
    need(pipe(ready) == 0, "pipe");
    for (int i = 0; i < count; ++i) {
        if (forkChild() > 0) continue;
        touch(first + firstSize - (size_t)(i + 1) * slice, slice, 1);
        mapWritten(own);
        sendPid(ready[1], getpid());
        waitForEver();
    }
    close(ready[1]);
    for (int i = 0; i < count; ++i) printf("%d%c", (int)receivePid(ready[0]), i + 1 < count ? ' ' : '\n');
}

static void tree(void)
{
    int report[2];
    need(pipe(report) == 0, "pipe");
    pid_t first = forkChild(), second, grandchild;
    if (first == 0) {
        if ((grandchild = forkChild()) == 0) waitForEver();
        sendPid(report[1], grandchild);
        waitForEver();
    }
    if ((second = forkChild()) == 0) waitForEver();
    printf("%d %d %d\n", (int)first, (int)second, (int)receivePid(report[0]));
}

static void churn(void)
{
    unsigned seed = (unsigned)getpid();
    for (int alive = 0;; ++alive, usleep(2000)) {
        while (waitpid(-1, NULL, alive >= 16 ? 0 : WNOHANG) > 0) --alive;
        if (forkChild() == 0) {
            mapWritten((1 + rand_r(&seed) % 8) << 20);
            usleep(rand_r(&seed) % 20000);
            _exit(0);
        }
    }
}

/* Prints its thread id once the main thread is a zombie: state Z after the name in /proc/self/stat. */
static void* worker(void* unused)
{
    char line[512], *end = NULL;
    while (end == NULL || strncmp(end, ") Z", 3) != 0) {
        usleep(1000);
        FILE* stat = fopen("/proc/self/stat", "r");
        line[stat ? fread(line, 1, sizeof(line) - 1, stat) : 0] = '\0';
        if (stat) fclose(stat);
        end = strrchr(line, ')');
    }
    printf("%d\nready\n", (int)gettid());
    fflush(stdout);
    waitForEver();
    return unused;
}

/* SIZE bytes of the file written through a shared mapping, the first OUT of them paged out; left unmapped. */
static void writeMapped(int fd, size_t size, size_t out)
{
    need(ftruncate(fd, (off_t)size) == 0, "ftruncate");
    char* pages = mmap(NULL, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    need(pages != MAP_FAILED, "mmap");
    touch(pages, size, 1);
    if (out > 0) need(madvise(pages, out, MADV_PAGEOUT) == 0, "madvise");
    munmap(pages, size);
}

/* Whether argv[i] is the directive `name` with its `count` arguments, to be skipped; its argument `k`. */
#define IS(name, count) (strcmp(argv[i], name) == 0 && i + (count) < argc && (skip = (count), 1))
#define NUMBER(k) ((size_t)strtoull(argv[i + (k)], NULL, 10))

int main(int argc, char** argv)
{
    page = (size_t)sysconf(_SC_PAGESIZE);
    prctl(PR_SET_DUMPABLE, 1);
    setpgid(0, 0);
    char* first = NULL;
    size_t firstSize = 0;
    for (int i = 1, skip = 0; i < argc; i += 1 + skip, skip = 0) {
        char* pages = NULL;
        size_t size = 0;
        if (IS("anon", 1) || IS("free", 1) || IS("lock", 1) || IS("pageout", 1)) {
            pages = mapWritten(size = NUMBER(1));
            int error = 0;
            if (IS("free", 1)) error = madvise(pages, size, MADV_FREE);
            if (IS("lock", 1)) error = mlock(pages, size);
            if (IS("pageout", 1)) error = madvise(pages, size, MADV_PAGEOUT);
            printf("%lu %d\n", (unsigned long)pages, error ? errno : 0);
        } else if (IS("file", 3) || IS("private", 2)) {
            /* A private mapping covers the whole file: "written" writes its first half and reads the rest,
             * "read" maps it read-only and reads its first and third quarter. */
            int shared = IS("file", 3), writable = shared || strcmp(argv[i + 2], "written") == 0;
            int fd = open(argv[i + 1], writable ? O_RDWR : O_RDONLY);
            struct stat status;
            need(fd >= 0 && fstat(fd, &status) == 0, argv[i + 1]);
            size = shared ? NUMBER(2) : (size_t)status.st_size;
            pages = mmap(NULL, size, PROT_READ | (writable ? PROT_WRITE : 0), shared ? MAP_SHARED : MAP_PRIVATE, fd, 0);
            need(pages != MAP_FAILED, "mmap");
            close(fd);
            size_t quarter = size / page / 4 * page;
            touch(pages, shared ? NUMBER(3) : writable ? 2 * quarter : quarter, writable);
            if (!shared) touch(pages + 2 * quarter, writable ? size - 2 * quarter : quarter, 0);
            printf("%lu\n", (unsigned long)pages);
        } else if (IS("mappings", 1)) {
            /* Every other page inaccessible: no two mappings can merge. */
            pages = mmap(NULL, 2 * NUMBER(1) * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
            need(pages != MAP_FAILED, "mmap");
            for (size_t m = 0; m < NUMBER(1); ++m)
                need(mprotect(pages + 2 * m * page, page, PROT_READ) == 0, "mprotect");
            printf("%lu\n", (unsigned long)pages);
        } else if (IS("fork", 3) && first != NULL) {
            forkFamily((int)NUMBER(1), NUMBER(2), NUMBER(3), first, firstSize);
        } else if (IS("memfd", 2)) {
            int fd = memfd_create("heft-layout", 0);
            need(fd >= 0, "memfd_create");
            writeMapped(fd, NUMBER(1), NUMBER(2));
            printf("%d\n", fd);
        } else if (IS("sysv", 1)) {
            int id = shmget(IPC_PRIVATE, NUMBER(1), IPC_CREAT | 0600);
            need(id >= 0, "shmget");
            char* segment = shmat(id, NULL, 0);
            need(segment != (void*)-1, "shmat");
            touch(segment, NUMBER(1), 1);
            shmdt(segment);
            printf("%d\n", id);
        } else if (IS("tmpfile", 2) || IS("heldfile", 2)) {
            int fd = open(argv[i + 1], O_RDWR | O_CREAT | O_EXCL, 0600), held = IS("heldfile", 2);
            need(fd >= 0 && (held || unlink(argv[i + 1]) == 0), argv[i + 1]);
            writeMapped(fd, NUMBER(2), 0);
            if (held) {
                char* mapped = mmap(NULL, NUMBER(2), PROT_READ, MAP_SHARED, fd, 0);
                need(mapped != MAP_FAILED, "mmap");
                touch(mapped, NUMBER(2), 0);
            }
            printf("%d\n", fd);
        } else if (IS("tree", 0)) {
            tree();
        } else if (IS("churn", 0)) {
            printf("0\nready\n");
            fflush(stdout);
            churn();
        } else if (IS("exit", 0)) {
            return 0;
        } else if (IS("exit-main", 0)) {
            pthread_t thread;
            need(pthread_create(&thread, NULL, worker, NULL) == 0, "pthread_create");
            pthread_exit(NULL);
        } else {
            fprintf(stderr, "layout: cannot lay out '%s'\n", argv[i]);
            return 2;
        }
        if (first == NULL && pages != NULL) first = pages, firstSize = size;
        fflush(stdout);
    }
    printf("ready\n");
    fflush(stdout);
    waitForEver();
}
