#include "platform/HTSignalSource.h"

#include <system_error>

namespace {

sigset_t setOf(int signo)
{
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, signo);
    return set;
}

void setDisposition(int signo, void (*disposition)(int))
{
    struct sigaction action {};
    action.sa_handler = disposition;
    sigemptyset(&action.sa_mask);
    sigaction(signo, &action, nullptr);
}

}  // namespace

HTSignalSource::HTSignalSource(int signo, std::function<void()> handler) : signo_(signo), handler_(std::move(handler))
{
    sigemptyset(&previousMask_);
}

std::unique_ptr<HTSignalSource> HTSignalSource::create(int signo, std::function<void()> handler)
{
    std::unique_ptr<HTSignalSource> source(new HTSignalSource(signo, std::move(handler)));

    // Blocked before the listener starts, so that it and every thread
    // started after it inherit the block and only sigwait takes the signal.
    sigset_t set = setOf(signo);
    if (pthread_sigmask(SIG_BLOCK, &set, &source->previousMask_) != 0) return nullptr;
    // A blocked signal is never discarded, whatever its disposition; a
    // thread started before the source that does not block it is then left
    // to ignore it rather than be ended by it.
    setDisposition(signo, SIG_IGN);

    try {
        source->listener_ = std::thread([raw = source.get()] { raw->listen(); });
    } catch (const std::system_error&) {
        setDisposition(signo, SIG_DFL);
        pthread_sigmask(SIG_SETMASK, &source->previousMask_, nullptr);
        source->cancelled_ = true;
        return nullptr;
    }
    return source;
}

HTSignalSource::~HTSignalSource() { cancel(); }

void HTSignalSource::listen()
{
    const sigset_t set = setOf(signo_);
    for (;;) {
        int received = 0;
        if (sigwait(&set, &received) != 0) continue;
        // cancel() wakes the listener with the signal itself, after raising
        // the stop flag.
        if (stopping_.load(std::memory_order_acquire)) return;
        handler_();
    }
}

void HTSignalSource::cancel()
{
    if (cancelled_) return;
    cancelled_ = true;

    stopping_.store(true, std::memory_order_release);
    // Directed at the listener, which blocks the signal: it stays pending
    // there until sigwait takes it, even if a handler is running right now.
    pthread_kill(listener_.native_handle(), signo_);
    listener_.join();

    setDisposition(signo_, SIG_DFL);
    if (!sigismember(&previousMask_, signo_)) {
        sigset_t set = setOf(signo_);
        pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
    }
}
