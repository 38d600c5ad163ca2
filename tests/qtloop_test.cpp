// The library inside Qt (offscreen): an idle connected application sleeps,
// a blocking wait keeps Qt's events flowing, the abort dialog ends a wait
// when pressed while the top window is off, boxes are answered by a person,
// and progress reaches a bar from any thread.
#include "nxbase/qtloop.h"

#include <gtest/gtest.h>

#include <QApplication>
#include <QMessageBox>
#include <QProgressBar>
#include <QProgressDialog>
#include <QPushButton>
#include <QTest>
#include <QTimer>
#include <QWidget>
#include <functional>
#include <thread>

#include "gui_test_util.h"
#include "nxbase/check.h"
#include "nxbase/qtuserinterface.h"
#include "nxbase/text.h"
#include "qt_test_util.h"

namespace {

using namespace std::chrono_literals;

// Calls `step` every 20 ms on Qt's loop until it returns true.
void EveryTwentyMs(QObject* owner, std::function<bool()> step) {
    auto* timer = new QTimer(owner);
    QObject::connect(timer, &QTimer::timeout, timer, [timer, step] {
        if (step()) timer->stop();
    });
    timer->start(20);
}

class QtLoopTest : public ::testing::Test {
  protected:
    void SetUp() override {
        window.resize(200, 100);
        window.show();
        QApplication::setActiveWindow(&window);
    }
    void TearDown() override {
        nxbase::qt::Detach();
        UserInterface::Install(nullptr);
    }
    nxtest::GuiSandbox gui;
    QApplication& app = nxtest::QtApp();  // before any widget
    QWidget window;
};

TEST_F(QtLoopTest, AConnectedIdleApplicationSleepsAndABlockingWaitKeepsQtRunning) {
    PostOffice* office = PostOffice::CreatePostOffice("QtTester");
    nxbase::qt::Attach();
    int ticks = 0;
    QTimer ticker;
    QObject::connect(&ticker, &QTimer::timeout, [&ticks] { ++ticks; });
    ticker.start(1);
    MyMemoryBlock level, answer;
    level << static_cast<unsigned char>(2);
    ASSERT_TRUE(office->SendAndReceive("LumaServer", CONNECT, level, answer))
        << office->GetLastError();
    EXPECT_GT(ticks, 0) << "Qt's timers did not run during the wait";
    ticker.stop();

    QEventLoop idle;
    QTimer::singleShot(10000, &idle, &QEventLoop::quit);
    std::uint64_t wakeUpsBefore = nxbase::qt::WakeUps();
    long switchesBefore = nxtest::ThreadWakeUps();
    idle.exec();
    std::uint64_t wakeUps = nxbase::qt::WakeUps() - wakeUpsBefore;
    long switches = nxtest::ThreadWakeUps() - switchesBefore;
    EXPECT_LE(wakeUps, 10u);
    EXPECT_LE(switches, 12) << "the thread woke " << switches << " times in 10 s";
    std::printf("idle over 10 s: %lu dispatches, %ld thread wake-ups\n",
                static_cast<unsigned long>(wakeUps), switches);

    MyMemoryBlock none, version;
    ASSERT_TRUE(office->SendAndReceive("LumaServer", GET_APP_VERSION, none, version));
    EXPECT_GT(version.Len(), 1);
    office->Send("LumaServer", DISCONNECT, none);
}

TEST_F(QtLoopTest, TheAbortDialogEndsAWaitWhilstTheTopWindowIsOffAndBoxesAreAnswered) {
    auto ui = std::make_shared<nxbase::qt::QtUserInterface>();
    UserInterface::Install(ui);
    PostOffice* office = PostOffice::CreatePostOffice("QtTester");
    nxbase::qt::Attach();

    // IS_APP_READY is never answered by the echo peer: after 6 s the abort
    // dialog opens, in the current language; a person presses its button.
    ASSERT_TRUE(Text::LoadLibraryTexts(49));
    bool windowOffWhileWaiting = false, pressed = false;
    QString title;
    EveryTwentyMs(&window, [&] {
        if (!window.isEnabled()) windowOffWhileWaiting = true;
        QWidget* dialog = ui->AbortDialog();
        if (dialog == nullptr || !dialog->isVisible()) return false;
        title = dialog->windowTitle();
        auto* button = dialog->findChild<QPushButton*>(QStringLiteral("nxbaseAbortButton"));
        if (button == nullptr) return false;
        QTest::mouseClick(button, Qt::LeftButton);
        pressed = true;
        return true;
    });
    MyMemoryBlock none, answer;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(office->SendAndReceive("EchoPeer", IS_APP_READY, none, answer, DisEnableWindow));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_TRUE(pressed);
    EXPECT_EQ(title.toStdString(), "Warten auf eine Antwort");
    EXPECT_TRUE(windowOffWhileWaiting);
    EXPECT_TRUE(window.isEnabled()) << "the top window stayed off after the wait";
    EXPECT_GE(took, 6s);
    EXPECT_LT(took, 12s);
    EXPECT_EQ(ui->AbortDialog(), nullptr);

    // The assertion's question, answered No by a person: the program goes on.
    QString asked;
    EveryTwentyMs(&window, [&] {
        auto* box = qobject_cast<QMessageBox*>(QApplication::activeModalWidget());
        if (box == nullptr) return false;
        asked = box->text();
        QTest::mouseClick(box->button(QMessageBox::No), Qt::LeftButton);
        return true;
    });
    NX_ASSERT_TEXT(false, "a test's own assertion");
    EXPECT_TRUE(asked.contains(QStringLiteral("Quit application?"))) << asked.toStdString();
    EXPECT_TRUE(asked.contains(QStringLiteral("a test's own assertion"))) << asked.toStdString();

    // The application's waiting state (a LOCK with its waiting byte) is the busy cursor.
    Application::Get().Wait(true);
    ASSERT_NE(QApplication::overrideCursor(), nullptr);
    EXPECT_EQ(QApplication::overrideCursor()->shape(), Qt::BusyCursor);
    Application::Get().Wait(false);
    EXPECT_EQ(QApplication::overrideCursor(), nullptr);
}

TEST_F(QtLoopTest, ProgressReachesABarFromAnyThreadAndADialogsCancelAborts) {
    QProgressBar bar(&window);
    nxbase::qt::QtProgressListener toBar(&bar);
    std::thread worker([&] { toBar.DisplayProgress(0.25, "patch 6"); });
    worker.join();
    EXPECT_NE(bar.value(), 250) << "a report from another thread drew at once";
    QCoreApplication::processEvents();
    EXPECT_EQ(bar.value(), 250);
    EXPECT_TRUE(bar.format().startsWith(QStringLiteral("patch 6")));
    toBar.DisplayProgress(1.0);
    EXPECT_EQ(bar.value(), 1000);
    EXPECT_FALSE(toBar.IsAborted());
    toBar.Abort();
    EXPECT_TRUE(toBar.IsAborted());

    QProgressDialog dialog(QStringLiteral("Measuring"), QStringLiteral("Cancel"), 0, 1, &window);
    nxbase::qt::QtProgressListener toDialog(&dialog);
    toDialog.DisplayProgress(0.5, "patch 12");
    EXPECT_EQ(dialog.value(), 500);
    EXPECT_EQ(dialog.labelText(), QStringLiteral("patch 12"));
    EXPECT_FALSE(toDialog.IsAborted());
    dialog.cancel();
    EXPECT_TRUE(toDialog.IsAborted());
}

TEST_F(QtLoopTest, QtsQuitEndsAWaitAndALostPeerIsASignal) {
    PostOffice* office = PostOffice::CreatePostOffice("QtTester");
    nxbase::qt::Attach();
    nxbase::qt::PeerWatch watch(*office);
    QStringList lost;
    QObject::connect(&watch, &nxbase::qt::PeerWatch::peerLost,
                     [&lost](const QString& peer) { lost << peer; });
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
    // The user closes the application while it waits for an answer that
    // does not come: the wait ends with Qt's loop.
    bool answered = true;
    std::chrono::steady_clock::duration took{};
    QTimer::singleShot(0, &app, [&] {
        auto start = std::chrono::steady_clock::now();
        answered =
            office->SendAndReceive("EchoPeer", IS_APP_READY, request, answer, [] { return true; });
        took = std::chrono::steady_clock::now() - start;
    });
    QTimer::singleShot(300, &app, &QCoreApplication::quit);
    QTimer::singleShot(5000, &app, [] { QCoreApplication::exit(1); });  // a hung wait fails
    EXPECT_EQ(app.exec(), 0);
    EXPECT_FALSE(answered);
    EXPECT_LT(took, 2s);
    Application::Get().ResetQuit();
    // The peer dies: the watch says so.
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", CANCEL_REQUEST, request, answer, [] { return true; }));
    EXPECT_TRUE(nxtest::RunUntil([&] { return !lost.isEmpty(); }, 3s));
    EXPECT_EQ(lost, QStringList{QStringLiteral("EchoPeer")});
}

}  // namespace
