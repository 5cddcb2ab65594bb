/*
 * Process churn, for running heft on a machine where processes come and go
 * all the time. Built and run by churn.sh:
 *
 *   churn_child RATE LIVE
 *
 * Starts RATE processes a second and keeps LIVE of them alive: once LIVE
 * are running, each new one is preceded by killing one of them picked at
 * random. A process lives LIVE / RATE seconds on average, most of them less
 * and a few many times as long, so that some live through a whole heft run.
 * A killed process is reaped one tick later, so that some are seen as
 * zombies. Every process writes memory of its own: every third one many
 * small mappings of alternate protections (which the kernel cannot merge),
 * the others 1 to 8 MiB of private anonymous memory and 1 MiB of shared
 * memory.
 *
 * On SIGTERM or SIGINT it kills and reaps every process it started, by pid,
 * and exits. Every process also dies with it (PR_SET_PDEATHSIG).
 */

#define _GNU_SOURCE
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#define MIB (1024UL * 1024UL)
#define MANY_MAPPINGS 400
#define MAX_LIVE 4096

static volatile sig_atomic_t stopping;

static void stop(int signal)
{
    (void)signal;
    stopping = 1;
}

static void touch(char* start, size_t size, long page)
{
    for (size_t offset = 0; offset < size; offset += (size_t)page) start[offset] = 1;
}

/* The life of one process: write its memory, then wait to be killed. */
static void liveOut(unsigned index, long page)
{
    signal(SIGTERM, SIG_DFL);
    signal(SIGINT, SIG_DFL);
    if (index % 3 == 0) {
        /* Neighbouring mappings with different protections stay apart. */
        for (unsigned i = 0; i < MANY_MAPPINGS; ++i) {
            char* one = mmap(NULL, (size_t)page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
            if (one == MAP_FAILED) break;
            one[0] = 1;
            if (i % 2) mprotect(one, (size_t)page, PROT_READ);
        }
    } else {
        size_t size = (1 + index % 8) * MIB;
        char* private = mmap(NULL, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        char* shared = mmap(NULL, MIB, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
        if (private != MAP_FAILED) touch(private, size, page);
        if (shared != MAP_FAILED) touch(shared, MIB, page);
    }
    for (;;) pause();
}

static void addNanoseconds(struct timespec* time, long nanoseconds)
{
    time->tv_nsec += nanoseconds;
    while (time->tv_nsec >= 1000000000L) {
        time->tv_nsec -= 1000000000L;
        ++time->tv_sec;
    }
}

int main(int argc, char** argv)
{
    if (argc != 3) {
        fprintf(stderr, "usage: churn_child RATE LIVE\n");
        return 2;
    }
    long rate = strtol(argv[1], NULL, 10);
    long maxLive = strtol(argv[2], NULL, 10);
    if (rate < 1 || maxLive < 1 || maxLive > MAX_LIVE) {
        fprintf(stderr, "churn_child: RATE must be positive and LIVE between 1 and %d\n", MAX_LIVE);
        return 2;
    }
    long page = sysconf(_SC_PAGESIZE);
    struct sigaction action = {.sa_handler = stop};
    sigaction(SIGTERM, &action, NULL);
    sigaction(SIGINT, &action, NULL);

    /* The live processes, and the one killed on the previous tick, still to
     * be reaped. */
    pid_t live[MAX_LIVE];
    long count = 0;
    pid_t killed = 0;
    unsigned started = 0;
    unsigned seed = 1;
    struct timespec next;
    clock_gettime(CLOCK_MONOTONIC, &next);

    while (!stopping) {
        if (killed > 0) waitpid(killed, NULL, 0);
        killed = 0;
        if (count == maxLive) {
            long victim = rand_r(&seed) % count;
            killed = live[victim];
            kill(killed, SIGKILL);
            live[victim] = live[--count];
        }
        pid_t pid = fork();
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            if (getppid() == 1) _exit(0);
            liveOut(started, page);
        }
        if (pid > 0) {
            live[count++] = pid;
            ++started;
        }
        addNanoseconds(&next, 1000000000L / rate);
        while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &next, NULL) == EINTR && !stopping) {}
    }

    if (killed > 0) waitpid(killed, NULL, 0);
    for (long i = 0; i < count; ++i) kill(live[i], SIGKILL);
    for (long i = 0; i < count; ++i) waitpid(live[i], NULL, 0);
    printf("%u\n", started);
    return 0;
}
