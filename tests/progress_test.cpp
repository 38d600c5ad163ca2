#include "nxbase/progress.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <thread>
#include <vector>

#include "test_util.h"
#include "toolkit/application.h"
#include "toolkit/userinterface.h"

namespace {

// Range arithmetic is a handful of double operations on values in 0..1.
constexpr double kTolerance = 1e-12;

// Records every value it is shown; any thread may report.
class RecordingListener : public ProgressListener {
  public:
    void DisplayProgress(double axProgress) override {
        std::lock_guard<std::mutex> lock(mutex);
        values.push_back(axProgress);
    }
    void DisplayProgress(double axProgress, const std::string& asText) override {
        std::lock_guard<std::mutex> lock(mutex);
        values.push_back(axProgress);
        texts.push_back(asText);
    }
    void DisplayProgress(const std::string& asText) override {
        std::lock_guard<std::mutex> lock(mutex);
        texts.push_back(asText);
    }
    bool IsAborted() const override { return aborted; }
    // Exposes the throttle for tests.
    bool Worth(double p) const { return CheckProgressIncrement(p); }
    bool OnUIThread() const { return CheckUIThread(); }

    std::mutex mutex;
    std::vector<double> values;
    std::vector<std::string> texts;
    bool aborted = false;
};

std::vector<std::string> AssertionConditions(const RecordingUserInterface& ui) {
    std::vector<std::string> conditions;
    for (const auto& box : ui.Boxes()) {
        const std::string head = "*****ASSERT*****\nCondition:\n";
        EXPECT_EQ(box.text.rfind(head, 0), 0u) << box.text;
        auto end = box.text.find("\n failed", head.size());
        conditions.push_back(box.text.substr(head.size(), end - head.size()));
        EXPECT_THAT(box.text, HasSubstr("file: waitvisu\n")) << box.text;
    }
    return conditions;
}

void ExpectRange(std::pair<double, double> range, double first, double second) {
    EXPECT_NEAR(range.first, first, kTolerance);
    EXPECT_NEAR(range.second, second, kTolerance);
}

void ExpectAllInUnitRange(const std::vector<double>& values) {
    for (double v : values) ASSERT_TRUE(v >= 0.0 && v <= 1.0) << "outside 0..1: " << v;
}

TEST(ProgressListenerRange, MapsOntoTheParentsShareNestsAndTilesOnUpdate) {
    RecordingListener parent;
    ProgressListenerRange range(parent, 0.2, 0.6);
    range.DisplayProgress(0.5);
    range.DisplayProgress(1.0, "done");
    range.DisplayProgress("text only");
    ASSERT_EQ(parent.values.size(), 2u);
    EXPECT_NEAR(parent.values[0], 0.4, kTolerance);
    EXPECT_NEAR(parent.values[1], 0.6, kTolerance);
    EXPECT_EQ(parent.texts, (std::vector<std::string>{"done", "text only"}));
    parent.aborted = true;
    EXPECT_TRUE(range.IsAborted());

    // An update starts the next share where the last one ended and shows it.
    RecordingListener root;
    ProgressListenerRange outer(root, 0.5, 1.0);
    ProgressListenerRange inner(outer, 0.0, 0.1);
    inner.UpdateRunRange(0.3);
    ExpectRange(inner.GetRunRange(), 0.1, 0.3);
    ASSERT_EQ(root.values.size(), 1u);
    EXPECT_NEAR(root.values[0], 0.55, kTolerance);
    inner.UpdateRunRange(0.2, 0.4);
    inner.DisplayProgress(0.5);  // 0.3 of outer -> 0.5 + 0.3 * 0.5
    EXPECT_NEAR(root.values.back(), 0.65, kTolerance);
}

TEST(ProgressListenerRange, BadRangesRaiseTheAssertionsInOrderAndStayUsable) {
    auto ui = std::make_shared<RecordingUserInterface>(false);  // "no": go on
    ScopedUserInterface scope(ui);
    RecordingListener parent;

    ProgressListenerRange reversed(parent, 0.7, 0.6);
    EXPECT_EQ(AssertionConditions(*ui), (std::vector<std::string>{"amStart <= amEnd"}));
    ui->Clear();
    // Going on after the failed check keeps the range as given.
    EXPECT_EQ(reversed.GetRunRange(), std::make_pair(0.7, 0.6));
    // Resetting a range resets it alone: the parent is not told anything.
    std::size_t shown = parent.values.size();
    reversed.ResetProgress();
    EXPECT_EQ(parent.values.size(), shown);

    ProgressListenerRange outside(parent, 1.5, -0.1);
    EXPECT_EQ(AssertionConditions(*ui),
              (std::vector<std::string>{"amStart >= 0.0 && amStart <= 1.0",
                                        "amEnd >= 0.0 && amEnd <= 1.0", "amStart <= amEnd"}));
    ui->Clear();

    ProgressListenerRange good(parent, 0.0, 0.5);
    good.UpdateRunRange(0.4);  // new start 0.5 above the new end
    EXPECT_EQ(AssertionConditions(*ui), (std::vector<std::string>{"amStart <= amEnd"}));
    ui->Clear();

    // Going on after a failed progress check reports the value as mapped,
    // unclamped: 1.5 on (0, 0.5) is 0.75, on the range and on the stack.
    ProgressListenerRange half(parent, 0.0, 0.5);
    half.DisplayProgress(1.5);
    EXPECT_EQ(AssertionConditions(*ui),
              (std::vector<std::string>{"axProgress >= 0.0 && axProgress <= 1.0"}));
    EXPECT_NEAR(parent.values.back(), 0.75, kTolerance);
    ui->Clear();
    auto current = boost::shared_ptr<RecordingListener>(new RecordingListener());
    CurrentWaitVisualizer installed(current);
    WaitVisualizerRunRange stacked(0.0, 0.5);
    WaitVisualizerRunRange::Display(1.5);
    EXPECT_EQ(AssertionConditions(*ui),
              (std::vector<std::string>{"axProgress >= 0.0 && axProgress <= 1.0"}));
    ASSERT_EQ(current->values.size(), 1u);
    EXPECT_NEAR(current->values.back(), 0.75, kTolerance);
}

TEST(WaitVisualizerRunRange, ComposesTheStackOldestFirstAndReportsUpdates) {
    ExpectRange(WaitVisualizerRunRange::GetCurrentRunRange(), 0.0, 1.0);
    {
        WaitVisualizerRunRange outer(0.5, 1.0);
        {
            WaitVisualizerRunRange inner(0.0, 0.5);
            ExpectRange(WaitVisualizerRunRange::GetCurrentRunRange(), 0.5, 0.75);
            inner.SetRunRange(0.5, 1.0);
            ExpectRange(WaitVisualizerRunRange::GetCurrentRunRange(), 0.75, 1.0);
        }
        ExpectRange(WaitVisualizerRunRange::GetCurrentRunRange(), 0.5, 1.0);
    }
    ExpectRange(WaitVisualizerRunRange::GetCurrentRunRange(), 0.0, 1.0);

    // An update moves on and reports through the current visualizer.
    auto listener = boost::shared_ptr<RecordingListener>(new RecordingListener());
    CurrentWaitVisualizer current(listener);
    WaitVisualizerRunRange outer(0.0, 0.5);
    WaitVisualizerRunRange step(0.0, 0.2);
    step.UpdateRunRange(0.6);  // (0.2, 0.6) of outer's half
    ASSERT_EQ(listener->values.size(), 1u);
    EXPECT_NEAR(listener->values[0], 0.1, kTolerance);
    WaitVisualizerRunRange::Display(0.5);  // the middle of (0.1, 0.3)
    EXPECT_NEAR(listener->values.back(), 0.2, kTolerance);

    CurrentWaitVisualizer::Disable();
    WaitVisualizerRunRange::Display(1.0);
    CurrentWaitVisualizer::Enable();
    EXPECT_EQ(listener->values.size(), 2u);
}

TEST(CurrentWaitVisualizer, ScopesNestAndRestoreThePreviousListener) {
    EXPECT_FALSE(CurrentWaitVisualizer::Get());
    CurrentWaitVisualizer::Display(0.5);  // no listener: nothing happens
    auto first = boost::shared_ptr<RecordingListener>(new RecordingListener());
    {
        CurrentWaitVisualizer a(first);
        EXPECT_EQ(CurrentWaitVisualizer::Get(), first);
        Window* parentSeen = reinterpret_cast<Window*>(1);
        boost::shared_ptr<RecordingListener> made;
        {
            CurrentWaitVisualizer b(nullptr, [&](Window* parent) {
                parentSeen = parent;
                made.reset(new RecordingListener());
                return boost::shared_ptr<ProgressListener>(made);
            });
            EXPECT_EQ(parentSeen, nullptr);
            EXPECT_EQ(CurrentWaitVisualizer::Get(), made);
            CurrentWaitVisualizer::Display(0.25);
        }
        EXPECT_EQ(CurrentWaitVisualizer::Get(), first);
        ASSERT_EQ(made->values.size(), 1u);
        EXPECT_TRUE(first->values.empty());
        {
            CurrentWaitVisualizer c(nullptr, String("Title"), String("Text"), true);
            EXPECT_NE(
                dynamic_cast<nxbase::TerminalProgressListener*>(CurrentWaitVisualizer::Get().get()),
                nullptr);
        }
    }
    EXPECT_FALSE(CurrentWaitVisualizer::Get());
}

TEST(ProgressListener, MinimalStepThrottlesAndOneThreadWinsEachValue) {
    // The user-interface thread is the one that drives the application's
    // loop, not the one that created the listener.
    Application::Get().Reschedule();
    std::unique_ptr<RecordingListener> madeByWorker;
    bool workerIsUIThread = true;
    std::thread([&] {
        madeByWorker.reset(new RecordingListener());
        workerIsUIThread = madeByWorker->OnUIThread();
    }).join();
    EXPECT_FALSE(workerIsUIThread);
    EXPECT_TRUE(madeByWorker->OnUIThread());

    RecordingListener listener;

    listener.SetMinimalProgressStep(0.1);
    EXPECT_TRUE(listener.Worth(0.0));
    EXPECT_FALSE(listener.Worth(0.05));
    EXPECT_TRUE(listener.Worth(0.1));
    EXPECT_FALSE(listener.Worth(0.1));
    EXPECT_TRUE(listener.Worth(1.0));  // the end is always worth showing, once
    EXPECT_FALSE(listener.Worth(1.0));
    listener.ResetProgress();
    EXPECT_TRUE(listener.Worth(0.95));

    // Eight threads report the same ladder; each rung is won by exactly one.
    listener.ResetProgress();
    listener.SetMinimalProgressStep(0.01);
    std::atomic<int> wins{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i <= 100; ++i) {
                if (listener.Worth(i / 100.0)) ++wins;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_GE(wins.load(), 1);
    EXPECT_TRUE(listener.Worth(0.0));  // last shown was not 0 any more
}

TEST(ProgressListenerRange, ListenersFedFromSeveralThreadsLoseNothing) {
    RecordingListener root;
    constexpr int kThreads = 4, kReports = 2000;
    std::vector<std::unique_ptr<ProgressListenerRange>> ranges;
    for (int t = 0; t < kThreads; ++t)
        ranges.emplace_back(new ProgressListenerRange(root, t / 4.0, (t + 1) / 4.0));
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i <= kReports; ++i) {
                ranges[t]->DisplayProgress(static_cast<double>(i) / kReports);
                if (i % 500 == 0) ranges[t]->UpdateRunRange(t / 4.0, (t + 1) / 4.0);
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(root.values.size(), static_cast<size_t>(kThreads * (kReports + 1 + 5)));
    ExpectAllInUnitRange(root.values);
}

TEST(TerminalProgressListener, FormatsBarRateAndTimeLeft) {
    using nxbase::TerminalProgressListener;
    EXPECT_EQ(TerminalProgressListener::FormatDuration(7.4), "0:07");
    EXPECT_EQ(TerminalProgressListener::FormatDuration(754), "12:34");
    EXPECT_EQ(TerminalProgressListener::FormatDuration(3723), "1:02:03");
    EXPECT_EQ(TerminalProgressListener::FormatDuration(-1), "--:--");

    // The bar takes what the terminal width leaves, so the line fills it exactly.
    EXPECT_EQ(TerminalProgressListener::FormatLine("read", 0.5, 2.0, 50000, "spectra", 60),
              "read  [#########.........]  50%  12.5 k spectra/s  left 0:02");
    EXPECT_EQ(TerminalProgressListener::FormatLine("x", 0.25, 5.0, 0, "", 40),
              "x  [##.........]  25%  5.0%/s  left 0:15");
    EXPECT_EQ(TerminalProgressListener::FormatLine("x", 1.0, 65.0, 1000, "", 200),
              "x  [########################################] 100%  15.4/s  done 1:05");
    EXPECT_EQ(TerminalProgressListener::FormatLine("x", 0.0, 0.0, 0, "", 30),
              "x  [..........]   0%  left --:--");
}

TEST(TerminalProgressListener, DrawsOnlyOnTerminalsAndThrottles) {
    nxtest::TempDir dir;
    std::string path = dir.File("bar.txt");
    int fd = ::open(path.c_str(), O_CREAT | O_WRONLY | O_TRUNC, 0600);
    ASSERT_GE(fd, 0);
    {
        nxbase::TerminalProgressListener quiet("q", fd);  // a file is no terminal
        EXPECT_FALSE(quiet.IsDrawing());
        quiet.DisplayProgress(0.5);
    }
    EXPECT_EQ(nxtest::ReadFile(path), "");
    {
        nxbase::TerminalProgressListener bar("job", fd,
                                             nxbase::TerminalProgressListener::DrawMode::kAlways);
        bar.SetMinimalInterval(std::chrono::milliseconds(0));
        bar.SetMinimalProgressStep(0.1);
        for (int i = 0; i <= 100; ++i) bar.DisplayProgress(i / 100.0);
    }
    ::close(fd);
    std::string out = nxtest::ReadFile(path);
    EXPECT_EQ(std::count(out.begin(), out.end(), '\r'), 11);  // 0, 0.1, ..., 1.0
    EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 1);   // the line ends at 1
    EXPECT_THAT(out, HasSubstr("100%"));
}

}  // namespace
