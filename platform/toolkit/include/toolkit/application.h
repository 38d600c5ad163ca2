// The toolkit's event loop: one boost::asio::io_context run by the
// user-interface thread. Timers, socket completions and posted user events
// are handlers on it, so they never run concurrently with each other.
//
// A GUI application drives the same context from its own main loop instead
// of Execute(): it watches GetLoopDescriptor() and calls Dispatch() when the
// descriptor is readable and before its loop goes to sleep, and installs a
// nested wait so that the library's waits turn the GUI's loop. The GLib and
// Qt adapters (nxbase/glibloop.h, nxbase/qtloop.h) do exactly that. Whatever
// drives it, it must be the one thread that also calls into the messaging
// classes.
#ifndef TOOLKIT_APPLICATION_H_
#define TOOLKIT_APPLICATION_H_

#include <array>
#include <atomic>
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/steady_timer.hpp>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <functional>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "nxbase/export.h"

// A bound member function taking void* and returning long: the toolkit's
// call-back. An unset link calls nothing and returns 0. Two links are equal
// when they bind the same member function to the same object.
class NXBASE_EXPORT Link {
  public:
    Link() = default;
    template <class T>
    Link(T* pObject, long (T::*pMember)(void*)) : call_(&Invoke<T>), object_(pObject) {
        static_assert(sizeof pMember <= sizeof member_, "member pointer too large");
        std::memcpy(member_.data(), &pMember, sizeof pMember);
    }

    long Call(void* pData) const { return call_ ? call_(*this, pData) : 0; }
    bool IsSet() const { return call_ != nullptr; }
    explicit operator bool() const { return IsSet(); }

    friend bool operator==(const Link& a, const Link& b) {
        return a.IsSet() == b.IsSet() && a.object_ == b.object_ && a.member_ == b.member_;
    }
    friend bool operator!=(const Link& a, const Link& b) { return !(a == b); }

  private:
    // The object and the member are kept as plain bytes, so that a link is
    // copied without an allocation: handlers are copied for every message.
    template <class T>
    static long Invoke(const Link& axLink, void* pData) {
        long (T::*member)(void*);
        std::memcpy(&member, axLink.member_.data(), sizeof member);
        return (static_cast<T*>(axLink.object_)->*member)(pData);
    }

    long (*call_)(const Link&, void*) = nullptr;
    void* object_ = nullptr;
    std::array<unsigned char, 2 * sizeof(void*)> member_{};
};

#define LINK(Class, pObject, Member) Link(pObject, &Class::Member)

class NXBASE_EXPORT Application {
  public:
    // The process's one application object.
    static Application& Get();

    boost::asio::io_context& GetContext() { return context_; }

    // Runs handlers until Quit(), sleeping while none is due. Handlers posted
    // before Execute run in it.
    void Execute();
    // Ends Execute() after the running handler returns, and every wait of
    // the library that is running (SendAndReceive, starting a peer). Any
    // thread may call it.
    void Quit();
    bool IsQuitting() const { return quitting_; }
    // How many times Quit() was called: a wait ends when it changes.
    unsigned long GetQuitCount() const { return quitCount_; }
    // Clears a Quit(), so that the loop can run again (tests).
    void ResetQuit();
    bool IsInExecute() const { return executing_ > 0; }

    // Runs the handlers that are ready, without blocking: Dispatch().
    void Reschedule();
    // Blocks until one handler ran or `timeout` passed; true when one ran.
    // With a nested wait installed, runs the GUI's loop instead (which
    // dispatches this one) and returns true.
    bool RunOneFor(std::chrono::milliseconds timeout);

    // How a RunUntil() ended.
    enum class WaitEnd { kReady, kGivenUp, kTimedOut, kQuit };
    // The one wait of the library: runs the loop (or the GUI's, see
    // SetNestedWait) until `ready()` is true, Quit() is called,
    // `keepWaiting()` (if set) says stop or `deadline` passes, in that order
    // of precedence. Both functions are asked before the first turn, after
    // every turn and at least every 50 ms; a handler a turn ran may destroy
    // whatever they look at, so they must hold what they need.
    WaitEnd RunUntil(const std::function<bool()>& ready,
                     const std::function<bool()>& keepWaiting = {},
                     std::chrono::steady_clock::time_point deadline =
                         std::chrono::steady_clock::time_point::max());

    // For a foreign main loop: a descriptor that becomes readable whenever a
    // handler is ready (a socket ready, a timer due, an event posted from
    // another thread). Handlers made ready by calls outside any handler, on
    // the loop's thread, are not announced: call Dispatch() also before the
    // foreign loop sleeps. Created on first use; throws std::system_error
    // when it cannot be.
    int GetLoopDescriptor();
    // Runs every ready handler without blocking; the number that ran.
    std::size_t Dispatch();
    // Dispatch() for a hook that must not run the foreign loop (GLib's
    // prepare): a handler that waits there runs this loop alone meanwhile.
    std::size_t DispatchWithoutNesting();
    // Runs the foreign loop once, for at most the given time. Installed by a
    // GUI adapter so that waits inside the library (SendAndReceive, a server
    // being started) keep the GUI alive; an empty function uninstalls it.
    using NestedWait = std::function<void(std::chrono::milliseconds)>;
    void SetNestedWait(NestedWait wait) { nestedWait_ = std::move(wait); }
    bool HasNestedWait() const { return static_cast<bool>(nestedWait_); }

    // True on the application's user-interface thread: the thread that last
    // drove the loop (Execute, Reschedule, RunOneFor), or, before the loop
    // ever ran, the thread that first asked for the application object.
    bool IsUserInterfaceThread() const { return std::this_thread::get_id() == uiThread_.load(); }

    // The waiting state of the user interface (busy cursor, input off),
    // passed to the UserInterface handler.
    void Wait(bool abWaiting);
    bool IsWaiting() const { return waiting_; }

    // Runs `handler` on the loop, after the running handler. Any thread may
    // post; a foreign loop hears of it through the loop descriptor.
    void Post(std::function<void()> handler);
    // Calls the user-event handler with (id, data) on the loop, as Post().
    void PostUserEvent(unsigned long alId, void* pData);
    void SetUserEventHandler(std::function<void(unsigned long, void*)> handler);

    // After fork() the child shares the parent's epoll set, timer and
    // wake-up descriptors. At its first use of the application object the
    // child takes descriptors of its own and runs these functions (the
    // transports let go of the parent's sockets there), so that nothing the
    // child does reaches the parent's loop. Children that exec or _exit are
    // untouched.
    void AddForkChildFunction(std::function<void()> fFunction);

  private:
    Application() = default;
    void AfterFork();
    void MarkUserInterfaceThread() { uiThread_.store(std::this_thread::get_id()); }
    void Wake();
    void RunOneTicked();
    void ArmWaitTick();

    boost::asio::io_context context_;
    NestedWait nestedWait_;
    // Held while a foreign loop drives this one: without work a poll stops
    // the context at once and leaves a readiness on the descriptor unread,
    // which would have the foreign loop spin.
    std::optional<boost::asio::executor_work_guard<boost::asio::io_context::executor_type>>
        foreignWork_;
    int dispatching_ = 0;         // Dispatch() calls running, nested ones included
    bool nestingBarred_ = false;  // inside DispatchWithoutNesting()
    int loopDescriptor_ = -1;     // an epoll set of the context's epoll set and wakeDescriptor_
    std::atomic<int> wakeDescriptor_{-1};   // an eventfd written by posts from other threads
    std::atomic<bool> wakePending_{false};  // set after each write to it
    std::function<void(unsigned long, void*)> userEventHandler_;
    std::vector<std::function<void()>> forkChildFunctions_;
    std::atomic<bool> quitting_{false};
    std::atomic<unsigned long> quitCount_{0};
    bool waiting_ = false;
    int executing_ = 0;
    std::atomic<std::thread::id> uiThread_{std::this_thread::get_id()};
    // Ends a long wait's turn every 50 ms. A timer armed for every turn costs
    // a round trip more than the rest of the loop: this one is armed by the
    // first wait, rearms itself while waits go on and stops at a tick that
    // finds none since the one before.
    boost::asio::steady_timer waitTick_{context_};
    bool waitTickArmed_ = false;
    bool waitedSinceTick_ = false;
};

// A one-shot timer on the application's loop: after Start() it calls its
// handler link once, `timeout` later, unless stopped.
class NXBASE_EXPORT Timer {
  public:
    Timer();
    virtual ~Timer();
    Timer(const Timer&) = delete;
    Timer& operator=(const Timer&) = delete;

    void SetTimeout(unsigned long alMilliseconds) { timeout_ = alMilliseconds; }
    unsigned long GetTimeout() const { return timeout_; }
    void SetTimeoutHdl(const Link& axHandler) { handler_ = axHandler; }
    const Link& GetTimeoutHdl() const { return handler_; }
    void Start();
    void Stop();
    bool IsActive() const { return active_; }

  protected:
    virtual void Fired();

  private:
    void Arm();

    boost::asio::steady_timer timer_;
    Link handler_;
    unsigned long timeout_ = 0;
    bool active_ = false;
    // Invalidates handlers of an earlier Start() or of a destroyed timer.
    std::shared_ptr<unsigned long> generation_ = std::make_shared<unsigned long>(0);

    friend class AutoTimer;
};

// A timer that restarts itself after every call of its handler.
class NXBASE_EXPORT AutoTimer : public Timer {
  protected:
    void Fired() override;
};

#endif  // TOOLKIT_APPLICATION_H_
