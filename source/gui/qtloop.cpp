#include "nxbase/qtloop.h"

#include <QAbstractEventDispatcher>
#include <QCoreApplication>
#include <QEvent>
#include <QSocketNotifier>
#include <QTimer>
#include <memory>

#include "nxbase/postoffice.h"
#include "toolkit/application.h"

namespace nxbase::qt {

namespace {

// Qt's quit reaches the library: its waits end, as on Application::Quit().
class QuitWatch : public QObject {
  public:
    bool eventFilter(QObject* watched, QEvent* event) override {
        if (event->type() == QEvent::Quit) Application::Get().Quit();
        return QObject::eventFilter(watched, event);
    }
};

struct Attachment {
    std::unique_ptr<QSocketNotifier> notifier;
    QuitWatch quitWatch;
    QTimer limit;  // ends a nested pass at its time limit
    QMetaObject::Connection beforeSleep;
    std::uint64_t wakeUps = 0;
};

std::unique_ptr<Attachment> gAttachment;

// One pass of Qt's loop, for at most `timeout`: a timer bounds the sleep,
// so that the library's wait can ask its keep-waiting function.
void ProcessEventsOnce(std::chrono::milliseconds timeout) {
    QAbstractEventDispatcher* dispatcher = QAbstractEventDispatcher::instance();
    if (dispatcher == nullptr || !gAttachment) return;
    gAttachment->limit.start(static_cast<int>(timeout.count()));
    dispatcher->processEvents(QEventLoop::AllEvents | QEventLoop::WaitForMoreEvents);
    gAttachment->limit.stop();
}

}  // namespace

void Attach() {
    Detach();
    int descriptor = Application::Get().GetLoopDescriptor();
    auto attachment = std::make_unique<Attachment>();
    attachment->notifier = std::make_unique<QSocketNotifier>(descriptor, QSocketNotifier::Read);
    Attachment* self = attachment.get();
    self->limit.setSingleShot(true);
    QObject::connect(self->notifier.get(), &QSocketNotifier::activated, [self] {
        ++self->wakeUps;
        Application::Get().Dispatch();
    });
    // Handlers made ready by calls outside any handler (a button that sent a
    // message, or an answer that came while the message was written) are not
    // announced on the descriptor: run them before Qt sleeps, and when some
    // ran, do not sleep (a nested wait is then over at once).
    if (QAbstractEventDispatcher* dispatcher = QAbstractEventDispatcher::instance()) {
        self->beforeSleep =
            QObject::connect(dispatcher, &QAbstractEventDispatcher::aboutToBlock, [dispatcher] {
                if (Application::Get().Dispatch() > 0) dispatcher->wakeUp();
            });
    }
    if (QCoreApplication* application = QCoreApplication::instance()) {
        application->installEventFilter(&self->quitWatch);
        QObject::connect(application, &QCoreApplication::aboutToQuit, &self->quitWatch,
                         [] { Application::Get().Quit(); });
    }
    gAttachment = std::move(attachment);
    Application::Get().SetNestedWait(ProcessEventsOnce);
}

void Detach() {
    if (!gAttachment) return;
    Application::Get().SetNestedWait({});
    QObject::disconnect(gAttachment->beforeSleep);
    gAttachment.reset();
}

std::uint64_t WakeUps() {
    return gAttachment ? gAttachment->wakeUps : 0;
}

PeerWatch::PeerWatch(PostOffice& office, QObject* parent) : QObject(parent), office_(office) {
    id_ = office_.AddPeerLostFunction(
        [this](const std::string& peer) { Q_EMIT peerLost(QString::fromStdString(peer)); });
}

PeerWatch::~PeerWatch() {
    if (PostOffice::IsInitialized() && PostOffice::Instance() == &office_)
        office_.RemovePeerLostFunction(id_);
}

}  // namespace nxbase::qt
