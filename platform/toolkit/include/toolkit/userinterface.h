// UserInterface shows the library's message boxes. The process has one
// current handler, replaceable at any time from any thread: a GUI application
// installs its own, tests install a RecordingUserInterface, and the default
// writes the text to stderr and takes the default answer.
#ifndef TOOLKIT_USERINTERFACE_H_
#define TOOLKIT_USERINTERFACE_H_

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "nxbase/export.h"

class NXBASE_EXPORT UserInterface {
  public:
    enum class BoxKind { kError, kInfo, kQuery };

    virtual ~UserInterface() = default;

    // A modal box with one acknowledgement button; returns when closed.
    virtual void ErrorBox(const std::string& text) = 0;
    virtual void InfoBox(const std::string& text) = 0;
    // A yes/no question; returns true for yes. A non-interactive handler
    // answers `defaultAnswer`.
    virtual bool QueryBox(const std::string& text, bool defaultAnswer) = 0;

    // The application's waiting state (busy cursor, input locked).
    virtual void SetWaiting(bool /*waiting*/) {}
    // The active top window: whether there is one, whether it takes input,
    // and switching its input on or off. Without a window there is nothing to do.
    virtual bool HasTopWindow() { return false; }
    virtual bool IsTopWindowEnabled() { return true; }
    virtual void EnableTopWindow(bool /*enable*/) {}
    // A tone of `frequency` Hz for `milliseconds`; silent unless a GUI plays it.
    virtual void Beep(unsigned /*frequency*/, unsigned /*milliseconds*/) {}
    // Whether a person can answer: a GUI says yes. Waits that would need a
    // person to end them end by a time-out instead when nobody can.
    virtual bool IsInteractive() { return false; }
    // A modeless dialog with an abort button, shown while a long wait goes
    // on; IsAbortDialogAborted() is true once the person pressed abort.
    virtual void OpenAbortDialog(const std::string& /*title*/, const std::string& /*text*/) {}
    virtual bool IsAbortDialogAborted() { return false; }
    virtual void CloseAbortDialog() {}

    // The current handler; never null.
    static std::shared_ptr<UserInterface> Current();
    // Installs `handler` (null restores the default) and returns the previous one.
    static std::shared_ptr<UserInterface> Install(std::shared_ptr<UserInterface> handler);
};

// Writes every box to stderr and answers with the default.
class NXBASE_EXPORT StderrUserInterface : public UserInterface {
  public:
    void ErrorBox(const std::string& text) override;
    void InfoBox(const std::string& text) override;
    bool QueryBox(const std::string& text, bool defaultAnswer) override;
};

// Records every box and answers queries with a preset answer; for tests.
// Any thread may call it.
class NXBASE_EXPORT RecordingUserInterface : public UserInterface {
  public:
    struct Box {
        BoxKind kind;
        std::string text;
    };

    explicit RecordingUserInterface(bool queryAnswer = false) : queryAnswer_(queryAnswer) {}

    void ErrorBox(const std::string& text) override;
    void InfoBox(const std::string& text) override;
    bool QueryBox(const std::string& text, bool defaultAnswer) override;
    // Recorded as "wait 1", "enable 0", "beep 5000 200"; it has a top window.
    void SetWaiting(bool waiting) override;
    bool HasTopWindow() override { return true; }
    bool IsTopWindowEnabled() override;
    void EnableTopWindow(bool enable) override;
    void Beep(unsigned frequency, unsigned milliseconds) override;
    // Recorded as "abort-dialog <title>"; aborted once SetAborted(true).
    void OpenAbortDialog(const std::string& title, const std::string& text) override;
    bool IsAbortDialogAborted() override;
    bool IsInteractive() override { return interactive_; }
    void SetInteractive(bool interactive) { interactive_ = interactive; }
    void SetAborted(bool aborted);

    std::vector<Box> Boxes() const;
    std::vector<std::string> Events() const;
    void Clear();

  private:
    void Record(BoxKind kind, const std::string& text);
    void RecordEvent(const std::string& event);

    mutable std::mutex mutex_;
    std::vector<Box> boxes_;
    std::vector<std::string> events_;
    bool queryAnswer_ = false;
    bool topWindowEnabled_ = true;
    bool interactive_ = false;
    bool aborted_ = false;
};

// Installs a handler for the lifetime of a scope, then puts the previous back.
class NXBASE_EXPORT ScopedUserInterface {
  public:
    explicit ScopedUserInterface(std::shared_ptr<UserInterface> handler)
        : previous_(UserInterface::Install(std::move(handler))) {}
    ~ScopedUserInterface() { UserInterface::Install(previous_); }
    ScopedUserInterface(const ScopedUserInterface&) = delete;
    ScopedUserInterface& operator=(const ScopedUserInterface&) = delete;

  private:
    std::shared_ptr<UserInterface> previous_;
};

#endif  // TOOLKIT_USERINTERFACE_H_
