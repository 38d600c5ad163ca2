// Runs the library's event loop inside Qt's event loop (library nxbase-qt):
// a socket notifier on the loop descriptor dispatches the library's handlers
// when it is readable, and again just before Qt's loop sleeps, so an idle
// application sleeps and a message is handled as soon as its socket is
// readable; the library's waits (a blocking SendAndReceive, a server being
// started) process Qt's events meanwhile, so windows keep painting.
//
//     QApplication app(argc, argv);
//     nxbase::qt::Attach();                 // before or after CreatePostOffice
//     return app.exec();                    // instead of Application::Execute()
//
// QCoreApplication::quit() (or exit()) also ends a wait of the library that
// is running, as Application::Quit() does: a window closed during a
// SendAndReceive does not wait on for its answer.
//
// Everything runs on the thread of the QCoreApplication.
#ifndef NXBASE_QTLOOP_H_
#define NXBASE_QTLOOP_H_

#include <QObject>
#include <QString>
#include <cstdint>
#include <string>

#include "nxbase/export.h"

class PostOffice;

namespace nxbase::qt {

// Attaches the library's loop to the calling thread's Qt event loop; a
// QCoreApplication must exist. Attaching again first detaches. Throws
// std::system_error when the loop descriptor cannot be made.
NXBASE_EXPORT void Attach();
// Removes the notifier and the nested wait.
NXBASE_EXPORT void Detach();
// How often the notifier found the loop descriptor readable and
// dispatched, since Attach(): the application's wake-ups for the library.
NXBASE_EXPORT std::uint64_t WakeUps();

// The post office's news as Qt signals, for widgets that show a peer's
// state: peerLost(name) whenever the channel to a peer is lost (it ended,
// was killed or broke the protocol).
class NXBASE_EXPORT PeerWatch : public QObject {
    Q_OBJECT
  public:
    explicit PeerWatch(PostOffice& office, QObject* parent = nullptr);
    ~PeerWatch() override;

  Q_SIGNALS:
    void peerLost(const QString& peer);

  private:
    PostOffice& office_;
    int id_ = 0;
};

}  // namespace nxbase::qt

#endif  // NXBASE_QTLOOP_H_
