#include "nxbase/thread.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <exception>
#include <map>
#include <mutex>
#include <system_error>
#include <thread>

#include "nxbase/check.h"
#include "nxbase/logfile.h"
#include "toolkit/system.h"

namespace {

// The process-wide table of named recursive mutexes. Entries are shared
// pointers so that cleaning the table never frees a mutex a holder still uses.
class NamedLockRegistry {
  public:
    static NamedLockRegistry& Get() {
        // Leaked on purpose: named locks are taken during static destruction.
        static NamedLockRegistry* registry = new NamedLockRegistry();
        return *registry;
    }

    std::shared_ptr<std::recursive_mutex> Find(const std::string& name) {
        std::lock_guard<std::mutex> lock(mutex_);
        auto& entry = locks_[name];
        if (!entry) entry = std::make_shared<std::recursive_mutex>();
        return entry;
    }

    void Clear() {
        std::lock_guard<std::mutex> lock(mutex_);
        locks_.clear();
    }

    std::size_t Count() {
        std::lock_guard<std::mutex> lock(mutex_);
        return locks_.size();
    }

  private:
    std::mutex mutex_;
    std::map<std::string, std::shared_ptr<std::recursive_mutex>> locks_;
};

constexpr const char* kCleanCriticalSections = "CleanCriticalSections";

// Nice values for the three priorities, relative to the process's own nice
// value (a program started under `nice` keeps its threads below normal):
// normal, one step below, one step above, within the range Linux allows.
int NiceValue(ThreadPriorityTYPE priority) {
    const int base = toolkit::ProcessNiceValue();
    int step = priority == BELOW_NORMAL_PRIORITY ? 1 : priority == ABOVE_NORMAL_PRIORITY ? -1 : 0;
    return std::clamp(base + step, -20, 19);
}

bool IsValidPriority(int priority) {
    return priority >= NORMAL_PRIORITY && priority <= ABOVE_NORMAL_PRIORITY;
}

// Raising a priority needs privileges; a refusal leaves the thread as it is.
void ApplyNice(int systemThreadId, ThreadPriorityTYPE priority) {
    if (systemThreadId != 0) {
        toolkit::SetThreadNiceValue(static_cast<std::uint32_t>(systemThreadId),
                                    NiceValue(priority));
    }
}

}  // namespace

CriticalSection::CriticalSection(const char* name)
    : amName(name ? name : ""), pMutex(NamedLockRegistry::Get().Find(amName)) {
    pMutex->lock();
}

CriticalSection::~CriticalSection() {
    pMutex->unlock();
    if (amName == kCleanCriticalSections) NamedLockRegistry::Get().Clear();
}

std::size_t CriticalSection::NamedLockCount() {
    return NamedLockRegistry::Get().Count();
}

std::mutex Thread::smRunningMutex;
std::vector<std::string> Thread::smRunningThreads;

Thread::Thread(const std::string& id, ThreadPriorityTYPE priority)
    : amPriority(priority), amId(id) {}

Thread::~Thread() {
    amDestroying = true;
    if (!pHandle || !pHandle->joinable()) return;
    if (running.load()) {
        // The derived part is gone already, so the body may be running on a
        // destroyed object: say which thread, then stop it as well as we can.
        std::string text = "Thread \"" + amId +
                           "\" destroyed while running: a derived class must call KillThread "
                           "in its own destructor";
        Check::AssertFailed(text.c_str(), __FILE__, __LINE__);
    }
    stopRequested = true;
    JoinOrDetach();
}

void Thread::JoinOrDetach() {
    if (pHandle->get_id() == std::this_thread::get_id()) {
        pHandle->detach();
    } else {
        pHandle->join();
    }
}

void Thread::StartThread() {
    if (pHandle) {
        if (running.load()) return;  // already running: nothing to start
        // Finished but not killed: collect the old thread before a new one.
        if (pHandle->joinable()) JoinOrDetach();
        pHandle.reset();
    }
    {
        std::lock_guard<std::mutex> lock(smRunningMutex);
        if (std::find(smRunningThreads.begin(), smRunningThreads.end(), amId) ==
            smRunningThreads.end()) {
            smRunningThreads.push_back(amId);
        }
    }
    // Cleared here, before the body can run, so that a stop requested at any
    // moment after StartThread returns is seen by the body.
    stopRequested = false;
    exitCode = 0;
    running = true;
    amBodyEntered = false;
    try {
        pHandle = std::make_unique<std::thread>(&Thread::ThreadRoutine, this);
    } catch (...) {
        running = false;
        throw;
    }
    // Wait until the body runs (its first IsStopRequested() or its return), at
    // most a moment: an owner that destroys the object right after starting it
    // then gets the destructor's report, never a call through a half-destroyed
    // object.
    std::unique_lock<std::mutex> lock(amStartMutex);
    amStartCondition.wait_for(lock, std::chrono::milliseconds(100),
                              [this] { return amBodyEntered.load(); });
}

void Thread::MarkBodyEntered() const {
    if (amBodyEntered.load() || amBodyEntered.exchange(true)) return;
    std::lock_guard<std::mutex> lock(amStartMutex);
    amStartCondition.notify_all();
}

bool Thread::IsStopRequested() const {
    MarkBodyEntered();
    return stopRequested.load();
}

void Thread::ThreadRoutine(Thread* self) {
    self->systemThreadId = static_cast<int>(toolkit::CurrentThreadId());
    ApplyNice(self->systemThreadId, self->amPriority);
    unsigned int result = 0;
    try {
        if (!self->amDestroying.load()) result = self->Run();
    } catch (const std::exception& e) {
        LogFile::WriteToLog(String("!!! Thread Exception: ") + String(e.what()), String());
    } catch (...) {
        LogFile::WriteToLog(String("!!! Thread Exception: Unknown"), String());
    }
    self->exitCode = result;
    self->MarkBodyEntered();
    self->running = false;
}

void Thread::SetPriority(ThreadPriorityTYPE priority) {
    if (!pHandle || !IsValidPriority(priority)) return;
    ApplyNice(systemThreadId, priority);
}

void Thread::RequestStop() {
    stopRequested = true;
    RequestChildrenStop();
}

void Thread::StopThread() {
    stopRequested = true;
}

void Thread::KillThread() {
    KillChildThreads();
    StopThread();
    if (pHandle) {
        if (pHandle->joinable()) JoinOrDetach();
        pHandle.reset();
    }
    running = false;
    std::lock_guard<std::mutex> lock(smRunningMutex);
    auto at = std::find(smRunningThreads.begin(), smRunningThreads.end(), amId);
    if (at != smRunningThreads.end()) smRunningThreads.erase(at);
}

std::vector<std::string> Thread::GetRunningThreads() {
    std::lock_guard<std::mutex> lock(smRunningMutex);
    return smRunningThreads;
}

namespace nxbase {
namespace {

// A spinning thread's hint to the processor (x86's pause).
inline void Relax() {
#if defined(__x86_64__) || defined(__i386__)
    __builtin_ia32_pause();
#endif
}

// Helper threads kept between calls: starting one per call costs as much as
// converting tens of thousands of spectra. Idle helpers sleep on a condition
// variable (no wake-ups). A caller always works on its own job too and, once
// its parts are done, withdraws the places no helper has taken, so that it
// never waits for a helper busy elsewhere: nested and concurrent calls
// cannot deadlock. A child after fork() has none of its parent's threads:
// it makes a pool of its own and leaves the parent's (and its locks) alone.
class PartPool {
  public:
    // Without a lock, so that a child forked while another thread made the
    // pool cannot find one held: a pool made in vain had no thread yet.
    static PartPool& Instance() {
        static std::atomic<PartPool*> pool{nullptr};
        PartPool* current = pool.load(std::memory_order_acquire);
        while (current == nullptr || current->generation_ != toolkit::ForkGeneration()) {
            auto* fresh = new PartPool;  // the one kept is never deleted: helpers outlive main
            if (pool.compare_exchange_strong(current, fresh, std::memory_order_acq_rel)) {
                current = fresh;  // a parent's pool is left as it is
            } else {
                delete fresh;
            }
        }
        return *current;
    }

    // Runs `take` on the calling thread and on up to `helpers` pool threads.
    void Run(unsigned helpers, const std::function<void()>& take) {
        Job job(&take, helpers);
        {
            std::lock_guard<std::mutex> lock(mutex_);
            Grow(helpers);
            Push(&job);
        }
        // One sleeping helper per place, not the whole pool.
        for (unsigned i = 0; i < helpers; ++i) wake_.notify_one();
        take();
        std::unique_lock<std::mutex> lock(mutex_);
        auto at = std::find(jobs_.begin(), jobs_.end(), &job);
        if (at != jobs_.end()) jobs_.erase(at);
        queued_.store(jobs_.size(), std::memory_order_relaxed);
        job.finished.wait(lock, [&] { return job.running == 0; });
    }

  private:
    struct Job {
        Job(const std::function<void()>* work, unsigned helpers) : take(work), places(helpers) {}
        const std::function<void()>* take;
        unsigned places;       // helpers it may still take
        unsigned running = 0;  // helpers in it now
        std::condition_variable finished;
    };

    // A helper that has just finished looks for the next job for a moment
    // before it sleeps: a caller converting array after array then finds it
    // awake instead of paying the wake-up of a sleeping thread every time.
    // The moment is short enough that an idle pool costs nothing.
    void AwaitJob(std::unique_lock<std::mutex>& lock) {
        lock.unlock();
        const auto until = std::chrono::steady_clock::now() + kAwake;
        while (queued_.load(std::memory_order_relaxed) == 0 &&
               std::chrono::steady_clock::now() < until) {
            Relax();
        }
        lock.lock();
        wake_.wait(lock, [&] { return !jobs_.empty(); });
    }
    void Push(Job* job) {
        jobs_.push_back(job);
        queued_.store(jobs_.size(), std::memory_order_relaxed);
    }
    void Pop() {
        jobs_.pop_front();
        queued_.store(jobs_.size(), std::memory_order_relaxed);
    }

    // Starts helpers up to `count` (fewer when the system has no thread to
    // give; never more than kMaxHelpers, which calls asking more share).
    void Grow(unsigned count) {
        for (count = std::min(count, kMaxHelpers); threads_ < count; ++threads_) {
            try {
                std::thread([this] { Serve(); }).detach();
            } catch (const std::system_error&) {
                return;
            }
        }
    }

    void Serve() {
        std::unique_lock<std::mutex> lock(mutex_);
        for (;;) {
            if (jobs_.empty()) AwaitJob(lock);
            Job* job = jobs_.front();
            if (--job->places == 0) Pop();
            ++job->running;
            lock.unlock();
            (*job->take)();
            lock.lock();
            // Under the lock: the caller cannot see `running` fall and
            // destroy the job before this notification is done with it.
            if (--job->running == 0) job->finished.notify_all();
        }
    }

    static constexpr unsigned kMaxHelpers = 256;
    static constexpr std::chrono::microseconds kAwake{50};
    const unsigned generation_ = toolkit::ForkGeneration();
    std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<Job*> jobs_;
    std::atomic<std::size_t> queued_{0};  // jobs_.size(), for the look without the lock
    unsigned threads_ = 0;
};

}  // namespace

void RunInParts(std::size_t alCount, unsigned alThreads, std::size_t alMinPerThread,
                std::size_t alGranule, const std::function<void(std::size_t, std::size_t)>& fPart) {
    unsigned threads = alThreads ? alThreads : std::max(1u, std::thread::hardware_concurrency());
    threads = static_cast<unsigned>(std::min<std::size_t>(
        threads, std::max<std::size_t>(1, alCount / std::max<std::size_t>(1, alMinPerThread))));
    if (threads <= 1) {
        fPart(0, alCount);
        return;
    }
    // Eight parts per thread, taken in turn by whichever thread is free: a
    // core slowed by other work then takes fewer, instead of holding up
    // the call with a fixed share.
    const std::size_t granule = std::max<std::size_t>(1, alGranule);
    const std::size_t part =
        std::max(granule * 256, (alCount / (8 * threads) + granule - 1) / granule * granule);
    std::atomic<std::size_t> next{0};
    const std::function<void()> take = [&] {
        for (std::size_t first = next.fetch_add(part); first < alCount;
             first = next.fetch_add(part)) {
            fPart(first, std::min(part, alCount - first));
        }
    };
    PartPool::Instance().Run(threads - 1, take);
}

}  // namespace nxbase
