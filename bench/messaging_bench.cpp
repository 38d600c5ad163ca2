// Messages between two processes against raw Unix sockets carrying the same
// bytes, in two placements that the program sets itself: both processes
// pinned to CPU 0 ("SameCpu"), and the caller on CPU 0 with its peer on
// CPU 1 ("TwoCpus"):
// - PostOffice::SendAndReceive to a post office answering with its default
//   handler, against a raw ping-pong of the same request and answer frames;
// - one message there and back through Pipe against the same raw ping-pong;
// - the post office over D-Bus against over the sockets (TwoCpus);
// - the floor of any messaging on the loop: a bare asio ping-pong of the same
//   frames (a read kept armed, run_one_for, no library code) against raw;
// - SendAndReceive with the loop inside a GLib main loop and inside Qt's
//   (their nested waits turn those loops) against the library's own loop.
// Each pair runs side by side in every one of five rounds; at the end the
// program prints the ratio of each pair's times per round as min/median/max.
// The peers are this program started again with "--peer MODE CPU".
#include <benchmark/benchmark.h>
#include <sched.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <boost/asio/local/stream_protocol.hpp>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "interleaved.h"
#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "nxbase/registry.h"
#include "toolkit/application.h"

#ifdef NXBASE_BENCH_GUI_LOOPS
#include <QCoreApplication>

#include "nxbase/glibloop.h"
#include "nxbase/qtloop.h"
#endif

namespace {

constexpr const char* kPeerName = "BenchPeer";
int gReceived = 0;

void CountAnswer(VELTRAEvent&) {
    ++gReceived;
}

void EchoAnswer(VELTRAEvent& event) {
    MyMemoryBlock data = event.GetData();
    nxbase::EncodeBlock(data);
    Pipe::Instance()->Send(event.GetSender(), kAnswerPrefix + event.GetCommand(), data);
}

// The payload of a small message: a status byte and a short text.
std::string Payload() {
    return std::string("\x00\x05LumaSpectro 3", 15);
}

// Where the two processes run.
enum class Placement { kSameCpu, kTwoCpus, kAnyCpu };

const char* PlacementName(Placement placement) {
    return placement == Placement::kSameCpu   ? "SameCpu"
           : placement == Placement::kTwoCpus ? "TwoCpus"
                                              : "AnyCpu";
}

// The CPU of the caller is 0; its peer's is 0 or 1, or any (-1).
int PeerCpu(Placement placement) {
    return placement == Placement::kSameCpu ? 0 : placement == Placement::kTwoCpus ? 1 : -1;
}

using nxbench::PinTo;

// Blocking exact read; false at end of file.
bool ReadExactly(int fd, char* buffer, std::size_t size) {
    while (size > 0) {
        ssize_t n = ::read(fd, buffer, size);
        if (n <= 0) return false;
        buffer += n;
        size -= static_cast<std::size_t>(n);
    }
    return true;
}

std::string RequestFrame() {
    std::string stuffed = nxbase::EncodeBytes(Payload().data(), Payload().size());
    return nxbase::EncodeFrame(nxbase::MessageBody("BenchClient", "GET_DEVICE_NAME", stuffed));
}

// What the default handler of a post office named "LumaServer" sends back.
std::string DefaultAnswerFrame() {
    return nxbase::EncodeFrame(
        nxbase::MessageBody("LumaServer", "ANSWER!GET_DEVICE_NAME", std::string("\x02", 1)));
}

// The raw baseline: a child answering each request frame with `answer`.
void RawPingPong(benchmark::State& state, Placement placement, const std::string& request,
                 const std::string& answer) {
    PinTo(0);
    int sockets[2];
    ::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets);
    pid_t child = ::fork();
    if (child == 0) {
        PinTo(PeerCpu(placement));
        ::close(sockets[0]);
        std::string buffer(request.size(), '\0');
        while (ReadExactly(sockets[1], buffer.data(), buffer.size())) {
            if (::write(sockets[1], answer.data(), answer.size()) < 0) break;
        }
        ::_exit(0);
    }
    ::close(sockets[1]);
    std::string received(answer.size(), '\0');
    for (auto _ : state) {
        if (::write(sockets[0], request.data(), request.size()) < 0) break;
        ReadExactly(sockets[0], received.data(), received.size());
    }
    ::close(sockets[0]);
    ::waitpid(child, nullptr, 0);
    PinTo(-1);
}

// A private runtime directory and machine hive, removed at the end.
struct Scratch {
    Scratch() {
        char pattern[] = "/tmp/nxbase-bench-XXXXXX";
        directory = ::mkdtemp(pattern);
        ::setenv("NXBASE_RUNTIME_DIR", directory.c_str(), 1);
        ::setenv("NXBASE_LOG_PATH", (directory + "/log").c_str(), 1);
        ::setenv("NXBASE_MACHINE_REGISTRY", (directory + "/machine.sqlite").c_str(), 1);
        ::setenv("NXBASE_USER_REGISTRY", (directory + "/user.sqlite").c_str(), 1);
        ::unsetenv("USERNAME");
        ::unsetenv("DBUS_SESSION_BUS_ADDRESS");  // never the user's bus
        ::setenv("XDG_RUNTIME_DIR", "", 1);
        const char* key = "Software\\K-Lume\\LumaServer";
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Path"), "/none");
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Executable"),
                                          "/none/lumaserver");
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Version"), "3.0");
    }
    ~Scratch() { std::filesystem::remove_all(directory); }
    std::string directory;
};

pid_t StartPeer(const char* mode, Placement placement) {
    std::string cpu = std::to_string(PeerCpu(placement));
    pid_t peer = ::fork();
    if (peer == 0) {
        ::execl("/proc/self/exe", "messaging_bench", "--peer", mode, cpu.c_str(), nullptr);
        ::_exit(127);
    }
    return peer;
}

void StopPeer(pid_t peer) {
    ::kill(peer, SIGTERM);
    ::waitpid(peer, nullptr, 0);
}

bool WaitForSocket(const std::string& name) {
    std::string path = nxbase::MessagingRuntimeDirectory() + "/PipeRequest-" + name;
    for (int i = 0; i < 1000; ++i) {
        if (std::filesystem::exists(path)) return true;
        ::usleep(10000);
    }
    return false;
}

// Which main loop drives the library's: its own, GLib's or Qt's.
enum class Loop { kOwn, kGLib, kQt };

// Attaches the library's loop to a GUI loop for the lifetime of a scope.
class GuiLoop {
  public:
    explicit GuiLoop(Loop loop) : loop_(loop) {
#ifdef NXBASE_BENCH_GUI_LOOPS
        if (loop_ == Loop::kGLib) nxbase::glib::Attach();
        if (loop_ == Loop::kQt) {
            static int argc = 1;
            static char name[] = "messaging_bench";
            static char* argv[] = {name, nullptr};
            static QCoreApplication* app = new QCoreApplication(argc, argv);
            (void)app;
            nxbase::qt::Attach();
        }
#endif
    }
    ~GuiLoop() {
#ifdef NXBASE_BENCH_GUI_LOOPS
        if (loop_ == Loop::kGLib) nxbase::glib::Detach();
        if (loop_ == Loop::kQt) nxbase::qt::Detach();
#endif
    }
    GuiLoop(const GuiLoop&) = delete;
    GuiLoop& operator=(const GuiLoop&) = delete;

  private:
    Loop loop_;
};

// SendAndReceive to a post office that answers with its default handler.
void PostOfficeRoundTrip(benchmark::State& state, Placement placement, Loop loop = Loop::kOwn) {
    PinTo(0);
    Scratch scratch;
    pid_t peer = StartPeer("server", placement);
    WaitForSocket("LumaServer");
    GuiLoop driver(loop);
    PostOffice* office = PostOffice::CreatePostOffice("BenchClient");
    MyMemoryBlock request, answer;
    request.Put(Payload().data(), static_cast<long>(Payload().size()));
    office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, [] { return true; });
    for (auto _ : state) {
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, [] { return true; });
    }
    NxSingleton::DeleteAllSingleton();
    StopPeer(peer);
    PinTo(-1);
}

// SendAndReceive to the same server reached by DDE on a private D-Bus bus.
void DdeRoundTrip(benchmark::State& state, Placement placement) {
    PinTo(0);
    Scratch scratch;
    std::string address = "unix:path=" + scratch.directory + "/bus";
    pid_t daemon = ::fork();
    if (daemon == 0) {
        ::execl("/usr/bin/dbus-daemon", "dbus-daemon", "--session", "--nofork",
                ("--address=" + address).c_str(), nullptr);
        ::_exit(127);
    }
    for (int i = 0; i < 500 && !std::filesystem::exists(scratch.directory + "/bus"); ++i)
        ::usleep(10000);
    ::setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
    pid_t peer = StartPeer("server-dde", placement);
    PostOffice* office = PostOffice::CreatePostOffice("BenchClient");
    MyMemoryBlock request, answer;
    request.Put(Payload().data(), static_cast<long>(Payload().size()));
    for (int i = 0; i < 500 && !office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request,
                                                       answer, [] { return true; });
         ++i) {
        ::usleep(10000);
    }
    for (auto _ : state) {
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, [] { return true; });
    }
    NxSingleton::DeleteAllSingleton();
    StopPeer(peer);
    ::kill(daemon, SIGTERM);
    ::waitpid(daemon, nullptr, 0);
    ::unsetenv("DBUS_SESSION_BUS_ADDRESS");
    PinTo(-1);
}

// The same exchange through Pipe with a peer process running its loop.
void PipeRoundTrip(benchmark::State& state, Placement placement) {
    PinTo(0);
    Scratch scratch;
    pid_t peer = StartPeer("echo", placement);
    WaitForSocket(kPeerName);
    Pipe* pipe = Pipe::CreatePipe("BenchClient");
    pipe->SetReceiveFunction(CountAnswer);
    MyMemoryBlock data;
    data.Put(Payload().data(), static_cast<long>(Payload().size()));
    nxbase::EncodeBlock(data);
    Application& app = Application::Get();
    gReceived = 0;
    if (!pipe->Send(kPeerName, "IS_READY", data))
        state.SkipWithError(("the peer is unreachable: " + pipe->GetLastError()).c_str());
    while (!state.error_occurred() && gReceived < 1) app.RunOneFor(std::chrono::milliseconds(10));
    for (auto _ : state) {
        int before = gReceived;
        if (!pipe->Send(kPeerName, "GET_DEVICE_NAME", data)) {
            state.SkipWithError(("a send failed: " + pipe->GetLastError()).c_str());
            break;
        }
        while (gReceived == before) app.RunOneFor(std::chrono::milliseconds(100));
    }
    Pipe::DeletePipe();
    StopPeer(peer);
    PinTo(-1);
}

// Both ends of the bare loop ping-pong: a read kept armed on a socket of the
// loop, as the library's channels do, and a send of `answer` per frame read
// on the answering side.
struct LoopEnd {
    explicit LoopEnd(int fd) : socket(context) {
        socket.assign(boost::asio::local::stream_protocol(), fd);
        socket.non_blocking(true);
        Arm();
    }
    void Arm() {
        socket.async_read_some(boost::asio::buffer(input),
                               [this](const boost::system::error_code& error, std::size_t) {
                                   if (error) {
                                       closed = true;
                                       return;
                                   }
                                   ++received;
                                   Arm();
                                   if (!answer.empty())
                                       ::send(socket.native_handle(), answer.data(), answer.size(),
                                              MSG_NOSIGNAL);
                               });
    }
    boost::asio::io_context context;
    boost::asio::local::stream_protocol::socket socket;
    std::array<char, 16 * 1024> input;
    std::string answer;
    long received = 0;
    bool closed = false;
};

void LoopPingPong(benchmark::State& state, Placement placement) {
    const std::string request = RequestFrame(), answer = DefaultAnswerFrame();
    PinTo(0);
    int sockets[2];
    ::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets);
    pid_t child = ::fork();
    if (child == 0) {
        PinTo(PeerCpu(placement));
        ::close(sockets[0]);
        LoopEnd end(sockets[1]);
        end.answer = answer;
        while (!end.closed) end.context.run_one_for(std::chrono::milliseconds(100));
        ::_exit(0);
    }
    ::close(sockets[1]);
    {
        LoopEnd end(sockets[0]);
        for (auto _ : state) {
            long before = end.received;
            ::send(sockets[0], request.data(), request.size(), MSG_NOSIGNAL);
            while (end.received == before) end.context.run_one_for(std::chrono::milliseconds(50));
        }
    }
    ::waitpid(child, nullptr, 0);
    PinTo(-1);
}

std::string EchoAnswerFrame() {
    std::string stuffed = nxbase::EncodeBytes(Payload().data(), Payload().size());
    return nxbase::EncodeFrame(nxbase::MessageBody(kPeerName, "ANSWER!GET_DEVICE_NAME", stuffed));
}

// ---- one server, many clients ----

constexpr int kRoundTripsPerClient = 2000;

// Runs `client(i)` in `count` child processes at once and waits for them.
void RunClients(int count, const std::function<void(int)>& client) {
    std::vector<pid_t> children;
    for (int i = 0; i < count; ++i) {
        pid_t child = ::fork();
        if (child == 0) {
            // A reactor of its own, not the parent's epoll instance.
            Application::Get().GetContext().notify_fork(boost::asio::execution_context::fork_child);
            client(i);
            ::_exit(0);
        }
        children.push_back(child);
    }
    for (pid_t child : children) ::waitpid(child, nullptr, 0);
}

// The raw peer of a server: one epoll loop answering every request frame on
// any of its connections with the answer frame.
void RawServer(const std::vector<int>& fds, const std::string& request, const std::string& answer) {
    int poller = ::epoll_create1(EPOLL_CLOEXEC);
    for (int fd : fds) {
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.fd = fd;
        ::epoll_ctl(poller, EPOLL_CTL_ADD, fd, &event);
    }
    std::size_t open = fds.size();
    std::string buffer(request.size(), '\0');
    epoll_event ready[64];
    while (open > 0) {
        int n = ::epoll_wait(poller, ready, 64, -1);
        for (int i = 0; i < n; ++i) {
            int fd = ready[i].data.fd;
            if (!ReadExactly(fd, buffer.data(), buffer.size()) ||
                ::write(fd, answer.data(), answer.size()) < 0) {
                ::epoll_ctl(poller, EPOLL_CTL_DEL, fd, nullptr);
                ::close(fd);
                --open;
            }
        }
    }
}

// Round trips per second of `clients` processes against one raw server.
void RawServerThroughput(benchmark::State& state, int clients) {
    const std::string request = RequestFrame(), answer = DefaultAnswerFrame();
    for (auto _ : state) {
        std::vector<int> serverEnds, clientEnds;
        for (int i = 0; i < clients; ++i) {
            int pair[2];
            ::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair);
            serverEnds.push_back(pair[0]);
            clientEnds.push_back(pair[1]);
        }
        pid_t server = ::fork();
        if (server == 0) {
            for (int fd : clientEnds) ::close(fd);
            RawServer(serverEnds, request, answer);
            ::_exit(0);
        }
        for (int fd : serverEnds) ::close(fd);
        RunClients(clients, [&](int i) {
            std::string received(answer.size(), '\0');
            for (int k = 0; k < kRoundTripsPerClient; ++k) {
                if (::write(clientEnds[static_cast<std::size_t>(i)], request.data(),
                            request.size()) < 0)
                    break;
                ReadExactly(clientEnds[static_cast<std::size_t>(i)], received.data(),
                            received.size());
            }
        });
        for (int fd : clientEnds) ::close(fd);
        ::waitpid(server, nullptr, 0);
    }
    state.SetItemsProcessed(state.iterations() * clients * kRoundTripsPerClient);
}

// The same with a post office answering with its default handler and
// clients that each run their own post office.
void PostOfficeServerThroughput(benchmark::State& state, int clients) {
    Scratch scratch;
    pid_t peer = StartPeer("server", Placement::kAnyCpu);
    WaitForSocket("LumaServer");
    for (auto _ : state) {
        RunClients(clients, [&](int i) {
            ::setenv("NXBASE_LOG_PATH", (scratch.directory + "/log" + std::to_string(i)).c_str(),
                     1);
            PostOffice* office =
                PostOffice::CreatePostOffice(String("BenchClient" + std::to_string(i)));
            MyMemoryBlock request, answer;
            request.Put(Payload().data(), static_cast<long>(Payload().size()));
            for (int k = 0; k < kRoundTripsPerClient; ++k) {
                office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer,
                                       [] { return true; });
            }
            NxSingleton::DeleteAllSingleton();
        });
    }
    state.SetItemsProcessed(state.iterations() * clients * kRoundTripsPerClient);
    StopPeer(peer);
}

// Each pair of contenders, peer last: the pair's ratio is peer / baseline.
struct Pair {
    std::string name;
    std::function<void(benchmark::State&, Placement)> contender;
    std::function<void(benchmark::State&, Placement)> baseline;
    std::vector<Placement> placements;
    bool rates = false;  // compare items per second instead of time
};

std::vector<Pair> Pairs() {
    auto raw = [](const std::string& answer) {
        return [answer](benchmark::State& state, Placement placement) {
            RawPingPong(state, placement, RequestFrame(), answer);
        };
    };
    std::vector<Placement> both{Placement::kSameCpu, Placement::kTwoCpus};
    auto on = [](Loop loop) {
        return [loop](benchmark::State& state, Placement placement) {
            PostOfficeRoundTrip(state, placement, loop);
        };
    };
    auto ownLoop = on(Loop::kOwn);
    std::vector<Pair> pairs = {
        {"SendAndReceive_vs_RawPingPong", ownLoop, raw(DefaultAnswerFrame()), both},
        {"PipeRoundTrip_vs_RawPingPong", PipeRoundTrip, raw(EchoAnswerFrame()), both},
        {"BareLoopPingPong_vs_RawPingPong", LoopPingPong, raw(DefaultAnswerFrame()), both},
        {"SendAndReceiveOverDBus_vs_OverSockets",
         DdeRoundTrip,
         [](benchmark::State& state, Placement placement) {
             PostOfficeRoundTrip(state, placement);
         },
         {Placement::kTwoCpus}},
        {"ServerThroughput4Clients_vs_RawServer",
         [](benchmark::State& state, Placement) { PostOfficeServerThroughput(state, 4); },
         [](benchmark::State& state, Placement) { RawServerThroughput(state, 4); },
         {Placement::kAnyCpu},
         true},
        {"ServerThroughput16Clients_vs_RawServer",
         [](benchmark::State& state, Placement) { PostOfficeServerThroughput(state, 16); },
         [](benchmark::State& state, Placement) { RawServerThroughput(state, 16); },
         {Placement::kAnyCpu},
         true},
    };
#ifdef NXBASE_BENCH_GUI_LOOPS
    pairs.push_back({"SendAndReceiveGLibLoop_vs_OwnLoop", on(Loop::kGLib), ownLoop, both});
    pairs.push_back({"SendAndReceiveQtLoop_vs_OwnLoop", on(Loop::kQt), ownLoop, both});
#endif
    return pairs;
}

constexpr int kRounds = 5;

std::string BaseName(const std::string& pair, const char* side, Placement placement, int round) {
    return nxbench::RoundName(pair, side, PlacementName(placement), round);
}

}  // namespace

int RunPeer(const std::string& mode, int cpu) {
    PinTo(cpu);
    ::signal(SIGTERM, [](int) { Application::Get().Quit(); });
    if (mode == "server" || mode == "server-dde") {
        if (mode == "server-dde") Pipe::SetSocketListening(false);
        PostOffice::CreatePostOffice("LumaServer");  // answers with its default handler
    } else {
        Pipe::CreatePipe(kPeerName)->SetReceiveFunction(EchoAnswer);
    }
    Application::Get().Execute();
    NxSingleton::DeleteAllSingleton();
    Pipe::DeletePipe();
    return 0;
}

int main(int argc, char** argv) {
    if (argc == 4 && std::strcmp(argv[1], "--peer") == 0)
        return RunPeer(argv[2], std::atoi(argv[3]));
    benchmark::Initialize(&argc, argv);
    const std::vector<Pair> pairs = Pairs();
    // Rounds outermost, so that the two sides of a pair run next to each
    // other and drifts of the machine hit both.
    for (int round = 1; round <= kRounds; ++round) {
        for (const Pair& pair : pairs) {
            for (Placement placement : pair.placements) {
                auto contender = pair.contender;
                auto baseline = pair.baseline;
                benchmark::RegisterBenchmark(
                    BaseName(pair.name, "baseline", placement, round).c_str(),
                    [baseline, placement](benchmark::State& state) { baseline(state, placement); })
                    ->UseRealTime();
                benchmark::RegisterBenchmark(
                    BaseName(pair.name, "contender", placement, round).c_str(),
                    [contender, placement](benchmark::State& state) {
                        contender(state, placement);
                    })
                    ->UseRealTime();
            }
        }
    }
    nxbench::RoundReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    std::printf(
        "\nRatios contender / baseline, min / median / max over %d interleaved rounds: of the real "
        "time per message (caller on CPU 0, peer on CPU 0 for SameCpu or 1 for TwoCpus, one thread "
        "each), and for ServerThroughput of round trips per second (one server process and 4 or 16 "
        "client processes, all free on every CPU; %d round trips per client):\n",
        kRounds, kRoundTripsPerClient);
    for (const Pair& pair : pairs) {
        for (Placement placement : pair.placements) {
            std::vector<double> ratios;
            for (int round = 1; round <= kRounds; ++round) {
                std::string base =
                    nxbench::RealTimeName(BaseName(pair.name, "baseline", placement, round));
                std::string contender =
                    nxbench::RealTimeName(BaseName(pair.name, "contender", placement, round));
                // Times: contender / baseline; rates: contender / baseline too,
                // so that above 1 is slower for times and faster for rates.
                double a = pair.rates ? reporter.Rate(contender) : reporter.Time(contender);
                double b = pair.rates ? reporter.Rate(base) : reporter.Time(base);
                if (a > 0 && b > 0) ratios.push_back(a / b);
            }
            nxbench::PrintSpread(pair.name + " " + PlacementName(placement), ratios);
        }
    }
    benchmark::Shutdown();
    return 0;
}
