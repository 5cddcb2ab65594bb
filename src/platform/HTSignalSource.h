#pragma once

#include <atomic>
#include <csignal>
#include <functional>
#include <memory>
#include <pthread.h>
#include <thread>

// Turns a signal into a call of an ordinary function on a thread of its own,
// outside signal context, where the function may take locks, allocate and
// write. While the source is installed the signal is blocked in the thread
// that installed it, and so in every thread started afterwards, and its
// disposition is "ignore", so that no thread can be ended by it; one
// listening thread takes it with sigwait.
//
// Install the source on the main thread before starting any other thread,
// and cancel it on the same thread: cancelling restores the signal's default
// action and that thread's signal mask.
class HTSignalSource {
public:
    // Installs a source for `signo` that calls `handler` once for every
    // delivery; null when the listening thread cannot be started (the signal
    // then keeps its disposition and mask).
    static std::unique_ptr<HTSignalSource> create(int signo, std::function<void()> handler);

    // Cancels the source if that has not been done.
    ~HTSignalSource();
    HTSignalSource(const HTSignalSource&) = delete;
    HTSignalSource& operator=(const HTSignalSource&) = delete;

    // Stops the listening thread (a handler that is running finishes first),
    // then restores the signal's default action and unblocks it in the
    // calling thread if it was not blocked before. Later calls do nothing.
    void cancel();

private:
    HTSignalSource(int signo, std::function<void()> handler);
    void listen();

    int signo_;
    std::function<void()> handler_;
    sigset_t previousMask_;
    std::atomic<bool> stopping_{false};
    std::thread listener_;
    bool cancelled_ = false;
};
