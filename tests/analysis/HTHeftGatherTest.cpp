// The parallel gathering and its cancellation by SIGINT. These tests start
// threads and deliver real signals; they also run under ThreadSanitizer.

#include "analysis/HTHeftTestSupport.h"
#include "base/HTNoticeLog.h"
#include "cli/HTCancelHandler.h"
#include "output/HTOutputFormatterText.h"
#include "platform/HTSignalSource.h"
#include "platform/HTWorkQueue.h"
#include "process/HTUserProcess.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstring>
#include <future>
#include <mutex>
#include <pthread.h>
#include <set>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>

namespace {

using namespace std::chrono_literals;
using HTHeftGatherTest = HTAnalysisTest;

int currentThreadNice() { return getpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid))); }

// Whether SIGINT is blocked on this thread, and whether it has its default action.
std::pair<bool, bool> sigintState()
{
    sigset_t mask;
    pthread_sigmask(SIG_BLOCK, nullptr, &mask);
    struct sigaction action {};
    sigaction(SIGINT, nullptr, &action);
    return {sigismember(&mask, SIGINT) == 1, action.sa_handler == SIG_DFL};
}

TEST(HTHeftGatherWorkQueueTest, RunsEveryIndexOnceOnLowPriorityNamedWorkers)
{
    HTWorkQueue queue("heft.gatherdata", 3);
    EXPECT_EQ(queue.threadCount(), 3u);
    const int callerNice = currentThreadNice();
    const auto caller = std::this_thread::get_id();
    // Two loops on one pool: workers join each loop afresh.
    for (size_t count : {size_t{1000}, size_t{7}}) {
        std::vector<std::atomic<int>> runs(count);
        std::mutex mutex;
        std::set<std::pair<std::string, int>> workers;
        queue.parallelFor(count, [&](size_t i) {
            runs[i].fetch_add(1);
            if (std::this_thread::get_id() == caller) return;
            char name[16] = {};
            pthread_getname_np(pthread_self(), name, sizeof(name));
            std::lock_guard<std::mutex> lock(mutex);
            workers.emplace(name, currentThreadNice());
        });
        for (size_t i = 0; i < count; ++i) EXPECT_EQ(runs[i].load(), 1) << "index " << i;
        for (const auto& worker : workers)
            EXPECT_EQ(
                worker,
                std::make_pair(std::string("heft.gatherdata"), std::min(callerNice + HTWorkQueue::kNiceIncrement, 19)));
    }
    queue.parallelFor(0, [](size_t) { ADD_FAILURE() << "no iteration expected"; });
    EXPECT_EQ(currentThreadNice(), callerNice);

    // An iteration that runs out of memory ends no worker: the others run,
    // and the loop throws on the calling thread.
    std::vector<std::atomic<int>> runs(50);
    EXPECT_THROW(queue.parallelFor(runs.size(),
                                   [&](size_t i) {
                                       runs[i].fetch_add(1);
                                       if (i % 7 == 3) throw std::bad_alloc();
                                   }),
                 std::bad_alloc);
    for (size_t i = 0; i < runs.size(); ++i) EXPECT_EQ(runs[i].load(), 1) << "index " << i;
}

TEST(HTHeftGatherSignalSourceTest, DeliversSigintToAThreadAndRestoresItOnCancel)
{
    ASSERT_FALSE(sigintState().first);
    std::promise<void> handled;
    std::atomic<int> calls{0};
    std::thread::id handlerThread;
    auto source = HTSignalSource::create(SIGINT, [&] {
        handlerThread = std::this_thread::get_id();
        if (calls.fetch_add(1) == 1) handled.set_value();
    });
    ASSERT_NE(source, nullptr);
    EXPECT_EQ(sigintState(), std::make_pair(true, false));

    // A process-directed signal, as Ctrl-C sends, twice.
    kill(getpid(), SIGINT);
    while (calls.load() == 0) std::this_thread::sleep_for(1ms);
    kill(getpid(), SIGINT);
    ASSERT_EQ(handled.get_future().wait_for(10s), std::future_status::ready);
    EXPECT_NE(handlerThread, std::this_thread::get_id());

    source->cancel();
    EXPECT_EQ(calls.load(), 2);
    EXPECT_EQ(sigintState(), std::make_pair(false, true));
    source->cancel();  // a second cancel changes nothing

    // Without any signal, cancelling (here by destruction) stops it as well.
    HTSignalSource::create(SIGINT, [] { ADD_FAILURE() << "no signal was sent"; }).reset();
    EXPECT_EQ(sigintState(), std::make_pair(false, true));
}

// Sends SIGINT as the first of them begins, then waits at the gate.
struct HTGatedProcess : HTScriptedProcess {
    using HTScriptedProcess::HTScriptedProcess;
    void gatherData() override
    {
        std::call_once(*signalled, [] { kill(getpid(), SIGINT); });
        gate.wait();
        HTScriptedProcess::gatherData();
    }
    std::shared_future<void> gate;
    std::once_flag* signalled = nullptr;
};

TEST_F(HTHeftGatherTest, SigintSkipsProcessesNotYetBegunAndTheReportFollows)
{
    // Every process waits at a gate until the SIGINT handler has cancelled
    // the run, so at most one process per thread has begun by then.
    const size_t threads = HTWorkQueue::defaultThreadCount() + 1;  // the workers and the caller
    const size_t count = threads + 3;
    std::promise<void> gate;
    const std::shared_future<void> opened = gate.get_future().share();
    std::once_flag signalled;
    std::vector<std::shared_ptr<HTGatedProcess>> scripted;
    for (int32_t pid = 100; scripted.size() < count; ++pid) {
        scripted.push_back(std::make_shared<HTGatedProcess>(
            platform_, pid, std::vector<HTScriptedRegion>{{.objectId = static_cast<uint64_t>(pid), .dirty = kPage}}));
        scripted.back()->gate = opened;
        scripted.back()->signalled = &signalled;
    }

    // On a terminal Ctrl-C keeps its default action.
    platform_->terminals = {1};
    EXPECT_EQ(installCancelHandler(*platform_, [] {}), nullptr);
    platform_->terminals.clear();

    HTHeft heft(HTHeft::ProcessList(scripted.begin(), scripted.end()), settings_);
    std::unique_ptr<HTSignalSource> source = installCancelHandler(*platform_, [&] {
        heft.cancel();
        gate.set_value();
    });
    ASSERT_NE(source, nullptr);
    heft.gatherData();
    source->cancel();
    EXPECT_TRUE(sigintState().second);

    EXPECT_TRUE(heft.earlyExit());
    size_t gatheredCount = 0;
    for (const auto& p : scripted) gatheredCount += p->gatherCount();
    EXPECT_GE(gatheredCount, 1u);
    // Largest pid first: only the last `threads` of them may have begun.
    for (size_t i = 0; i + threads < count; ++i) EXPECT_EQ(scripted[i]->gatherCount(), 0) << "pid " << 100 + i;
    EXPECT_THAT(HTProcess::globalErrors(), ::testing::ElementsAre(HTHeft::kEarlyExitError));

    // Every process still has its block, and the report ends with the
    // error in the diagnostics.
    char* data = nullptr;
    size_t size = 0;
    FILE* out = open_memstream(&data, &size);
    heft.addOutputFormatter(std::make_shared<HTOutputFormatterText>(settings_, out));
    heft.printOutputVerbose(false, false);
    std::fclose(out);
    const std::string report(data, size);
    std::free(data);
    size_t headers = 0;
    for (size_t at = 0; (at = report.find("\tHeft: ", at)) != std::string::npos; ++at) ++headers;
    EXPECT_EQ(headers, count);
    EXPECT_NE(report.find(HTHeft::kEarlyExitError), std::string::npos) << report;
}

TEST_F(HTHeftGatherTest, ProcessesReadSideBySideShareOneLineOnStandardError)
{
    // Seven processes exit while threads read them side by side; one more
    // cannot be opened at all. Each story is told once, naming the
    // processes in pid order whichever thread read them.
    HTNoticeLog::standardError().take();
    HTHeft::ProcessList processes;
    for (int32_t pid = 501; pid <= 507; ++pid) {
        HTFakePlatform::Process& script = platform_->addProcess(pid, 1, "worker");
        script.regionFailureIndex = 0;
        auto process = std::make_shared<HTUserProcess>(platform_);
        ASSERT_TRUE(process->initWithBsdInfo(script.info));
        script.exited = true;
        processes.push_back(process);
    }
    HTFakePlatform::Process& locked = platform_->addProcess(600, 1, "locked");
    locked.taskResult = HT_KERN_ERRNO_BASE | EPERM;
    EXPECT_FALSE(HTUserProcess(platform_).initWithBsdInfo(locked.info));
    gathered(processes);
    EXPECT_EQ(HTNoticeLog::standardError().take(),
              (std::vector<std::string>{std::string("locked [600]: could not be opened: ") + std::strerror(EPERM),
                                        "worker [501], worker [502], worker [503], worker [504], worker [505] and 2 "
                                        "more: exited while being read; the report shows what was read, marked "
                                        "\"(process exited)\" (7 processes)"}));
}

}  // namespace
