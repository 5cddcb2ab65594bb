#pragma once

// A process lives as long as one of its threads does. When its main thread
// exits first (pthread_exit in main), the kernel keeps that thread as a
// zombie until the last one ends: /proc/PID then shows state Z, and the files
// that describe the address space (smaps, pagemap, the memory lines of
// status) read empty there, while /proc/PID/task/TID of any live thread
// reads the address space whole.

#include <cstdint>

// Opens the /proc/PID/task/TID directory of a thread of the process that has
// not exited, through the process's own directory `processDir`, so that the
// thread is surely one of that process. -1 with errno, ESRCH when no thread
// lives on.
int htOpenLiveThreadDirectory(int processDir);
