// CriticalSection is a scoped lock on a process-wide recursive mutex chosen by
// name; Thread is a base class for named worker threads with cooperative stop
// requests. Named locks may be taken from any thread.
#ifndef NXBASE_THREAD_H_
#define NXBASE_THREAD_H_

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "nxbase/export.h"

class NXBASE_EXPORT CriticalSection {
  public:
    // Finds or creates the mutex named `name` and enters it (recursively).
    explicit CriticalSection(const char* name);
    // Leaves the mutex. Leaving "CleanCriticalSections" destroys every named
    // mutex: take it once at the very end of the process.
    virtual ~CriticalSection();
    CriticalSection(const CriticalSection&) = delete;
    CriticalSection& operator=(const CriticalSection&) = delete;

    // Number of named mutexes alive (for diagnostics and tests).
    static std::size_t NamedLockCount();

  private:
    std::string amName;
    std::shared_ptr<std::recursive_mutex> pMutex;
};

enum ThreadPriorityTYPE {
    NORMAL_PRIORITY = 0,
    BELOW_NORMAL_PRIORITY = 1,
    ABOVE_NORMAL_PRIORITY = 2
};

class NXBASE_EXPORT Thread {
  public:
    Thread(const std::string& id, ThreadPriorityTYPE priority);
    // A derived class ends its thread in its own destructor (KillThread):
    // by the time this base destructor runs, the derived part that Run()
    // uses is gone. A thread still running here is reported as an assertion
    // naming the thread, then stopped and joined.
    virtual ~Thread();
    Thread(const Thread&) = delete;
    Thread& operator=(const Thread&) = delete;

    // Registers the id in smRunningThreads, starts the body on a new thread
    // and applies the stored priority. A stop request made at any time after
    // this call is seen by the body. A finished thread may be started again
    // (with or without KillThread in between); a running one is left alone.
    void StartThread();
    // Applies the priority to a started thread; the stored priority does not change.
    void SetPriority(ThreadPriorityTYPE priority);
    ThreadPriorityTYPE GetPriority() const { return amPriority; }
    // Asks the body to return (it polls IsStopRequested()).
    void RequestStop();
    // Requests the stop and joins: Linux has no safe forced termination.
    // Closes the handle and unregisters the id; callable in any state.
    void KillThread();

    bool IsRunning() const { return running.load(); }
    bool IsFinished() const { return !running.load(); }
    const std::string& GetId() const { return amId; }
    // Exit code of the body once it returned (0 after an exception).
    unsigned int GetExitCode() const { return exitCode.load(); }

    static std::vector<std::string> GetRunningThreads();

  protected:
    virtual unsigned int Run() = 0;
    virtual void StopThread();
    virtual void RequestChildrenStop() {}
    virtual void KillChildThreads() {}
    bool IsStopRequested() const;

  private:
    static void ThreadRoutine(Thread* self);
    void JoinOrDetach();
    void MarkBodyEntered() const;
    void ApplyPriority();

    std::unique_ptr<std::thread> pHandle;
    ThreadPriorityTYPE amPriority;
    std::atomic<bool> stopRequested{false};
    std::atomic<bool> running{false};
    std::string amId;
    std::atomic<unsigned int> exitCode{0};
    std::atomic<int> systemThreadId{0};
    mutable std::mutex amStartMutex;
    mutable std::condition_variable amStartCondition;
    mutable std::atomic<bool> amBodyEntered{false};
    std::atomic<bool> amDestroying{false};

    static std::mutex smRunningMutex;
    static std::vector<std::string> smRunningThreads;
};

namespace nxbase {

// Runs fPart(first, count) over [0, alCount) on up to alThreads threads (0:
// one per core; fewer when alCount / alMinPerThread is smaller), the calling
// thread one of them. The range is cut into parts whose starts are multiples
// of alGranule, eight or so per thread, taken by whichever thread is free;
// the call returns when all are done. The other threads are kept between
// calls (they look for work for 50 µs, then sleep; a forked child starts its
// own); a call from one
// of them, or from several threads at once, is served as helpers come free,
// the calling thread always working too. With one thread, or when no thread
// can be started, the work is done on the calling thread. fPart must not
// throw.
NXBASE_EXPORT void RunInParts(std::size_t alCount, unsigned alThreads, std::size_t alMinPerThread,
                              std::size_t alGranule,
                              const std::function<void(std::size_t, std::size_t)>& fPart);

}  // namespace nxbase

#endif  // NXBASE_THREAD_H_
