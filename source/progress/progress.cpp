#include "nxbase/progress.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <vector>

#include "nxbase/check.h"
#include "toolkit/application.h"
#include "toolkit/fileio.h"
#include "toolkit/system.h"

namespace {

// Source name of the assertions raised here.
constexpr const char* kSource = "waitvisu";

constexpr std::size_t kDefaultTerminalWidth = 80;
constexpr double kTerminalMinimalStep = 0.005;

double Clamp01(double value) {
    if (!(value >= 0.0)) return 0.0;  // also NaN
    return value > 1.0 ? 1.0 : value;
}

// The range checks, each failing test raising the assertion, in this order.
void CheckRange(double amStart, double amEnd) {
    if (!(amStart >= 0.0 && amStart <= 1.0))
        Check::AssertFailed("amStart >= 0.0 && amStart <= 1.0", kSource, __LINE__);
    if (!(amEnd >= 0.0 && amEnd <= 1.0))
        Check::AssertFailed("amEnd >= 0.0 && amEnd <= 1.0", kSource, __LINE__);
    if (!(amStart <= amEnd)) Check::AssertFailed("amStart <= amEnd", kSource, __LINE__);
}

void CheckProgress(double axProgress) {
    if (!(axProgress >= 0.0 && axProgress <= 1.0))
        Check::AssertFailed("axProgress >= 0.0 && axProgress <= 1.0", kSource, __LINE__);
}

namespace term {

bool IsTerminal(int fd) {
    return toolkit::IsTerminal(fd);
}

std::size_t Width(int fd) {
    const std::size_t columns = toolkit::TerminalColumns(fd);
    return columns > 0 ? columns : kDefaultTerminalWidth;
}

}  // namespace term

std::string Fixed(double value, int precision) {
    char buffer[64];
    auto result =
        std::to_chars(buffer, buffer + sizeof buffer, value, std::chars_format::fixed, precision);
    return std::string(buffer, result.ptr);
}

std::string TwoDigits(long value) {
    std::string text = std::to_string(value);
    return text.size() < 2 ? "0" + text : text;
}

// "950", "12.3 k", "4.56 M" per second.
std::string Rate(double perSecond) {
    if (perSecond >= 1e6) return Fixed(perSecond / 1e6, 2) + " M";
    if (perSecond >= 1e4) return Fixed(perSecond / 1e3, 1) + " k";
    return Fixed(perSecond, perSecond >= 100 ? 0 : 1);
}

// The process-wide current wait visualiser.
struct CurrentState {
    std::mutex mutex;
    boost::shared_ptr<ProgressListener> listener;
    std::atomic<bool> enabled{true};
};

CurrentState& Current() {
    static CurrentState* state = new CurrentState();  // lives for the whole process
    return *state;
}

// The process-wide run-range stack, oldest entry first.
struct RunRangeStack {
    std::mutex mutex;
    std::vector<std::pair<const void*, std::pair<double, double>>> entries;
};

RunRangeStack& Stack() {
    static RunRangeStack* stack = new RunRangeStack();  // lives for the whole process
    return *stack;
}

}  // namespace

// ---------------------------------------------------------------------------
// ProgressListener

ProgressListener::ProgressListener() = default;

ProgressListener::~ProgressListener() = default;

void ProgressListener::ResetProgress() {
    amShown.store(-1.0);
}

void ProgressListener::DisplayProgress(double) {}

void ProgressListener::DisplayProgress(double, const std::string&) {}

void ProgressListener::DisplayProgress(const std::string&) {}

bool ProgressListener::IsAborted() const {
    return false;
}

void ProgressListener::SetMinimalProgressStep(double axStep) {
    amMinimalStep.store(Clamp01(axStep));
}

bool ProgressListener::CheckUIThread() const {
    return Application::Get().IsUserInterfaceThread();
}

bool ProgressListener::CheckProgressIncrement(double axProgress) const {
    double step = amMinimalStep.load();
    double shown = amShown.load();
    for (;;) {
        bool worth = shown < 0.0 || std::fabs(axProgress - shown) >= step ||
                     (axProgress >= 1.0 && shown < 1.0);
        if (!worth || axProgress == shown) return false;
        if (amShown.compare_exchange_weak(shown, axProgress)) return true;
    }
}

// ---------------------------------------------------------------------------
// ProgressListenerRange

ProgressListenerRange::ProgressListenerRange(ProgressListener& axParent, double axStart,
                                             double axEnd)
    : amParent(axParent) {
    SetChecked(axStart, axEnd);
}

// A range that failed its check is stored as given once the user chose to go on.
void ProgressListenerRange::SetChecked(double axStart, double axEnd) {
    CheckRange(axStart, axEnd);
    std::lock_guard<std::mutex> lock(amMutex);
    amStart = axStart;
    amEnd = axEnd;
}

void ProgressListenerRange::UpdateRunRange(double axStart, double axEnd) {
    SetChecked(axStart, axEnd);
    amParent.DisplayProgress(Map(0.0));
}

void ProgressListenerRange::UpdateRunRange(double axEnd) {
    double previousEnd;
    {
        std::lock_guard<std::mutex> lock(amMutex);
        previousEnd = amEnd;
    }
    UpdateRunRange(previousEnd, axEnd);
}

std::pair<double, double> ProgressListenerRange::GetRunRange() const {
    std::lock_guard<std::mutex> lock(amMutex);
    return {amStart, amEnd};
}

double ProgressListenerRange::Map(double axProgress) const {
    std::lock_guard<std::mutex> lock(amMutex);
    return amStart + axProgress * (amEnd - amStart);
}

// Resets this listener's own state only; the parent keeps what it shows.
void ProgressListenerRange::ResetProgress() {
    ProgressListener::ResetProgress();
}

void ProgressListenerRange::DisplayProgress(double axProgress) {
    CheckProgress(axProgress);
    amParent.DisplayProgress(Map(axProgress));
}

void ProgressListenerRange::DisplayProgress(double axProgress, const std::string& asText) {
    CheckProgress(axProgress);
    amParent.DisplayProgress(Map(axProgress), asText);
}

void ProgressListenerRange::DisplayProgress(const std::string& asText) {
    amParent.DisplayProgress(asText);
}

bool ProgressListenerRange::IsAborted() const {
    return amParent.IsAborted();
}

// ---------------------------------------------------------------------------
// WaitVisualizerRunRange

WaitVisualizerRunRange::WaitVisualizerRunRange(double axStart, double axEnd) {
    CheckRange(axStart, axEnd);
    std::pair<double, double> range{axStart, axEnd};  // as given, also after a failed check
    amStart = range.first;
    amEnd = range.second;
    RunRangeStack& stack = Stack();
    std::lock_guard<std::mutex> lock(stack.mutex);
    stack.entries.push_back({this, range});
}

WaitVisualizerRunRange::~WaitVisualizerRunRange() {
    RunRangeStack& stack = Stack();
    std::lock_guard<std::mutex> lock(stack.mutex);
    // Normally the last entry; search from the back in case scopes ended out of order.
    for (auto it = stack.entries.rbegin(); it != stack.entries.rend(); ++it) {
        if (it->first == this) {
            stack.entries.erase(std::next(it).base());
            break;
        }
    }
}

void WaitVisualizerRunRange::SetRunRange(double axStart, double axEnd) {
    CheckRange(axStart, axEnd);
    std::pair<double, double> range{axStart, axEnd};
    RunRangeStack& stack = Stack();
    std::lock_guard<std::mutex> lock(stack.mutex);
    amStart = range.first;
    amEnd = range.second;
    for (auto& entry : stack.entries) {
        if (entry.first == this) entry.second = range;
    }
}

void WaitVisualizerRunRange::UpdateRunRange(double axEnd) {
    SetRunRange(amEnd, axEnd);
    CurrentWaitVisualizer::Display(GetCurrentRunRange().first);
}

std::pair<double, double> WaitVisualizerRunRange::GetCurrentRunRange() {
    RunRangeStack& stack = Stack();
    std::lock_guard<std::mutex> lock(stack.mutex);
    double s = 0.0, e = 1.0;
    for (const auto& entry : stack.entries) {
        double w = e - s;
        e = s + w * entry.second.second;  // from the old start, before it moves
        s = s + w * entry.second.first;
    }
    return {s, e};
}

void WaitVisualizerRunRange::Display(double axProgress) {
    CheckProgress(axProgress);
    auto range = GetCurrentRunRange();
    CurrentWaitVisualizer::Display(range.first + axProgress * (range.second - range.first));
}

// ---------------------------------------------------------------------------
// CurrentWaitVisualizer

CurrentWaitVisualizer::CurrentWaitVisualizer(boost::shared_ptr<ProgressListener> axListener) {
    Install(std::move(axListener));
}

CurrentWaitVisualizer::CurrentWaitVisualizer(Window* pParent, const Factory& fCreate) {
    Install(fCreate ? fCreate(pParent) : boost::shared_ptr<ProgressListener>());
}

CurrentWaitVisualizer::CurrentWaitVisualizer(Window*, const String& asTitle, const String&, bool) {
    Install(
        boost::shared_ptr<ProgressListener>(new nxbase::TerminalProgressListener(asTitle.str())));
}

void CurrentWaitVisualizer::Install(boost::shared_ptr<ProgressListener> axListener) {
    amListener = std::move(axListener);
    CurrentState& state = Current();
    std::lock_guard<std::mutex> lock(state.mutex);
    amPrevious = state.listener;
    state.listener = amListener;
}

CurrentWaitVisualizer::~CurrentWaitVisualizer() {
    CurrentState& state = Current();
    std::lock_guard<std::mutex> lock(state.mutex);
    // Only put the previous one back if this scope's listener is still current.
    if (state.listener == amListener) state.listener = amPrevious;
}

boost::shared_ptr<ProgressListener> CurrentWaitVisualizer::Get() {
    CurrentState& state = Current();
    std::lock_guard<std::mutex> lock(state.mutex);
    return state.listener;
}

void CurrentWaitVisualizer::Display(double axProgress) {
    if (!Current().enabled.load()) return;
    boost::shared_ptr<ProgressListener> listener = Get();
    if (listener) listener->DisplayProgress(axProgress);
}

void CurrentWaitVisualizer::Enable() {
    Current().enabled.store(true);
}

void CurrentWaitVisualizer::Disable() {
    Current().enabled.store(false);
}

bool CurrentWaitVisualizer::IsEnabled() {
    return Current().enabled.load();
}

// ---------------------------------------------------------------------------
// nxbase::TerminalProgressListener

namespace nxbase {

TerminalProgressListener::TerminalProgressListener(std::string asLabel, int axFd, DrawMode axMode)
    : amLabel(std::move(asLabel)), amFd(axFd) {
    amDrawing = axMode == DrawMode::kAlways ||
                (axMode == DrawMode::kWhenTerminal && term::IsTerminal(axFd));
    SetMinimalProgressStep(kTerminalMinimalStep);
    amStartTime = std::chrono::steady_clock::now();
}

TerminalProgressListener::~TerminalProgressListener() {
    std::lock_guard<std::mutex> lock(amMutex);
    if (amLineOpen) (void)toolkit::WriteAll(amFd, "\n");
}

void TerminalProgressListener::SetTotal(std::uint64_t axTotal, std::string asUnit) {
    std::lock_guard<std::mutex> lock(amMutex);
    amTotal = axTotal;
    amUnit = std::move(asUnit);
}

void TerminalProgressListener::SetMinimalInterval(std::chrono::milliseconds axInterval) {
    std::lock_guard<std::mutex> lock(amMutex);
    amMinimalInterval = axInterval;
}

void TerminalProgressListener::ResetProgress() {
    ProgressListener::ResetProgress();
    std::lock_guard<std::mutex> lock(amMutex);
    if (amLineOpen) (void)toolkit::WriteAll(amFd, "\n");
    amLineOpen = false;
    amStartTime = std::chrono::steady_clock::now();
    amLastDraw = {};
    amLastProgress = 0.0;
}

void TerminalProgressListener::DisplayProgress(double axProgress) {
    if (!amDrawing) return;
    axProgress = Clamp01(axProgress);
    if (!CheckProgressIncrement(axProgress)) return;
    std::lock_guard<std::mutex> lock(amMutex);
    auto now = std::chrono::steady_clock::now();
    if (axProgress < 1.0 && amLastDraw != std::chrono::steady_clock::time_point{} &&
        now - amLastDraw < amMinimalInterval)
        return;
    amLastDraw = now;
    DrawLocked(axProgress);
}

void TerminalProgressListener::DisplayProgress(double axProgress, const std::string& asText) {
    {
        std::lock_guard<std::mutex> lock(amMutex);
        amText = asText;
    }
    DisplayProgress(axProgress);
}

void TerminalProgressListener::DisplayProgress(const std::string& asText) {
    if (!amDrawing) return;
    std::lock_guard<std::mutex> lock(amMutex);
    amText = asText;
    DrawLocked(amLastProgress);
}

void TerminalProgressListener::DrawLocked(double axProgress) {
    amLastProgress = axProgress;
    double elapsed =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - amStartTime).count();
    std::string label = amText.empty() ? amLabel : amText;
    std::string line = "\r" +
                       FormatLine(label, axProgress, elapsed, amTotal, amUnit,
                                  term::Width(amFd) - 1) +
                       "\x1b[K";  // erase what a longer earlier line left
    if (axProgress >= 1.0) {
        line += "\n";
        amLineOpen = false;
    } else {
        amLineOpen = true;
    }
    (void)toolkit::WriteAll(amFd, line);  // a progress bar is not worth an error
}

std::string TerminalProgressListener::FormatDuration(double axSeconds) {
    if (!(axSeconds >= 0.0) || axSeconds > 359999.0) return "--:--";
    long total = std::lround(axSeconds);
    long hours = total / 3600, minutes = total / 60 % 60, seconds = total % 60;
    if (hours > 0)
        return std::to_string(hours) + ":" + TwoDigits(minutes) + ":" + TwoDigits(seconds);
    return std::to_string(minutes) + ":" + TwoDigits(seconds);
}

std::string TerminalProgressListener::FormatLine(const std::string& asLabel, double axProgress,
                                                 double axElapsedSeconds, std::uint64_t axTotal,
                                                 const std::string& asUnit, std::size_t axWidth) {
    constexpr std::size_t kMinBar = 10, kMaxBar = 40;
    double p = Clamp01(axProgress);
    std::string percent = std::to_string(static_cast<int>(std::floor(p * 100.0))) + "%";
    while (percent.size() < 4) percent.insert(percent.begin(), ' ');

    std::string rate, left;
    if (axElapsedSeconds > 0.0 && p > 0.0) {
        if (axTotal > 0) {
            rate = Rate(p * static_cast<double>(axTotal) / axElapsedSeconds) +
                   (asUnit.empty() ? "" : " " + asUnit) + "/s";
        } else {
            rate = Fixed(p * 100.0 / axElapsedSeconds, 1) + "%/s";
        }
        left = p >= 1.0 ? "done " + FormatDuration(axElapsedSeconds)
                        : "left " + FormatDuration(axElapsedSeconds * (1.0 - p) / p);
    } else {
        left = "left --:--";
    }
    std::string tail = " " + percent + (rate.empty() ? "" : "  " + rate) + "  " + left;
    std::size_t fixed = asLabel.size() + 4 + tail.size();  // label, "  [", "]"
    std::size_t bar = axWidth > fixed ? std::min(kMaxBar, axWidth - fixed) : kMinBar;
    bar = std::max(bar, kMinBar);
    std::size_t filled = static_cast<std::size_t>(std::floor(p * static_cast<double>(bar)));
    return asLabel + "  [" + std::string(filled, '#') + std::string(bar - filled, '.') + "]" + tail;
}

}  // namespace nxbase
