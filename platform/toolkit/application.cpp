#include "toolkit/application.h"

#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <boost/asio/post.hpp>
#include <cerrno>
#include <system_error>
#include <utility>

#include "toolkit/arrival.h"
#include "toolkit/userinterface.h"

#if !defined(BOOST_ASIO_HAS_EPOLL) || !defined(BOOST_ASIO_HAS_TIMERFD)
#error "the loop descriptor needs asio's epoll reactor with timerfd timers"
#endif

namespace {

// The longest turn of a wait: how often its functions are asked.
constexpr std::chrono::milliseconds kLongestTurn(50);

[[noreturn]] void ThrowErrno(const char* asWhat) {
    throw std::system_error(errno, std::generic_category(), asWhat);
}

void Watch(int aEpoll, int aDescriptor) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = aDescriptor;
    if (::epoll_ctl(aEpoll, EPOLL_CTL_ADD, aDescriptor, &event) != 0) ThrowErrno("epoll_ctl");
}

// Gives a variable a value for the lifetime of a scope, exceptions included.
template <class T>
class ScopedValue {
  public:
    ScopedValue(T& axVariable, T axValue) : amVariable(axVariable), amOld(axVariable) {
        amVariable = axValue;
    }
    ~ScopedValue() { amVariable = amOld; }
    ScopedValue(const ScopedValue&) = delete;
    ScopedValue& operator=(const ScopedValue&) = delete;

  private:
    T& amVariable;
    T amOld;
};

std::atomic<bool> gForkedChild{false};

void MarkForkedChild() {
    gForkedChild.store(true);  // all a fork handler may safely do
}

}  // namespace

Application& Application::Get() {
    // Never destroyed: handlers of objects that outlive main may still refer to it.
    static Application* application = [] {
        ::pthread_atfork(nullptr, nullptr, &MarkForkedChild);
        return new Application();
    }();
    if (gForkedChild.load(std::memory_order_relaxed)) [[unlikely]]
        application->AfterFork();
    return *application;
}

void Application::AfterFork() {
    if (!gForkedChild.exchange(false)) return;
    context_.notify_fork(boost::asio::execution_context::fork_child);
    // The foreign loop's descriptors are the parent's too: the child's own
    // are made on demand. The old ones stay open (closing the wake-up eventfd
    // changes nothing for the parent, but a reused number would confuse).
    loopDescriptor_ = -1;
    wakeDescriptor_ = -1;
    wakePending_ = false;
    foreignWork_.reset();
    nestedWait_ = nullptr;
    uiThread_.store(std::this_thread::get_id());
    for (const auto& function : forkChildFunctions_) function();
}

void Application::AddForkChildFunction(std::function<void()> fFunction) {
    forkChildFunctions_.push_back(std::move(fFunction));
}

void Application::Execute() {
    MarkUserInterfaceThread();
    ++executing_;
    // Sleeps until a handler is due: Quit() stops the context to end it.
    auto work = boost::asio::make_work_guard(context_);
    while (!quitting_) {
        if (context_.stopped()) context_.restart();
        context_.run_one();
    }
    --executing_;
}

void Application::Quit() {
    quitting_ = true;
    ++quitCount_;
    context_.stop();
    Wake();
}

void Application::ResetQuit() {
    quitting_ = false;
}

void Application::Reschedule() {
    Dispatch();
}

bool Application::RunOneFor(std::chrono::milliseconds timeout) {
    MarkUserInterfaceThread();
    if (nestedWait_ && !nestingBarred_) {
        nestedWait_(timeout);
        return true;
    }
    if (context_.stopped()) context_.restart();
    bool ran = context_.run_one_for(timeout) > 0;
    return ran;
}

Application::WaitEnd Application::RunUntil(const std::function<bool()>& ready,
                                           const std::function<bool()>& keepWaiting,
                                           std::chrono::steady_clock::time_point deadline) {
    using namespace std::chrono;
    const unsigned long quits = quitCount_.load();
    while (true) {
        if (ready()) return WaitEnd::kReady;
        // Before the keep-waiting function, which may ask a person.
        if (quitCount_.load() != quits) return WaitEnd::kQuit;
        if (keepWaiting && !keepWaiting()) return WaitEnd::kGivenUp;
        auto now = steady_clock::now();
        if (now >= deadline) return WaitEnd::kTimedOut;
        // Rounded up, so that a turn ending just before the deadline is not
        // followed by turns of 0 ms.
        auto left = deadline - now;
        if (left < kLongestTurn) {
            RunOneFor(duration_cast<milliseconds>(left) + milliseconds(1));
        } else if (nestedWait_ && !nestingBarred_) {
            RunOneFor(kLongestTurn);
        } else {
            RunOneTicked();
        }
    }
}

// One turn of a wait with no deadline within the tick: blocks until a
// handler ran, the tick's included.
void Application::RunOneTicked() {
    MarkUserInterfaceThread();
    if (!waitTickArmed_) ArmWaitTick();
    waitedSinceTick_ = true;
    if (context_.stopped()) context_.restart();
    context_.run_one();
}

void Application::ArmWaitTick() {
    waitTickArmed_ = true;
    waitTick_.expires_after(kLongestTurn);
    waitTick_.async_wait([this](const boost::system::error_code& error) {
        waitTickArmed_ = false;
        const bool waited = std::exchange(waitedSinceTick_, false);
        if (!error && waited) ArmWaitTick();
    });
}

int Application::GetLoopDescriptor() {
    if (loopDescriptor_ >= 0) return loopDescriptor_;
    int loop = ::epoll_create1(EPOLL_CLOEXEC);
    if (loop < 0) ThrowErrno("epoll_create1");
    int wake = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    try {
        if (wake < 0) ThrowErrno("eventfd");
        Watch(loop, toolkit::ReactorDescriptor(context_));
        Watch(loop, wake);
    } catch (...) {
        ::close(loop);
        if (wake >= 0) ::close(wake);
        throw;
    }
    wakeDescriptor_ = wake;
    loopDescriptor_ = loop;
    foreignWork_.emplace(context_.get_executor());
    return loopDescriptor_;
}

std::size_t Application::Dispatch() {
    MarkUserInterfaceThread();
    // Read only after a Wake(): a message's round trip should cost no call
    // that finds nothing. The flag is raised after the write, so a counter
    // written after this read is read by a later Dispatch().
    if (wakePending_.exchange(false)) {
        eventfd_t count;
        (void)::eventfd_read(wakeDescriptor_, &count);
    }
    if (context_.stopped()) context_.restart();
    ScopedValue<int> depth(dispatching_, dispatching_ + 1);
    return context_.poll();
}

std::size_t Application::DispatchWithoutNesting() {
    ScopedValue<bool> barred(nestingBarred_, true);
    return Dispatch();
}

void Application::Wake() {
    if (wakeDescriptor_ < 0) return;
    (void)::eventfd_write(wakeDescriptor_, 1);
    wakePending_.store(true);
}

void Application::Wait(bool abWaiting) {
    waiting_ = abWaiting;
    UserInterface::Current()->SetWaiting(abWaiting);
}

void Application::Post(std::function<void()> handler) {
    boost::asio::post(context_, std::move(handler));
    // asio wakes a thread only while one blocks inside it: a foreign loop
    // sleeping on the loop descriptor, or about to, hears of the handler
    // only so. Inside Dispatch() the running poll takes it anyway.
    if (!IsUserInterfaceThread() || dispatching_ == 0) Wake();
}

void Application::PostUserEvent(unsigned long alId, void* pData) {
    Post([this, alId, pData] {
        if (userEventHandler_) userEventHandler_(alId, pData);
    });
}

void Application::SetUserEventHandler(std::function<void(unsigned long, void*)> handler) {
    userEventHandler_ = std::move(handler);
}

Timer::Timer() : timer_(Application::Get().GetContext()) {}

Timer::~Timer() {
    Application::Get();  // a forked child's timers are its own first
    ++*generation_;
    timer_.cancel();
}

void Timer::Start() {
    Application::Get();
    active_ = true;
    Arm();
}

void Timer::Stop() {
    Application::Get();
    active_ = false;
    ++*generation_;
    timer_.cancel();
}

void Timer::Arm() {
    unsigned long generation = ++*generation_;
    std::weak_ptr<unsigned long> alive = generation_;
    timer_.expires_after(std::chrono::milliseconds(timeout_));
    timer_.async_wait([this, alive, generation](const boost::system::error_code& error) {
        auto current = alive.lock();
        if (error || !current || *current != generation) return;
        Fired();
    });
}

void Timer::Fired() {
    active_ = false;
    handler_.Call(this);
}

void AutoTimer::Fired() {
    Arm();  // the next period starts before the handler, as a periodic timer does
    GetTimeoutHdl().Call(this);
}
