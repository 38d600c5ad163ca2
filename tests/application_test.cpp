// The toolkit's event loop: links, timers, user events, waiting and quitting.
#include "toolkit/application.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <boost/asio/posix/stream_descriptor.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>
#include <memory>
#include <random>
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

// A wait that watches a socket beside the loop, at the top or inside a
// handler: whatever the loop holds (handlers an earlier turn left queued, a
// timer, a post from another thread) still runs, and the socket's bytes are
// read by the wait, in order. A handler left unrun ends the wait at its
// deadline.
TEST(EventLoop, AWaitOnASocketStillRunsEveryHandlerTheLoopHolds) {
    const unsigned seed = std::random_device{}();
    std::mt19937 random(seed);
    Application& app = Application::Get();
    int sockets[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, sockets), 0);
    std::string received, sent;
    Application::Awaited awaited{sockets[0], [&] {
                                     char buffer[64];
                                     for (ssize_t n; (n = ::recv(sockets[0], buffer, 64, 0)) > 0;)
                                         received.append(buffer, static_cast<std::size_t>(n));
                                     return sockets[0];
                                 }};
    // The loop watches the socket too, as it does a channel's: a wait inside
    // a handler reads it only so.
    boost::asio::posix::stream_descriptor watch(app.GetContext(), ::dup(sockets[0]));
    std::function<void()> arm = [&] {
        watch.async_wait(boost::asio::posix::stream_descriptor::wait_read,
                         [&](const boost::system::error_code& error) {
                             if (error) return;
                             awaited.read();
                             arm();
                         });
    };
    arm();
    for (int round = 0; round < 300; ++round) {
        int ran = 0, expected = 0;
        auto count = [&ran] { ++ran; };
        boost::asio::steady_timer timer(app.GetContext());
        if (random() % 2 == 0) {
            ++expected;
            timer.expires_after(std::chrono::microseconds(random() % 3000));
            timer.async_wait([&](const boost::system::error_code&) { ++ran; });
        }
        const auto delay = std::chrono::microseconds(random() % 2000);
        std::string word = random() % 2 == 0 ? std::to_string(round) + ";" : "";
        const bool post = random() % 2 == 0;
        expected += post ? 1 : 0;
        std::thread other([&, delay, word, post] {
            std::this_thread::sleep_for(delay);
            if (post) app.Post(count);
            if (!word.empty()) (void)::send(sockets[1], word.data(), word.size(), 0);
        });
        sent += word;
        auto wait = [&] {
            auto end = app.RunUntil([&] { return ran == expected && received == sent; }, {},
                                    std::chrono::steady_clock::now() + 5s, awaited);
            EXPECT_EQ(end, Application::WaitEnd::kReady)
                << "seed " << seed << " round " << round << ": " << ran << " of " << expected
                << " handlers ran, read \"" << received << "\" of \"" << sent << "\"";
        };
        // Handlers queued behind the one the turn runs, which waits or not.
        const bool inHandler = random() % 2 == 0;
        const int behind = static_cast<int>(random() % 3);
        expected += behind + (inHandler ? 0 : 1);
        boost::asio::post(app.GetContext(), inHandler ? std::function<void()>(wait) : count);
        for (int i = 0; i < behind; ++i) boost::asio::post(app.GetContext(), count);
        ASSERT_TRUE(app.RunOneFor(1s));
        if (!inHandler) wait();
        other.join();
        if (HasFailure()) break;
    }
    watch.close();
    ::close(sockets[0]);
    ::close(sockets[1]);
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
