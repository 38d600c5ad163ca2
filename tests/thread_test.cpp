#include "nxbase/thread.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <future>
#include <mutex>
#include <random>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "log_test_util.h"
#include "nxbase/logfile.h"
#include "test_util.h"
#include "toolkit/eintr.h"
#include "toolkit/system.h"
#include "toolkit/userinterface.h"

namespace {

using namespace std::chrono_literals;

// Tests here read the log back: a log of this process's own, which no other
// test process writes or truncates.
::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

TEST(CriticalSection, NestsOnOneThreadAndExcludesOtherThreads) {
    std::atomic<bool> otherEntered{false};
    std::thread other;
    {
        CriticalSection outer("A");
        CriticalSection inner("A");  // recursive: must not deadlock
        other = std::thread([&] {
            CriticalSection section("A");
            otherEntered = true;
        });
        std::this_thread::sleep_for(50ms);
        EXPECT_FALSE(otherEntered.load());
        CriticalSection unrelated("B");  // another name does not block
    }
    other.join();
    EXPECT_TRUE(otherEntered.load());
}

TEST(CriticalSection, CountedIncrementsStayExactUnderContention) {
    long counter = 0;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&counter] {
            for (int i = 0; i < 20000; ++i) {
                CriticalSection section("Counter");
                ++counter;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(counter, 80000);
}

TEST(CriticalSection, CleanCriticalSectionsDropsEveryNamedLock) {
    { CriticalSection a("X1"); }
    EXPECT_GT(CriticalSection::NamedLockCount(), 0u);
    { CriticalSection clean("CleanCriticalSections"); }
    EXPECT_EQ(CriticalSection::NamedLockCount(), 0u);
    CriticalSection again("X1");  // usable afterwards
}

class Worker : public Thread {
  public:
    using Thread::Thread;
    std::promise<int> niceOfBody;
    bool throwInBody = false;

  protected:
    unsigned int Run() override {
        niceOfBody.set_value(getpriority(PRIO_PROCESS, toolkit::CurrentThreadId()));
        if (throwInBody) throw std::runtime_error("boom");
        while (!IsStopRequested()) std::this_thread::sleep_for(1ms);
        return 7;
    }
};

TEST(Thread, RunsUntilStopRequestedAndReportsStates) {
    Worker worker("worker-1", BELOW_NORMAL_PRIORITY);
    EXPECT_TRUE(worker.IsFinished());
    worker.SetPriority(ABOVE_NORMAL_PRIORITY);  // before start: no effect
    EXPECT_EQ(worker.GetPriority(), BELOW_NORMAL_PRIORITY);
    auto nice = worker.niceOfBody.get_future();
    worker.StartThread();
    EXPECT_TRUE(worker.IsRunning());
    auto running = Thread::GetRunningThreads();
    EXPECT_NE(std::find(running.begin(), running.end(), "worker-1"), running.end());
    // The body ran at the priority given to the constructor: one step below
    // normal, clamped at the weakest nice value when the test runs under nice 19.
    EXPECT_EQ(nice.get(), std::min(getpriority(PRIO_PROCESS, 0) + 1, 19));
    worker.RequestStop();
    worker.KillThread();
    EXPECT_TRUE(worker.IsFinished());
    EXPECT_EQ(worker.GetExitCode(), 7u);
    running = Thread::GetRunningThreads();
    EXPECT_EQ(std::find(running.begin(), running.end(), "worker-1"), running.end());
    worker.KillThread();  // on a finished thread: only unregisters again
}

TEST(Thread, ExceptionInBodyIsLoggedAndTheThreadEnds) {
    Worker worker("thrower", NORMAL_PRIORITY);
    worker.throwInBody = true;
    worker.StartThread();
    worker.niceOfBody.get_future().wait();
    worker.KillThread();
    EXPECT_TRUE(worker.IsFinished());
    std::string log = nxtest::ReadFile(LogFile::Instance()->GetFileName());
    EXPECT_THAT(log, HasSubstr("!!! Thread Exception: boom"));
}

// Runs until asked to stop and counts its runs; ends its thread itself.
class StopWorker : public Thread {
  public:
    explicit StopWorker(const std::string& id) : Thread(id, NORMAL_PRIORITY) {}
    ~StopWorker() override { KillThread(); }
    std::atomic<int> runs{0};

  protected:
    unsigned int Run() override {
        ++runs;
        while (!IsStopRequested()) std::this_thread::yield();
        return 3;
    }
};

TEST(Thread, StopRequestsRightAfterStartAreSeenAndFinishedThreadsRestart) {
    StopWorker worker("cycler");
    for (int cycle = 0; cycle < 2000; ++cycle) {
        worker.StartThread();
        if (cycle % 2 == 0) worker.RequestStop();
        worker.KillThread();  // must not hang: the body sees the request
        ASSERT_TRUE(worker.IsFinished());
    }
    EXPECT_EQ(worker.runs.load(), 2000);
    // Finished but not killed, then started again: the old thread is collected.
    for (int cycle = 0; cycle < 200; ++cycle) {
        worker.StartThread();
        worker.RequestStop();
        while (!worker.IsFinished()) std::this_thread::yield();
        ASSERT_EQ(worker.GetExitCode(), 3u);
    }
    worker.StartThread();
    worker.StartThread();  // running: left alone, no second registration
    auto running = Thread::GetRunningThreads();
    EXPECT_EQ(std::count(running.begin(), running.end(), "cycler"), 1);
    worker.KillThread();
    EXPECT_EQ(worker.runs.load(), 2201);
}

// A derived class that forgets to end its thread.
class CarelessWorker : public Thread {
  public:
    CarelessWorker() : Thread("careless", NORMAL_PRIORITY) {}

  protected:
    unsigned int Run() override {
        while (!IsStopRequested()) std::this_thread::yield();
        return 0;
    }
};

TEST(Thread, DestroyingARunningThreadIsReportedWithItsName) {
    auto ui = std::make_shared<RecordingUserInterface>(false);
    ScopedUserInterface scoped(ui);
    {
        CarelessWorker worker;
        worker.StartThread();
    }
    auto boxes = ui->Boxes();
    ASSERT_EQ(boxes.size(), 1u);
    EXPECT_THAT(boxes[0].text, HasSubstr("*****ASSERT*****"));
    EXPECT_THAT(boxes[0].text, HasSubstr("\"careless\" destroyed while running"));
}

// A read that a signal interrupts (its handler installed without
// SA_RESTART) is made again and gets the byte written after the signals.
TEST(RetryOnEintr, ACallASignalInterruptedIsMadeAgain) {
    int fds[2];
    ASSERT_EQ(::pipe(fds), 0);
    struct sigaction action {};
    struct sigaction previous {};
    action.sa_handler = [](int) {};
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(::sigaction(SIGUSR1, &action, &previous), 0);
    const pthread_t reader = ::pthread_self();
    std::atomic<int> calls{0};
    std::thread writer([&] {
        while (calls.load() < 2) {  // until one read was interrupted and made again
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
            ::pthread_kill(reader, SIGUSR1);
        }
        EXPECT_EQ(::write(fds[1], "x", 1), 1);
    });
    char byte = 0;
    const ssize_t n = toolkit::RetryOnEintr([&] {
        ++calls;
        return ::read(fds[0], &byte, 1);
    });
    writer.join();
    ::sigaction(SIGUSR1, &previous, nullptr);
    ::close(fds[0]);
    ::close(fds[1]);
    EXPECT_EQ(n, 1);
    EXPECT_EQ(byte, 'x');
    EXPECT_GE(calls.load(), 2);
}

// Random calls from four threads at once, a fifth of them calling again from
// inside a part: every index is done exactly once, by parts that start on
// the granule, and no call waits for another's helpers.
TEST(RunInParts, EveryIndexOnceFromCallersAtOnceAndFromInsideAPart) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::atomic<int> wrong{0};
    auto caller = [&](unsigned callerSeed) {
        std::mt19937 random(callerSeed);
        for (int call = 0; call < 40; ++call) {
            const std::size_t count = random() % 200000, granule = 1 + random() % 64;
            const unsigned threads = random() % 5;
            std::vector<std::atomic<unsigned char>> done(count);
            const bool nest = random() % 5 == 0;
            nxbase::RunInParts(
                count, threads, 1 + random() % 5000, granule,
                [&](std::size_t first, std::size_t n) {
                    if (first % granule != 0) ++wrong;
                    if (nest) {
                        nxbase::RunInParts(n, 2, 1, 1, [&](std::size_t f, std::size_t m) {
                            for (std::size_t i = first + f; i < first + f + m; ++i) ++done[i];
                        });
                        return;
                    }
                    for (std::size_t i = first; i < first + n; ++i) ++done[i];
                });
            for (std::size_t i = 0; i < count; ++i)
                if (done[i] != 1) ++wrong;
        }
    };
    std::vector<std::thread> callers;
    for (unsigned c = 0; c < 4; ++c) callers.emplace_back(caller, seed + c);
    for (std::thread& t : callers) t.join();
    EXPECT_EQ(wrong.load(), 0);
}

// A child forked while the parent's helpers are busy has none of them: its
// own calls are served by helpers of its own.
TEST(RunInParts, AForkedChildServesItsOwnCalls) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer cannot start threads in a child of a multi-threaded process";
#endif
    std::atomic<bool> stop{false};
    std::thread busy([&] {
        while (!stop)
            nxbase::RunInParts(400000, 2, 1, 1, [](std::size_t, std::size_t) {
                std::this_thread::sleep_for(std::chrono::microseconds(50));
            });
    });
    std::this_thread::sleep_for(20ms);
    const pid_t child = nxtest::Fork([] {
        // Slow parts, so that a helper surely takes some: two threads work.
        std::vector<std::atomic<int>> done(100000);
        std::mutex mutex;
        std::set<std::thread::id> workers;
        nxbase::RunInParts(done.size(), 2, 1, 1, [&](std::size_t first, std::size_t n) {
            for (std::size_t i = first; i < first + n; ++i) ++done[i];
            std::lock_guard<std::mutex> lock(mutex);
            workers.insert(std::this_thread::get_id());
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
        });
        const bool once =
            std::all_of(done.begin(), done.end(), [](const auto& d) { return d == 1; });
        return once ? (workers.size() == 2 ? 0 : 2) : 1;
    });
    stop = true;
    busy.join();
    int status = -1;
    for (int i = 0; i < 1000 && ::waitpid(child, &status, WNOHANG) == 0; ++i)
        std::this_thread::sleep_for(10ms);
    if (!WIFEXITED(status)) {
        ::kill(child, SIGKILL);
        ::waitpid(child, &status, 0);
        FAIL() << "the child hung in RunInParts";
    }
    EXPECT_EQ(WEXITSTATUS(status), 0) << "1: an index not done once; 2: no helper in the child";
}

}  // namespace
