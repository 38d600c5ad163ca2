// The library's boxes, waiting state and abort dialog as Qt widgets (library
// nxbase-qt), and a progress listener that drives a QProgressBar or a
// QProgressDialog. Install the user interface once the QApplication exists:
//
//     UserInterface::Install(std::make_shared<nxbase::qt::QtUserInterface>());
//
// Boxes are modal on the active top window; the abort dialog of a long
// SendAndReceive is modeless with one button. Call on the GUI thread only,
// except for the progress listener, which any thread may report to.
#ifndef NXBASE_QTUSERINTERFACE_H_
#define NXBASE_QTUSERINTERFACE_H_

#include <QPointer>
#include <QProgressBar>
#include <QProgressDialog>
#include <QWidget>
#include <atomic>
#include <string>

#include "nxbase/export.h"
#include "nxbase/progress.h"
#include "toolkit/userinterface.h"

namespace nxbase::qt {

class NXBASE_EXPORT QtUserInterface : public UserInterface {
  public:
    QtUserInterface();
    ~QtUserInterface() override;

    // Message boxes on the active top window, titled with the application's name.
    void ErrorBox(const std::string& text) override;
    void InfoBox(const std::string& text) override;
    // Yes and No; `defaultAnswer` is the button Return presses.
    bool QueryBox(const std::string& text, bool defaultAnswer) override;
    // A busy cursor over the whole application while waiting.
    void SetWaiting(bool waiting) override;
    // The active top window, or the first visible top-level window when none
    // is active (an application in the background).
    bool HasTopWindow() override;
    bool IsTopWindowEnabled() override;
    void EnableTopWindow(bool enable) override;
    void Beep(unsigned frequency, unsigned milliseconds) override;
    bool IsInteractive() override { return true; }
    // A modeless dialog with the text and an abort button (object name
    // "nxbaseAbortDialog", its button "nxbaseAbortButton").
    void OpenAbortDialog(const std::string& title, const std::string& text) override;
    bool IsAbortDialogAborted() override { return aborted_; }
    void CloseAbortDialog() override;
    // The open abort dialog, or null.
    QWidget* AbortDialog() const { return abortDialog_; }

  private:
    QWidget* TopWindow() const;

    QPointer<QWidget> abortDialog_;
    QPointer<QWidget> disabledWindow_;  // the window EnableTopWindow(false) turned off
    bool aborted_ = false;
    bool waiting_ = false;
};

// Shows progress in a bar or a progress dialog; a dialog's cancel button,
// or Abort(), makes IsAborted() true. Reports from other threads are passed
// to the GUI thread. The widget must outlive the listener.
class NXBASE_EXPORT QtProgressListener : public ProgressListener {
  public:
    explicit QtProgressListener(QProgressBar* bar);
    explicit QtProgressListener(QProgressDialog* dialog);

    void DisplayProgress(double progress) override;
    void DisplayProgress(double progress, const std::string& text) override;
    void DisplayProgress(const std::string& text) override;
    bool IsAborted() const override;
    // For an abort button of the application's own.
    void Abort() { aborted_ = true; }

  private:
    static constexpr int kSteps = 1000;
    static int Steps(double progress);  // 0..1 clamped, as bar steps
    void Show(int value, const QString& text, bool withText);

    QPointer<QProgressBar> bar_;
    QPointer<QProgressDialog> dialog_;
    std::atomic<bool> aborted_{false};
};

}  // namespace nxbase::qt

#endif  // NXBASE_QTUSERINTERFACE_H_
