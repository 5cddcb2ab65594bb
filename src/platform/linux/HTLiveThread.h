#pragma once

// A process lives as long as one of its threads does. When its main thread
// exits first (pthread_exit in main), the kernel keeps that thread as a
// zombie until the last one ends: /proc/PID then shows state Z, and the files
// that describe the address space (smaps, pagemap, the memory lines of
// status) read empty there, while /proc/PID/task/TID of any live thread
// reads the address space whole.

#include "platform/linux/HTFileDescriptor.h"

#include <cerrno>

// Opens the /proc/PID/task/TID directory of a thread of the process that has
// not exited, through the process's own directory `processDir`, so that the
// thread is surely one of that process. Closed with errno, ESRCH when no
// thread lives on.
HTFileDescriptor htOpenLiveThreadDirectory(int processDir);

// Whether the thread behind a /proc/PID or /proc/PID/task/TID descriptor
// has exited or is exiting: it is gone (its files vanish), a zombie (its
// files read empty), or on its way out, with its address space being torn
// down. Asked of the thread whose files were read, which is the main one
// unless that one exited before the others.
bool htThreadHasExited(int dirfd);

// Whether a failure's errno means the process is gone.
inline bool htMeansGone(int error) { return error == ESRCH || error == ENOENT; }
