// glib-measure: the library's loop inside a GLib main loop, with the
// asynchronous SendAndReceive and MeasurementSession. Connects to LumaServer
// (started on demand), subscribes to its notices, measures N patches one
// answer after the other without ever blocking the loop, prints each patch's
// CIELAB and each notice as it comes, and leaves.
//
//   glib-measure [N]     N patches (default 4)
// The server must be registered (lumaserver --register does it).
#include <nxbase/colorbatch.h>
#include <nxbase/glibloop.h>
#include <nxbase/lumaclient.h>
#include <nxbase/postoffice.h>
#include <nxbase/singleton.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>

namespace {

// Subscribes to the server's notices (its own CONNECT keeps the server
// between measurements), measures with a MeasurementSession, and leaves.
class Session {
  public:
    Session(PostOffice& office, int count, GMainLoop* loop)
        : office_(office),
          loop_(loop),
          measurement_(
              office, count, [](const nxbase::MeasuredSpectrum& patch, int, int) { Print(patch); },
              [this](bool ok, const std::string& error) { Done(ok, error); }) {}

    void Start() {
        MyMemoryBlock level;
        level << static_cast<unsigned char>(2);
        Ask(CONNECT, level, [this] { Ask(NOTIFY_MESSUNG, {}, [this] { measurement_.Start(); }); });
    }

    long OnNotice(void* event) {
        MyMemoryBlock data = static_cast<VELTRAEvent*>(event)->GetData();
        String id;
        data >> id;
        std::printf("notice: LumaServer measured %s\n", id.str().c_str());
        ++notices_;
        return 0;
    }

    bool Succeeded() const { return succeeded_; }
    const std::string& Failure() const { return failed_; }
    int Notices() const { return notices_; }

  private:
    // Sends and continues with `then` once the answer is there; the loop
    // runs on meanwhile.
    void Ask(int message, const MyMemoryBlock& data, std::function<void()> then) {
        office_.SendAndReceiveAsync(
            "LumaServer", message, data, [this, message, then](AnswerResult& result) {
                // CONNECT is answered with the protocol level, everything else with a status first.
                signed char status = -1;
                if (result.answered && message != CONNECT) result.data >> status;
                if (!result.answered || (message != CONNECT && status != 0)) {
                    Done(false,
                         std::string(nxbase::MessageName(message)) + ": " +
                             (result.answered ? "status " + std::to_string(status) : result.error));
                    return;
                }
                then();
            });
    }

    static void Print(const nxbase::MeasuredSpectrum& patch) {
        float lab[3];
        nxbase::ColorBatch().ToLab(patch.values.data(), 1, lab);
        std::printf("%-12s L* %6.2f  a* %7.2f  b* %7.2f\n", patch.id.c_str(), lab[0], lab[1],
                    lab[2]);
    }

    void Done(bool ok, const std::string& error) {
        succeeded_ = ok;
        failed_ = error;
        MyMemoryBlock none;
        // The server is not started again only to be told goodbye.
        office_.Send("LumaServer", NOTIFY_MESSUNG_AUS, none, {}, PeerStart::kNever);
        office_.Send("LumaServer", DISCONNECT, none, {}, PeerStart::kNever);
        g_main_loop_quit(loop_);
    }

    PostOffice& office_;
    GMainLoop* loop_;
    nxbase::MeasurementSession measurement_;
    int notices_ = 0;
    bool succeeded_ = false;
    std::string failed_;
};

}  // namespace

int main(int argc, char** argv) {
    const int count = argc > 1 ? std::atoi(argv[1]) : 4;
    GMainLoop* loop = g_main_loop_new(nullptr, FALSE);
    nxbase::glib::Attach();
    PostOffice* office = PostOffice::CreatePostOffice("GlibMeasure");
    Session session(*office, count, loop);
    Link notice = LINK(Session, &session, OnNotice);
    office->ChangeMessageHdl(MESSUNG_AUSGELOEST, notice);
    session.Start();  // returns at once; the answers come on the loop
    g_main_loop_run(loop);
    if (!session.Succeeded())
        std::fprintf(stderr, "measuring failed: %s\n", session.Failure().c_str());
    std::printf("%d notices\n", session.Notices());
    nxbase::glib::Detach();
    NxSingleton::DeleteAllSingleton();
    g_main_loop_unref(loop);
    return session.Succeeded() ? 0 : 1;
}
