#include "platform/HTWorkQueue.h"

#include <algorithm>
#include <cerrno>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <system_error>
#include <unistd.h>
#include <utility>

namespace {

// A Linux thread name holds 15 characters and the terminating NUL.
constexpr size_t kThreadNameLength = 15;
constexpr int kMaxNice = 19;

// Lowers the priority of the calling thread only: on Linux the nice value
// belongs to the thread, addressed by its thread id.
void lowerPriorityOfCurrentThread(int increment)
{
    const auto tid = static_cast<id_t>(::syscall(SYS_gettid));
    errno = 0;
    int current = ::getpriority(PRIO_PROCESS, tid);
    if (current == -1 && errno != 0) return;
    // A failure leaves the worker at its creator's priority, which is slower
    // for the rest of the machine but not wrong.
    (void)::setpriority(PRIO_PROCESS, tid, std::min(current + increment, kMaxNice));
}

}  // namespace

HTWorkQueue::HTWorkQueue(std::string label, unsigned threadCount) : label_(std::move(label))
{
    if (threadCount == 0) threadCount = defaultThreadCount();
    workers_.reserve(threadCount);
    for (unsigned i = 0; i < threadCount; ++i) {
        try {
            workers_.emplace_back([this] { workerMain(); });
        } catch (const std::system_error&) {
            // Out of threads: the loops still run, on fewer workers or on the
            // calling thread alone.
            break;
        }
    }
}

HTWorkQueue::~HTWorkQueue()
{
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopping_ = true;
    }
    jobPosted_.notify_all();
    for (std::thread& worker : workers_) worker.join();
}

unsigned HTWorkQueue::defaultThreadCount() { return std::max(1u, std::thread::hardware_concurrency()); }

void HTWorkQueue::parallelFor(size_t count, const std::function<void(size_t)>& body)
{
    if (count == 0) return;
    if (workers_.empty()) {
        std::exception_ptr failure;
        for (size_t index = 0; index < count; ++index) {
            try {
                body(index);
            } catch (...) {
                if (!failure) failure = std::current_exception();
            }
        }
        if (failure) std::rethrow_exception(failure);
        return;
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        body_ = &body;
        count_ = count;
        completed_ = 0;
        failure_ = nullptr;
        nextIndex_.store(0, std::memory_order_relaxed);
        ++generation_;
    }
    jobPosted_.notify_all();

    // Every iteration has ended once all are counted; `body` must outlive
    // the workers still leaving the loop as well.
    std::unique_lock<std::mutex> lock(mutex_);
    jobDone_.wait(lock, [this, count] { return completed_ == count && activeWorkers_ == 0; });
    // A worker that wakes only now finds no loop to join.
    body_ = nullptr;
    count_ = 0;
    if (failure_) std::rethrow_exception(std::exchange(failure_, nullptr));
}

void HTWorkQueue::runIterations(const std::function<void(size_t)>& body, size_t count)
{
    for (;;) {
        size_t index = nextIndex_.fetch_add(1, std::memory_order_relaxed);
        if (index >= count) return;
        std::exception_ptr failure;
        try {
            body(index);
        } catch (...) {
            failure = std::current_exception();
        }
        std::lock_guard<std::mutex> lock(mutex_);
        if (failure && !failure_) failure_ = failure;
        ++completed_;
    }
}

void HTWorkQueue::workerMain()
{
    std::string name = label_.substr(0, kThreadNameLength);
    ::pthread_setname_np(::pthread_self(), name.c_str());
    lowerPriorityOfCurrentThread(kNiceIncrement);

    uint64_t joinedGeneration = 0;
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
        jobPosted_.wait(lock, [&] { return stopping_ || generation_ != joinedGeneration; });
        if (stopping_) return;
        joinedGeneration = generation_;
        const std::function<void(size_t)>* body = body_;
        size_t count = count_;
        if (!body) continue;

        ++activeWorkers_;
        lock.unlock();
        runIterations(*body, count);
        lock.lock();
        if (--activeWorkers_ == 0) jobDone_.notify_all();
    }
}
