// The toolkit's event loop: links, timers, user events, waiting and quitting.
#include "toolkit/application.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <boost/asio/post.hpp>
#include <memory>
#include <random>
#include <string>
#include <thread>

#include "toolkit/userinterface.h"

namespace {

using namespace std::chrono_literals;

struct Counter {
    int calls = 0;
    void* last = nullptr;
    long Count(void* data) {
        ++calls;
        last = data;
        return calls;
    }
    long Other(void*) { return -1; }
};

TEST(Link, CallsItsMemberAndComparesByObjectAndMember) {
    Counter a, b;
    Link unset;
    EXPECT_FALSE(unset.IsSet());
    EXPECT_EQ(unset.Call(nullptr), 0);
    Link count = LINK(Counter, &a, Count);
    int payload = 0;
    EXPECT_EQ(count.Call(&payload), 1);
    EXPECT_EQ(a.last, &payload);
    EXPECT_EQ(count, LINK(Counter, &a, Count));
    EXPECT_NE(count, LINK(Counter, &b, Count));
    EXPECT_NE(count, LINK(Counter, &a, Other));
    EXPECT_NE(count, unset);
    EXPECT_EQ(unset, Link());
}

TEST(EventLoop, TimersFireInOrderAutoTimersRepeatAndStoppedTimersStaySilent) {
    Application& app = Application::Get();
    app.ResetQuit();
    std::vector<std::string> fired;
    struct Recorder {
        std::vector<std::string>* fired;
        std::string name;
        long Fire(void*) {
            fired->push_back(name);
            return 0;
        }
    };
    Recorder late{&fired, "late"}, early{&fired, "early"}, tick{&fired, "tick"},
        never{&fired, "never"};
    Timer lateTimer, earlyTimer, stopped;
    lateTimer.SetTimeout(40);
    lateTimer.SetTimeoutHdl(LINK(Recorder, &late, Fire));
    earlyTimer.SetTimeout(5);
    earlyTimer.SetTimeoutHdl(LINK(Recorder, &early, Fire));
    stopped.SetTimeout(1);
    stopped.SetTimeoutHdl(LINK(Recorder, &never, Fire));
    AutoTimer ticker;
    ticker.SetTimeout(10);
    ticker.SetTimeoutHdl(LINK(Recorder, &tick, Fire));
    lateTimer.Start();
    earlyTimer.Start();
    stopped.Start();
    stopped.Stop();
    ticker.Start();
    {
        Timer destroyed;  // a timer destroyed while armed never calls back
        destroyed.SetTimeout(1);
        destroyed.SetTimeoutHdl(LINK(Recorder, &never, Fire));
        destroyed.Start();
    }
    auto until = std::chrono::steady_clock::now() + 100ms;
    while (std::chrono::steady_clock::now() < until) app.RunOneFor(10ms);
    ticker.Stop();
    ASSERT_FALSE(fired.empty());
    EXPECT_EQ(fired.front(), "early");
    EXPECT_EQ(std::count(fired.begin(), fired.end(), "late"), 1);
    EXPECT_GE(std::count(fired.begin(), fired.end(), "tick"), 5);
    EXPECT_EQ(std::count(fired.begin(), fired.end(), "never"), 0);
    EXPECT_FALSE(lateTimer.IsActive());
}

TEST(EventLoop, UserEventsRunAfterTheCurrentHandlerAndQuitEndsExecute) {
    Application& app = Application::Get();
    app.ResetQuit();
    std::vector<unsigned long> events;
    int marker = 0;
    app.SetUserEventHandler([&](unsigned long id, void* data) {
        events.push_back(id);
        EXPECT_EQ(data, &marker);
        EXPECT_TRUE(app.IsInExecute());
        if (id == 2) app.Quit();
    });
    boost::asio::post(app.GetContext(), [&] {
        app.PostUserEvent(1234, &marker);
        events.push_back(0);  // still in this handler: the event comes after
        app.PostUserEvent(2, &marker);
    });
    app.Execute();
    EXPECT_EQ(events, (std::vector<unsigned long>{0, 1234, 2}));
    EXPECT_FALSE(app.IsInExecute());
    app.ResetQuit();
    app.SetUserEventHandler(nullptr);
}

// Whether the loop descriptor becomes readable within `ms`.
bool Readable(int descriptor, int ms) {
    pollfd entry{descriptor, POLLIN, 0};
    return ::poll(&entry, 1, ms) == 1;
}

// What a foreign main loop relies on: the descriptor is readable when a timer
// is due or another thread posted, not before and not after the dispatch.
TEST(EventLoop, TheLoopDescriptorIsReadableExactlyWhileAHandlerIsDue) {
    Application& app = Application::Get();
    const int descriptor = app.GetLoopDescriptor();
    app.Dispatch();
    EXPECT_FALSE(Readable(descriptor, 0));

    Counter timerCalls;
    Timer timer;
    timer.SetTimeout(30);
    timer.SetTimeoutHdl(LINK(Counter, &timerCalls, Count));
    auto start = std::chrono::steady_clock::now();
    timer.Start();
    EXPECT_FALSE(Readable(descriptor, 0));
    ASSERT_TRUE(Readable(descriptor, 2000));
    EXPECT_GE(std::chrono::steady_clock::now() - start, 25ms);
    EXPECT_GE(app.Dispatch(), 1u);
    EXPECT_EQ(timerCalls.calls, 1);
    EXPECT_FALSE(Readable(descriptor, 0)) << "still readable after the dispatch: a busy loop";

    std::vector<unsigned long> events;
    app.SetUserEventHandler([&](unsigned long id, void*) { events.push_back(id); });
    std::thread([&app] { app.PostUserEvent(7, nullptr); }).join();
    ASSERT_TRUE(Readable(descriptor, 2000)) << "a post from another thread was not announced";
    app.Dispatch();
    EXPECT_EQ(events, std::vector<unsigned long>{7});
    EXPECT_FALSE(Readable(descriptor, 0));
    app.SetUserEventHandler(nullptr);

    // With a nested wait installed the library's waits turn the foreign loop.
    std::vector<long> turns;
    app.SetNestedWait(
        [&turns](std::chrono::milliseconds limit) { turns.push_back(limit.count()); });
    app.RunOneFor(15ms);
    app.SetNestedWait({});
    EXPECT_EQ(turns, std::vector<long>{15});
}

// Random waits against a model: a timer that makes the wait ready at T and a
// deadline D (or none) give kReady near T when T comes first, else kTimedOut
// near D; the keep-waiting function is asked at least every 50 ms however
// long the wait; after the waits the loop falls asleep (no tick left armed).
TEST(EventLoop, RandomWaitsEndAsTheirModelSaysAndLeaveTheLoopAsleep) {
    using Clock = std::chrono::steady_clock;
    Application& app = Application::Get();
    app.ResetQuit();
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    for (int round = 0; round < 12; ++round) {
        const auto readyAt = std::chrono::milliseconds(random() % 260);
        const bool bounded = random() % 2 == 0;
        const auto deadlineIn = std::chrono::milliseconds(random() % 260);
        // Too close to call on a loaded machine.
        if (bounded && (readyAt > deadlineIn ? readyAt - deadlineIn : deadlineIn - readyAt) < 40ms)
            continue;
        SCOPED_TRACE("round " + std::to_string(round));
        bool ready = false;
        // Before the timer: it expires readyAt after its making, not after a later now.
        const auto start = Clock::now();
        boost::asio::steady_timer trigger(app.GetContext(), readyAt);
        trigger.async_wait([&](const boost::system::error_code& error) { ready = !error; });
        std::vector<Clock::time_point> asked;
        auto end =
            app.RunUntil([&] { return ready; }, [&] { return asked.push_back(Clock::now()), true; },
                         bounded ? start + deadlineIn : Clock::time_point::max());
        const auto took = Clock::now() - start;
        const bool readyFirst = !bounded || readyAt < deadlineIn;
        EXPECT_EQ(end, readyFirst ? Application::WaitEnd::kReady : Application::WaitEnd::kTimedOut);
        EXPECT_GE(took, readyFirst ? readyAt : deadlineIn);
        EXPECT_LT(took, (readyFirst ? readyAt : deadlineIn) + 250ms);
        asked.push_back(Clock::now());
        for (std::size_t i = 1; i < asked.size(); ++i)
            EXPECT_LT((asked[i] - asked[i - 1]) / 1ms, 150);
        trigger.cancel();
        app.GetContext().poll();
    }
    // At most two ticks after the last wait (one finds that wait, the next none).
    std::size_t ran = 0;
    for (auto until = Clock::now() + 300ms; Clock::now() < until;)
        ran += app.GetContext().run_one_until(until);
    EXPECT_LE(ran, 2u);
    EXPECT_EQ(app.GetContext().run_one_for(200ms), 0u);
}

TEST(EventLoop, WaitingStateAndTopWindowGoThroughTheUserInterface) {
    auto ui = std::make_shared<RecordingUserInterface>();
    ScopedUserInterface scoped(ui);
    Application::Get().Wait(true);
    EXPECT_TRUE(Application::Get().IsWaiting());
    Application::Get().Wait(false);
    UserInterface::Current()->EnableTopWindow(false);
    EXPECT_FALSE(UserInterface::Current()->IsTopWindowEnabled());
    EXPECT_EQ(ui->Events(), (std::vector<std::string>{"wait 1", "wait 0", "enable 0"}));
    // Without a GUI there is no window and nothing to switch.
    StderrUserInterface plain;
    EXPECT_FALSE(plain.HasTopWindow());
}

}  // namespace
