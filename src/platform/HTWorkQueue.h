#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

// A pool of worker threads that runs parallel loops. The workers run at a
// lowered priority (nice +10 over the creating thread) so that a long
// gathering does not crowd out the rest of the machine, and carry the
// queue's label as their thread name. Iterations take their indexes from
// one atomic counter, so a slow iteration holds up only its own thread.
//
// parallelFor is called from one thread at a time; the pool is joined when
// the queue is destroyed.
class HTWorkQueue {
public:
    // `label` names the worker threads (cut to the 15 characters a Linux
    // thread name holds). `threadCount` 0 means one worker per core.
    explicit HTWorkQueue(std::string label, unsigned threadCount = 0);
    ~HTWorkQueue();
    HTWorkQueue(const HTWorkQueue&) = delete;
    HTWorkQueue& operator=(const HTWorkQueue&) = delete;

    // Runs body(i) once for every i in [0, count), spread over the workers,
    // and returns when every iteration has ended. The calling thread only
    // waits, so that the whole loop runs at the workers' priority; without
    // workers it runs the loop itself. An iteration that throws (out of
    // memory, say) ends no thread: the other iterations run, and
    // parallelFor then throws the first exception on the calling thread.
    void parallelFor(size_t count, const std::function<void(size_t)>& body);

    const std::string& label() const { return label_; }
    size_t threadCount() const { return workers_.size(); }

    // One worker per core, at least one.
    static unsigned defaultThreadCount();
    // How much the workers' nice value exceeds their creator's.
    static constexpr int kNiceIncrement = 10;

private:
    void workerMain();
    // Runs iterations of the current loop until its indexes run out.
    void runIterations(const std::function<void(size_t)>& body, size_t count);

    std::string label_;
    std::vector<std::thread> workers_;

    std::mutex mutex_;
    std::condition_variable jobPosted_;
    std::condition_variable jobDone_;
    // Guarded by mutex_: the loop being run, its number (so that a worker
    // joins each loop once), how many workers are still inside it, and the
    // stop request.
    const std::function<void(size_t)>* body_ = nullptr;
    size_t count_ = 0;
    uint64_t generation_ = 0;
    size_t activeWorkers_ = 0;
    size_t completed_ = 0;
    std::exception_ptr failure_;
    bool stopping_ = false;

    // The next index of the current loop to hand out.
    std::atomic<size_t> nextIndex_{0};
};
