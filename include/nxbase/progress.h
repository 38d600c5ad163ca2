// Progress reporting: listeners take fractions 0..1, ranges map a step's own
// 0..1 onto a share of their parent, and a process-wide stack of run ranges
// reports through the current wait visualiser. Any thread may report progress;
// every class here is safe to call from several threads at once.
#ifndef NXBASE_PROGRESS_H_
#define NXBASE_PROGRESS_H_

#include <atomic>
#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <string>
#include <utility>

#include "nxbase/export.h"
#include "toolkit/string.h"

// The toolkit's window class; the Linux toolkit has no windows, so parents are
// passed through unused and may be null.
class Window;

// Sink of progress fractions from 0 (nothing done) to 1 (all done). The base
// shows nothing; derived classes draw. Reports from any thread are allowed.
class NXBASE_EXPORT ProgressListener {
  public:
    ProgressListener();
    virtual ~ProgressListener();
    ProgressListener(const ProgressListener&) = delete;
    ProgressListener& operator=(const ProgressListener&) = delete;

    // Forgets what was shown, so that the next report is shown whatever its value.
    virtual void ResetProgress();
    virtual void DisplayProgress(double axProgress);
    virtual void DisplayProgress(double axProgress, const std::string& asText);
    virtual void DisplayProgress(const std::string& asText);
    // True once the user asked to stop; the base never aborts.
    virtual bool IsAborted() const;

    // Smallest change of the shown value worth drawing (default 0: every
    // change). Values are clamped to 0..1.
    void SetMinimalProgressStep(double axStep);
    double GetMinimalProgressStep() const { return amMinimalStep.load(); }

  protected:
    // True on the application's user-interface thread (the thread that drives
    // the event loop), whichever thread created the listener.
    bool CheckUIThread() const;
    // True when `axProgress` should be drawn: nothing shown since the last
    // reset, a change of at least the minimal step, or the first report of 1.
    // A true answer records the value as shown, so of several threads
    // reporting the same value only one draws it.
    bool CheckProgressIncrement(double axProgress) const;

  private:
    std::atomic<double> amMinimalStep{0.0};
    // Last value drawn; negative when nothing is shown.
    mutable std::atomic<double> amShown{-1.0};
};

// A step of a larger operation: its own 0..1 maps onto [start, end] of its
// parent. The parent must outlive the range. A failed range or progress check
// raises the library's assertion (source "waitvisu"); when the user goes on,
// the values are used as given: start + p * (end - start) reaches the parent
// even when it lies outside 0..1.
class NXBASE_EXPORT ProgressListenerRange : public ProgressListener {
  public:
    ProgressListenerRange(ProgressListener& axParent, double axStart, double axEnd);

    // Replaces the range, checks it, then reports the new start to the parent.
    void UpdateRunRange(double axStart, double axEnd);
    // The next tile: UpdateRunRange(old end, axEnd).
    void UpdateRunRange(double axEnd);

    // Forgets what this range showed; the parent is not told anything.
    void ResetProgress() override;
    // Checks axProgress, then reports start + axProgress * (end - start).
    void DisplayProgress(double axProgress) override;
    void DisplayProgress(double axProgress, const std::string& asText) override;
    void DisplayProgress(const std::string& asText) override;
    bool IsAborted() const override;

    std::pair<double, double> GetRunRange() const;

  private:
    void SetChecked(double axStart, double axEnd);
    double Map(double axProgress) const;

    ProgressListener& amParent;
    mutable std::mutex amMutex;
    double amStart = 0.0;
    double amEnd = 1.0;
};

// One entry (start, end) on the process-wide stack of run ranges, pushed by
// the constructor and removed by the destructor. Entries are meant to nest
// like scopes on one thread; the stack itself is locked, so other threads may
// read the composed range at any time.
class NXBASE_EXPORT WaitVisualizerRunRange {
  public:
    WaitVisualizerRunRange(double axStart, double axEnd);
    ~WaitVisualizerRunRange();
    WaitVisualizerRunRange(const WaitVisualizerRunRange&) = delete;
    WaitVisualizerRunRange& operator=(const WaitVisualizerRunRange&) = delete;

    // Replaces this entry's pair.
    void SetRunRange(double axStart, double axEnd);
    // start := previous end, end := axEnd; then shows the composed start
    // through the current wait visualiser.
    void UpdateRunRange(double axEnd);

    // The share of the whole operation that the innermost entry covers: from
    // (0, 1), each entry (a, b), oldest first, narrows (s, e) to
    // (s + (e - s) a, s + (e - s) b).
    static std::pair<double, double> GetCurrentRunRange();
    // Checks axProgress, maps the innermost step's own 0..1 through
    // GetCurrentRunRange() (unclamped, as the range does) and passes it to
    // CurrentWaitVisualizer::Display.
    static void Display(double axProgress);

  private:
    double amStart = 0.0;
    double amEnd = 1.0;
};

// Makes a listener the process-wide current one for the lifetime of a scope;
// the previous one is current again afterwards.
class NXBASE_EXPORT CurrentWaitVisualizer {
  public:
    using Factory = boost::function<boost::shared_ptr<ProgressListener>(Window*)>;

    explicit CurrentWaitVisualizer(boost::shared_ptr<ProgressListener> axListener);
    CurrentWaitVisualizer(Window* pParent, const Factory& fCreate);
    // A wait visualiser with a title and a text. Without windows this is a
    // terminal progress bar on stderr labelled with the title (drawn only
    // when stderr is a terminal); `axCanAbort` is kept for the applications'
    // wait windows and has no effect here.
    CurrentWaitVisualizer(Window* pParent, const String& asTitle, const String& asText,
                          bool axCanAbort);
    ~CurrentWaitVisualizer();
    CurrentWaitVisualizer(const CurrentWaitVisualizer&) = delete;
    CurrentWaitVisualizer& operator=(const CurrentWaitVisualizer&) = delete;

    // The current listener; empty when none is installed.
    static boost::shared_ptr<ProgressListener> Get();
    // Passes axProgress to the current listener, if any, while enabled.
    static void Display(double axProgress);
    static void Enable();
    static void Disable();
    static bool IsEnabled();

  private:
    void Install(boost::shared_ptr<ProgressListener> axListener);

    boost::shared_ptr<ProgressListener> amPrevious;
    boost::shared_ptr<ProgressListener> amListener;
};

namespace nxbase {

// A progress bar for command-line tools, e.g.
//   "nxcolor  [#########.........]  50%  12.5 k spectra/s  left 0:02"
// redrawn in place with "\r" to the terminal's width. It draws only when its
// file descriptor is a terminal (or when forced, for tests), when the value
// moved by at least the minimal progress step (default 0.005) and at most
// once per minimal interval (default 100 ms); 1.0 is always drawn and ends
// the line. With a total count set, the rate is in items per second, else in
// percent per second; the time left assumes the rate so far.
class NXBASE_EXPORT TerminalProgressListener : public ProgressListener {
  public:
    enum class DrawMode { kWhenTerminal, kAlways, kNever };

    explicit TerminalProgressListener(std::string asLabel, int axFd = 2,
                                      DrawMode axMode = DrawMode::kWhenTerminal);
    ~TerminalProgressListener() override;

    // Number of items that 1.0 stands for, and their unit ("spectra"); 0: none.
    void SetTotal(std::uint64_t axTotal, std::string asUnit = std::string());
    // Minimal time between two redraws (default 100 ms; 0 draws every step).
    void SetMinimalInterval(std::chrono::milliseconds axInterval);
    // True when this listener writes anything at all.
    bool IsDrawing() const { return amDrawing; }

    void ResetProgress() override;
    void DisplayProgress(double axProgress) override;
    void DisplayProgress(double axProgress, const std::string& asText) override;
    void DisplayProgress(const std::string& asText) override;

    // The bar line for a state, without "\r"; exposed for tests.
    static std::string FormatLine(const std::string& asLabel, double axProgress,
                                  double axElapsedSeconds, std::uint64_t axTotal,
                                  const std::string& asUnit, std::size_t axWidth);
    // "0:07", "12:34" or "1:02:03"; "--:--" when unknown.
    static std::string FormatDuration(double axSeconds);

  private:
    void DrawLocked(double axProgress);

    std::string amLabel;
    int amFd = 2;
    bool amDrawing = false;
    std::mutex amMutex;
    std::chrono::steady_clock::time_point amStartTime;
    std::chrono::steady_clock::time_point amLastDraw;
    std::chrono::milliseconds amMinimalInterval{100};
    std::uint64_t amTotal = 0;
    std::string amUnit;
    double amLastProgress = 0.0;
    bool amLineOpen = false;
    std::string amText;
};

}  // namespace nxbase

#endif  // NXBASE_PROGRESS_H_
