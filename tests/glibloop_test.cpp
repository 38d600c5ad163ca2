// The library's loop inside a GLib main loop: an idle connected application
// sleeps, a blocking wait keeps GLib turning, messages are handled as soon
// as they come, and asynchronous sends end in each of their outcomes.
#include "nxbase/glibloop.h"

#include <gtest/gtest.h>

#include <functional>

#include "gui_test_util.h"

namespace {

using namespace std::chrono_literals;

// Iterates the default context until `done` or `limit`; false on the time-out.
bool IterateUntil(const std::function<bool()>& done, std::chrono::milliseconds limit = 10s) {
    return nxtest::Until(done, limit, [] {
        // A short time-out bounds each sleep, so that `done` is asked again.
        guint limit = g_timeout_add(
            10, [](gpointer) -> gboolean { return G_SOURCE_REMOVE; }, nullptr);
        g_main_context_iteration(nullptr, TRUE);
        if (GSource* left = g_main_context_find_source_by_id(nullptr, limit))
            g_source_destroy(left);
    });
}

class GlibLoopTest : public ::testing::Test {
  protected:
    void TearDown() override { nxbase::glib::Detach(); }
    nxtest::GuiSandbox gui;
};

TEST_F(GlibLoopTest, AConnectedIdleApplicationSleepsAndABlockingWaitKeepsGLibTurning) {
    PostOffice* office = PostOffice::CreatePostOffice("GlibTester");
    nxbase::glib::Attach();
    int ticks = 0;
    guint ticker = g_timeout_add(
        1,
        [](gpointer count) -> gboolean { return ++*static_cast<int*>(count), G_SOURCE_CONTINUE; },
        &ticks);
    // Starting the server and connecting wait inside SendAndReceive: GLib runs meanwhile.
    MyMemoryBlock send, answer;
    send << static_cast<unsigned char>(2);
    ASSERT_TRUE(office->SendAndReceive("LumaServer", CONNECT, send, answer))
        << office->GetLastError();
    EXPECT_GT(ticks, 0) << "GLib's sources did not run during the wait";
    g_source_remove(ticker);

    // Idle for 10 s with the channel open: the loop thread wakes at most once a second.
    GMainLoop* loop = g_main_loop_new(nullptr, FALSE);
    g_timeout_add_seconds(
        10,
        [](gpointer l) -> gboolean {
            return g_main_loop_quit(static_cast<GMainLoop*>(l)), G_SOURCE_REMOVE;
        },
        loop);
    std::uint64_t wakeUpsBefore = nxbase::glib::WakeUps();
    long switchesBefore = nxtest::ThreadWakeUps();
    g_main_loop_run(loop);
    std::uint64_t wakeUps = nxbase::glib::WakeUps() - wakeUpsBefore;
    long switches = nxtest::ThreadWakeUps() - switchesBefore;
    g_main_loop_unref(loop);
    EXPECT_LE(wakeUps, 10u);
    EXPECT_LE(switches, 12) << "the thread woke " << switches << " times in 10 s";
    RecordProperty("IdleWakeUpsIn10s", static_cast<int>(switches));
    std::printf("idle over 10 s: %lu dispatches, %ld thread wake-ups\n",
                static_cast<unsigned long>(wakeUps), switches);

    // Still connected: a round trip works at once.
    MyMemoryBlock none, version;
    ASSERT_TRUE(office->SendAndReceive("LumaServer", GET_APP_VERSION, none, version));
    EXPECT_GT(version.Len(), 1);
    MyMemoryBlock bye;
    office->Send("LumaServer", DISCONNECT, bye);
}

TEST_F(GlibLoopTest, AsynchronousSendsEndInAnAnswerALostPeerARefusalOrATimeOut) {
    PostOffice* office = PostOffice::CreatePostOffice("GlibTester");
    nxbase::glib::Attach();
    std::vector<AnswerResult> results;
    auto collect = [&](AnswerResult& result) { results.push_back(result); };

    MyMemoryBlock payload;
    payload << String("swatch 7");
    office->SendAndReceiveAsync("EchoPeer", GET_APP_VERSION, payload, collect);
    EXPECT_TRUE(results.empty()) << "the call did not return at once";
    ASSERT_TRUE(IterateUntil([&] { return results.size() == 1; }));
    ASSERT_TRUE(results[0].answered) << results[0].error;
    MyMemoryBlock echoed = results[0].data;
    PostOffice::Decode(echoed);
    String text;
    echoed >> text;
    EXPECT_EQ(text.str(), "swatch 7");

    // IS_APP_READY is never answered by the echo peer.
    MyMemoryBlock none;
    office->SendAndReceiveAsync("EchoPeer", IS_APP_READY, none, collect, 200ms);
    int asked = 0;
    office->SendAndReceiveAsync("EchoPeer", IS_APP_READY, none, collect, 10s,
                                [&asked] { return ++asked < 3; });
    ASSERT_TRUE(IterateUntil([&] { return results.size() == 3; }));
    EXPECT_FALSE(results[1].answered);
    EXPECT_FALSE(results[2].answered);
    // Which of the two ends first is not the point: each ends in its own way.
    std::string both = results[1].error + "|" + results[2].error;
    EXPECT_THAT(both, HasSubstr("within 200 ms")) << both;
    EXPECT_THAT(both, HasSubstr("given up")) << both;
    EXPECT_EQ(asked, 3);

    // CANCEL_REQUEST makes the peer die without an answer: the channel is lost.
    office->SendAndReceiveAsync("EchoPeer", CANCEL_REQUEST, none, collect, 10s);
    ASSERT_TRUE(IterateUntil([&] { return results.size() == 4; }));
    EXPECT_FALSE(results[3].answered);
    EXPECT_THAT(results[3].error, HasSubstr("was lost")) << results[3].error;
    EXPECT_EQ(office->GetPendingAsyncCount(), 0u);
}

}  // namespace
