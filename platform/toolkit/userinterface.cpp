#include "toolkit/userinterface.h"

#include <cstdio>

namespace {

std::mutex& HandlerMutex() {
    static std::mutex mutex;
    return mutex;
}

std::shared_ptr<UserInterface>& HandlerSlot() {
    static std::shared_ptr<UserInterface> handler = std::make_shared<StderrUserInterface>();
    return handler;
}

void WriteBox(const char* head, const std::string& text) {
    std::fprintf(stderr, "[%s] %s\n", head, text.c_str());
    std::fflush(stderr);
}

}  // namespace

std::shared_ptr<UserInterface> UserInterface::Current() {
    std::lock_guard<std::mutex> lock(HandlerMutex());
    return HandlerSlot();
}

std::shared_ptr<UserInterface> UserInterface::Install(std::shared_ptr<UserInterface> handler) {
    if (!handler) handler = std::make_shared<StderrUserInterface>();
    std::lock_guard<std::mutex> lock(HandlerMutex());
    std::swap(HandlerSlot(), handler);
    return handler;
}

void StderrUserInterface::ErrorBox(const std::string& text) {
    WriteBox("error", text);
}

void StderrUserInterface::InfoBox(const std::string& text) {
    WriteBox("info", text);
}

bool StderrUserInterface::QueryBox(const std::string& text, bool defaultAnswer) {
    WriteBox(defaultAnswer ? "question, answered yes" : "question, answered no", text);
    return defaultAnswer;
}

void RecordingUserInterface::Record(BoxKind kind, const std::string& text) {
    std::lock_guard<std::mutex> lock(mutex_);
    boxes_.push_back(Box{kind, text});
}

void RecordingUserInterface::ErrorBox(const std::string& text) {
    Record(BoxKind::kError, text);
}

void RecordingUserInterface::InfoBox(const std::string& text) {
    Record(BoxKind::kInfo, text);
}

bool RecordingUserInterface::QueryBox(const std::string& text, bool /*defaultAnswer*/) {
    Record(BoxKind::kQuery, text);
    return queryAnswer_;
}

void RecordingUserInterface::RecordEvent(const std::string& event) {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back(event);
}

void RecordingUserInterface::SetWaiting(bool waiting) {
    RecordEvent(waiting ? "wait 1" : "wait 0");
}

bool RecordingUserInterface::IsTopWindowEnabled() {
    std::lock_guard<std::mutex> lock(mutex_);
    return topWindowEnabled_;
}

void RecordingUserInterface::EnableTopWindow(bool enable) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        topWindowEnabled_ = enable;
    }
    RecordEvent(enable ? "enable 1" : "enable 0");
}

void RecordingUserInterface::Beep(unsigned frequency, unsigned milliseconds) {
    RecordEvent("beep " + std::to_string(frequency) + " " + std::to_string(milliseconds));
}

void RecordingUserInterface::OpenAbortDialog(const std::string& title, const std::string&) {
    RecordEvent("abort-dialog " + title);
}

bool RecordingUserInterface::IsAbortDialogAborted() {
    std::lock_guard<std::mutex> lock(mutex_);
    return aborted_;
}

void RecordingUserInterface::SetAborted(bool aborted) {
    std::lock_guard<std::mutex> lock(mutex_);
    aborted_ = aborted;
}

std::vector<std::string> RecordingUserInterface::Events() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
}

std::vector<RecordingUserInterface::Box> RecordingUserInterface::Boxes() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return boxes_;
}

void RecordingUserInterface::Clear() {
    std::lock_guard<std::mutex> lock(mutex_);
    boxes_.clear();
    events_.clear();
}
