// The toolkit's event loop: links, timers, user events, waiting and quitting.
#include "toolkit/application.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <boost/asio/post.hpp>
#include <memory>
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
