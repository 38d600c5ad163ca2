#include "nxbase/qtuserinterface.h"

#include <QApplication>
#include <QDialog>
#include <QLabel>
#include <QMessageBox>
#include <QPushButton>
#include <QThread>
#include <QVBoxLayout>
#include <algorithm>
#include <cmath>

namespace nxbase::qt {

namespace {

QString Q(const std::string& text) {
    return QString::fromStdString(text);
}

QString Title() {
    QString name = QApplication::applicationDisplayName();
    return name.isEmpty() ? QStringLiteral("NxBase") : name;
}

}  // namespace

QtUserInterface::QtUserInterface() = default;

QtUserInterface::~QtUserInterface() {
    CloseAbortDialog();
    if (waiting_) QApplication::restoreOverrideCursor();
}

QWidget* QtUserInterface::TopWindow() const {
    if (QWidget* active = QApplication::activeWindow()) return active;
    for (QWidget* widget : QApplication::topLevelWidgets()) {
        if (widget->isVisible() && widget != abortDialog_ && !qobject_cast<QDialog*>(widget))
            return widget;
    }
    return nullptr;
}

void QtUserInterface::ErrorBox(const std::string& text) {
    QMessageBox::critical(TopWindow(), Title(), Q(text));
}

void QtUserInterface::InfoBox(const std::string& text) {
    QMessageBox::information(TopWindow(), Title(), Q(text));
}

bool QtUserInterface::QueryBox(const std::string& text, bool defaultAnswer) {
    auto answer =
        QMessageBox::question(TopWindow(), Title(), Q(text), QMessageBox::Yes | QMessageBox::No,
                              defaultAnswer ? QMessageBox::Yes : QMessageBox::No);
    return answer == QMessageBox::Yes;
}

void QtUserInterface::SetWaiting(bool waiting) {
    if (waiting == waiting_) return;
    waiting_ = waiting;
    if (waiting) {
        QApplication::setOverrideCursor(Qt::BusyCursor);
    } else {
        QApplication::restoreOverrideCursor();
    }
}

bool QtUserInterface::HasTopWindow() {
    return disabledWindow_ != nullptr || TopWindow() != nullptr;
}

bool QtUserInterface::IsTopWindowEnabled() {
    QWidget* window = disabledWindow_ ? disabledWindow_.data() : TopWindow();
    return window == nullptr || window->isEnabled();
}

void QtUserInterface::EnableTopWindow(bool enable) {
    if (enable) {
        // The window turned off earlier, even if another is active now.
        QWidget* window = disabledWindow_ ? disabledWindow_.data() : TopWindow();
        if (window) window->setEnabled(true);
        disabledWindow_ = nullptr;
        return;
    }
    QWidget* window = TopWindow();
    if (window == nullptr) return;
    window->setEnabled(false);
    disabledWindow_ = window;
}

void QtUserInterface::Beep(unsigned, unsigned) {
    QApplication::beep();
}

void QtUserInterface::OpenAbortDialog(const std::string& title, const std::string& text) {
    CloseAbortDialog();
    aborted_ = false;
    auto* dialog = new QDialog(TopWindow());
    dialog->setObjectName(QStringLiteral("nxbaseAbortDialog"));
    dialog->setWindowTitle(Q(title));
    dialog->setAttribute(Qt::WA_DeleteOnClose);
    auto* layout = new QVBoxLayout(dialog);
    layout->addWidget(new QLabel(Q(text), dialog));
    auto* abort = new QPushButton(QApplication::translate("QtUserInterface", "Abort"), dialog);
    abort->setObjectName(QStringLiteral("nxbaseAbortButton"));
    layout->addWidget(abort);
    QObject::connect(abort, &QPushButton::clicked, dialog, [this] { aborted_ = true; });
    // Closing the dialog by its window button aborts as well.
    QObject::connect(dialog, &QDialog::rejected, dialog, [this] { aborted_ = true; });
    // The top window may be disabled by the wait; the dialog stays usable.
    dialog->setWindowModality(Qt::NonModal);
    dialog->show();
    abortDialog_ = dialog;
}

void QtUserInterface::CloseAbortDialog() {
    if (!abortDialog_) return;
    QWidget* dialog = abortDialog_;
    abortDialog_ = nullptr;
    dialog->disconnect();
    dialog->deleteLater();
    dialog->hide();
}

int QtProgressListener::Steps(double progress) {
    return static_cast<int>(std::lround(std::clamp(progress, 0.0, 1.0) * kSteps));
}

QtProgressListener::QtProgressListener(QProgressBar* bar) : bar_(bar) {
    if (bar) bar->setRange(0, kSteps);
}

QtProgressListener::QtProgressListener(QProgressDialog* dialog) : dialog_(dialog) {
    if (dialog) dialog->setRange(0, kSteps);
}

void QtProgressListener::DisplayProgress(double progress) {
    if (!CheckProgressIncrement(progress)) return;
    Show(Steps(progress), QString(), false);
}

void QtProgressListener::DisplayProgress(double progress, const std::string& text) {
    // A new text is worth showing even when the value has not moved enough.
    CheckProgressIncrement(progress);
    Show(Steps(progress), Q(text), true);
}

void QtProgressListener::DisplayProgress(const std::string& text) {
    Show(-1, Q(text), true);
}

bool QtProgressListener::IsAborted() const {
    if (aborted_) return true;
    // wasCanceled() reads the dialog: only on its own thread.
    return dialog_ && QThread::currentThread() == dialog_->thread() && dialog_->wasCanceled();
}

// On the widget's thread; `value` -1 keeps the value.
void QtProgressListener::Show(int value, const QString& text, bool withText) {
    QObject* target = bar_ ? static_cast<QObject*>(bar_.data()) : dialog_.data();
    if (target == nullptr) return;
    QPointer<QProgressBar> bar = bar_;
    QPointer<QProgressDialog> dialog = dialog_;
    auto show = [bar, dialog, value, text, withText] {
        if (bar) {
            if (value >= 0) bar->setValue(value);
            if (withText)
                bar->setFormat(text.isEmpty() ? QStringLiteral("%p%")
                                              : text + QStringLiteral(" %p%"));
        }
        if (dialog) {
            if (value >= 0) dialog->setValue(value);
            if (withText) dialog->setLabelText(text);
        }
    };
    if (QThread::currentThread() == target->thread()) {
        show();
    } else {
        QMetaObject::invokeMethod(target, show, Qt::QueuedConnection);
    }
}

}  // namespace nxbase::qt
