#include "nxbase/thread.h"

#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <exception>
#include <map>

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
    errno = 0;
    int base = getpriority(PRIO_PROCESS, static_cast<id_t>(getpid()));
    if (base == -1 && errno != 0) base = 0;
    int step = priority == BELOW_NORMAL_PRIORITY ? 1 : priority == ABOVE_NORMAL_PRIORITY ? -1 : 0;
    return std::clamp(base + step, -20, 19);
}

bool IsValidPriority(int priority) {
    return priority >= NORMAL_PRIORITY && priority <= ABOVE_NORMAL_PRIORITY;
}

// Raising a priority needs privileges; a refusal leaves the thread as it is.
void ApplyNice(int systemThreadId, ThreadPriorityTYPE priority) {
    if (systemThreadId != 0) {
        setpriority(PRIO_PROCESS, static_cast<id_t>(systemThreadId), NiceValue(priority));
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
    if (pHandle && pHandle->joinable()) {
        stopRequested = true;
        if (pHandle->get_id() == std::this_thread::get_id()) {
            pHandle->detach();
        } else {
            pHandle->join();
        }
    }
}

void Thread::StartThread() {
    {
        std::lock_guard<std::mutex> lock(smRunningMutex);
        smRunningThreads.push_back(amId);
    }
    running = true;
    pHandle = std::make_unique<std::thread>(&Thread::ThreadRoutine, this);
    // The new thread applies the stored priority itself once its system id is known.
}

void Thread::ThreadRoutine(Thread* self) {
    self->systemThreadId = static_cast<int>(toolkit::CurrentThreadId());
    ApplyNice(self->systemThreadId, self->amPriority);
    self->running = true;
    self->stopRequested = false;
    unsigned int result = 0;
    try {
        result = self->Run();
    } catch (const std::exception& e) {
        LogFile::WriteToLog(String("!!! Thread Exception: ") + String(e.what()), String());
    } catch (...) {
        LogFile::WriteToLog(String("!!! Thread Exception: Unknown"), String());
    }
    self->exitCode = result;
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
        if (pHandle->joinable()) {
            if (pHandle->get_id() == std::this_thread::get_id()) {
                pHandle->detach();
            } else {
                pHandle->join();
            }
        }
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
