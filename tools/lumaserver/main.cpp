// lumaserver: an emulator of the measuring-device server LumaServer. It
// answers the post-office messages of a spectrophotometer and measures the
// patches of a chart (the built-in ColorChecker, or --chart FILE), one per
// EXEC_MEASUREMENT or per --trigger-every period, and tells subscribed
// applications that the device was triggered. It ends one second after its
// last peer disconnects.
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "nxbase/logfile.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "nxbase/registry.h"
#include "nxbase/strhelp.h"
#include "nxbase/version.h"
#include "spectra_csv.h"
#include "toolkit/application.h"
#include "toolkit/system.h"

namespace {

constexpr const char* kVersion = "3.0";
constexpr int kExitOk = 0;
constexpr int kExitUsage = 2;
constexpr int kExitFailed = 3;

const char kUsage[] =
    "Usage: lumaserver [--chart FILE] [--trigger-every MS]\n"
    "       lumaserver --register\n"
    "Emulates the measuring-device server LumaServer: a spectrophotometer that\n"
    "measures the patches of a chart in turn. Applications reach it through the\n"
    "post office under the name \"LumaServer\"; it ends one second after its last\n"
    "peer disconnects.\n"
    "\n"
    "  --chart FILE        the chart's spectra (CSV or CGATS, as nxcolor reads\n"
    "                      them); default: the built-in ColorChecker\n"
    "  --trigger-every MS  also measure on its own every MS milliseconds, as a\n"
    "                      device key would, and notify the subscribers\n"
    "  --dde-only          be reachable only by DDE on the D-Bus session bus (no\n"
    "                      request socket), as an older server\n"
    "  --register          write Path, Executable and Version of this program\n"
    "                      into HKEY_LOCAL_MACHINE\\Software\\K-Lume\\LumaServer\n"
    "                      (the machine hive: $NXBASE_MACHINE_REGISTRY or\n"
    "                      /etc/k-lume/registry.sqlite) and exit\n"
    "  -S, -LNG CODE       as an application starts it: with -S the server also\n"
    "                      ends when no peer connected for 30 s\n"
    "  --version, --help\n";

constexpr signed char kDone = nxbase::kDone;
constexpr signed char kRefused = nxbase::kRefused;

class Server {
  public:
    explicit Server(nxcolor::SpectraTable chart) : amChart(std::move(chart)) {
        PostOffice* office = PostOffice::Instance();
        Install(office, IS_APP_READY, &Server::StatusOnly);
        Install(office, CANCEL_REQUEST, &Server::StatusOnly);
        Install(office, EXEC_WHITE_MEASUREMENT, &Server::StatusOnly);
        Install(office, GET_APP_VERSION, &Server::Text);
        Install(office, GET_SW_VERSION, &Server::Text);
        Install(office, GET_SERIE_NR, &Server::Text);
        Install(office, GET_DEVICE_NAME, &Server::Text);
        Install(office, GET_DEVICE_TYPE, &Server::DeviceType);
        Install(office, EXEC_MEASUREMENT, &Server::Measure);
        Install(office, SPECTRUM_REQUEST, &Server::Spectrum);
        Install(office, NOTIFY_MESSUNG, &Server::Subscribe);
        Install(office, NOTIFY_MESSUNG_AUS, &Server::Unsubscribe);
        Install(office, DISCONNECT, &Server::Disconnected);
        office->AddPeerLostFunction([this](const std::string& peer) { PeerLost(peer); });
    }

    // Started on demand (-S) but no peer for a while: the peer that started
    // it is gone, so nobody will disconnect and end it. Looked at every 10 s,
    // not every second, so that an idle server sleeps.
    long IdleCheck(void* pTimer) {
        bool idle = PostOffice::Instance()->GetConnectionCount() <= 0 &&
                    Pipe::Instance()->ChannelCount() == 0;
        amIdleChecks = idle ? amIdleChecks + 1 : 0;
        if (amIdleChecks * kIdleCheckSeconds >= kIdleSeconds) {
            LogFile::WriteToLog(String("No peer since the start - Closing application"), String());
            Application::Get().Quit();
        }
        static_cast<Timer*>(pTimer)->Start();
        return 0;
    }

    long TriggerTick(void*) {
        MeasureNext();
        Notify();
        return 0;
    }

    static constexpr int kIdleSeconds = 30;
    static constexpr std::chrono::seconds kNoticeWait{1};
    static constexpr int kIdleCheckSeconds = 10;

  private:
    void Install(PostOffice* office, PO_Botschaften message, long (Server::*handler)(void*)) {
        Link link(this, handler);
        office->ChangeMessageHdl(message, link);
    }
    static VELTRAEvent& Event(void* p) { return *static_cast<VELTRAEvent*>(p); }
    static void Reply(void* p, MyMemoryBlock& answer) {
        PostOffice::Instance()->Answer(&Event(p), answer);
    }

    long StatusOnly(void* p) {
        MyMemoryBlock answer;
        answer << kDone;
        Reply(p, answer);
        return 0;
    }
    long Text(void* p) {
        int number = PostOffice::Instance()->NumberOfCommand(Event(p));
        const char* text = number == GET_APP_VERSION  ? kVersion
                           : number == GET_SW_VERSION ? "lumaserver 3.0 (NxBase emulator)"
                           : number == GET_SERIE_NR   ? "EMU-0001"
                                                      : "LumaSpectro Emulator";
        MyMemoryBlock answer;
        answer << kDone << String(text);
        Reply(p, answer);
        return 0;
    }
    long DeviceType(void* p) {
        MyMemoryBlock answer;
        answer << kDone << static_cast<short>(1);  // a spectrophotometer
        Reply(p, answer);
        return 0;
    }
    long Measure(void* p) {
        MeasureNext();
        MyMemoryBlock answer;
        answer << kDone << String(CurrentId()) << amLast;
        Reply(p, answer);
        Notify();
        return 0;
    }
    long Spectrum(void* p) {
        MyMemoryBlock answer;
        if (amLast < 0) {
            answer << kRefused;
        } else {
            const nxcolor::SpectrumRow& row = amChart.rows[static_cast<std::size_t>(amLast)];
            answer << kDone << String(row.id) << nxcolor::kSpectrumSize;
            for (float value : row.values) {
                answer << static_cast<int>(std::lround(static_cast<double>(value) * 100000.0));
            }
        }
        Reply(p, answer);
        return 0;
    }
    long Subscribe(void* p) {
        amSubscribers.insert(Event(p).GetSender());
        return StatusOnly(p);
    }
    long Unsubscribe(void* p) {
        amSubscribers.erase(Event(p).GetSender());
        return StatusOnly(p);
    }
    // A subscription ends with the subscriber's last connection, not with
    // the DISCONNECT of another part of the same application.
    long Disconnected(void* p) {
        const std::string& sender = Event(p).GetSender();
        if (PostOffice::Instance()->GetConnectionCount(sender) == 0) amSubscribers.erase(sender);
        return 0;
    }

    void MeasureNext() {
        amLast = (amLast + 1) % static_cast<int>(amChart.rows.size());
        LogFile::WriteToLog(String("Measured patch ") + String(CurrentId()), String("LumaServer"));
    }
    std::string CurrentId() const { return amChart.rows[static_cast<std::size_t>(amLast)].id; }
    // Each notice goes out from the loop, after the handler that measured,
    // and waits at most a second for its subscriber: one that cannot be
    // reached holds nobody up and loses its subscription.
    void Notify() {
        for (const std::string& subscriber : amSubscribers) {
            auto notice = std::make_shared<MyMemoryBlock>();
            *notice << String(CurrentId()) << amLast;
            Application::Get().Post([this, subscriber, notice] {
                auto until = std::chrono::steady_clock::now() + kNoticeWait;
                boost::function<bool()> inTime = [until] {
                    return std::chrono::steady_clock::now() < until;
                };
                if (amSubscribers.count(subscriber) == 0 ||
                    PostOffice::Instance()->Send(subscriber, MESSUNG_AUSGELOEST, *notice, inTime,
                                                 PeerStart::kNever))
                    return;
                LogFile::WriteToLog(String("Notice to ") + String(subscriber) + " failed (" +
                                        String(PostOffice::Instance()->GetLastError()) +
                                        "); its subscription ends",
                                    String());
                amSubscribers.erase(subscriber);
            });
        }
    }
    // A subscriber whose channel is lost and that holds no connection has gone.
    void PeerLost(const std::string& asPeer) {
        if (PostOffice::Instance()->GetConnectionCount(asPeer) == 0) amSubscribers.erase(asPeer);
    }

    nxcolor::SpectraTable amChart;
    int amIdleChecks = 0;
    int amLast = -1;  // index of the last measured patch
    std::set<std::string> amSubscribers;
};

int Register() {
    std::string executable = toolkit::ExecutableFileName();
    std::string directory = executable.substr(0, executable.rfind('/'));
    const char* key = "Software\\K-Lume\\LumaServer";
    RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Path"), directory);
    RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Executable"),
                                      executable);
    RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Version"), kVersion);
    std::cout << "Registered " << executable << " as LumaServer " << kVersion << " in "
              << nxbase::RegistryHiveFile(nxbase::RegistryHive::LocalMachine) << "\n";
    return kExitOk;
}

}  // namespace

int main(int argc, char** argv) {
    std::string chartFile;
    long triggerEvery = 0;
    bool startedOnDemand = false;
    for (int i = 1; i < argc; ++i) {
        std::string argument = argv[i];
        auto value = [&](const char* what) -> std::string {
            if (i + 1 >= argc) {
                std::cerr << "lumaserver: " << argument << " needs " << what << "\n";
                std::exit(kExitUsage);
            }
            return argv[++i];
        };
        if (argument == "--help" || argument == "-h") {
            std::cout << kUsage;
            return kExitOk;
        } else if (argument == "--version") {
            std::cout << "lumaserver " << kVersion << " (NxBase " << nxbase::Version() << ")\n";
            return kExitOk;
        } else if (argument == "--register") {
            try {
                return Register();
            } catch (const std::exception& error) {
                std::cerr << "lumaserver: " << error.what() << "\n";
                return kExitFailed;
            }
        } else if (argument == "--chart") {
            chartFile = value("a file");
        } else if (argument == "--trigger-every") {
            std::string ms = value("milliseconds");
            long long every = 0;
            if (!StringHelpers::ParseInteger(ms, every) || every < 1 || every > 86400000) {
                std::cerr << "lumaserver: --trigger-every needs a positive number\n";
                return kExitUsage;
            }
            triggerEvery = static_cast<long>(every);
        } else if (argument == "--dde-only") {
            Pipe::SetSocketListening(false);
        } else if (argument == "-S") {
            startedOnDemand = true;
        } else if (argument == "/WM") {
        } else if (argument == "-LNG") {
            value("a country code");
        } else {
            std::cerr << "lumaserver: unknown option " << argument << "\n" << kUsage;
            return kExitUsage;
        }
    }

    nxcolor::SpectraTable chart;
    std::string error;
    if (chartFile.empty()) {
        chart = nxcolor::ParseSpectra(nxcolor::EmbeddedChart(), nxcolor::EmbeddedChartName());
    } else if (!nxcolor::ReadSpectralFile(chartFile, {}, &chart, &error)) {
        std::cerr << "lumaserver: " << error << "\n";
        return kExitUsage;
    }
    for (const std::string& message : chart.errors) std::cerr << message << "\n";
    if (chart.rows.empty()) {
        std::cerr << "lumaserver: the chart holds no spectra\n";
        return kExitUsage;
    }

    LogFile::CreateLogFile("lumaserver");
    try {
        PostOffice::CreatePostOffice("LumaServer");
    } catch (const std::exception& failure) {
        std::cerr << "lumaserver: " << failure.what() << "\n";
        return kExitFailed;
    }
    // The session bus refused the connection: the box said so, and the
    // application quits, not as a success.
    if (Application::Get().IsQuitting()) {
        std::cerr << "lumaserver: DDE-Server kann nicht initialisiert werden.\n";
        NxSingleton::DeleteAllSingleton();
        return kExitFailed;
    }
    // Without its socket nobody could reach the server: say why and end.
    if (!Pipe::Instance()->GetRefusal().empty()) {
        std::cerr << "lumaserver: " << Pipe::Instance()->GetRefusal() << "\n";
        NxSingleton::DeleteAllSingleton();
        return kExitFailed;
    }
    Server server(std::move(chart));
    AutoTimer trigger;
    if (triggerEvery > 0) {
        trigger.SetTimeout(static_cast<unsigned long>(triggerEvery));
        trigger.SetTimeoutHdl(LINK(Server, &server, TriggerTick));
        trigger.Start();
    }
    Timer idle;
    if (startedOnDemand) {
        idle.SetTimeout(Server::kIdleCheckSeconds * 1000);
        idle.SetTimeoutHdl(LINK(Server, &server, IdleCheck));
        idle.Start();
    }
    Application::Get().Execute();
    idle.Stop();
    trigger.Stop();
    NxSingleton::DeleteAllSingleton();
    return kExitOk;
}
