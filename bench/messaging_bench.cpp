// Messages between two processes against raw Unix sockets carrying the same
// bytes, with both processes pinned to one CPU and free to run on any:
// - one message there and back through Pipe (frame, byte stuffing, event
//   loop, delivery) against a raw ping-pong of the same frame;
// - PostOffice::SendAndReceive to a post office answering with its default
//   handler, against a raw ping-pong of the same request and answer frames;
// - one-way PostOffice::Send into a peer that reads and drops, against raw
//   writes of the same frames.
// The peers are this program started again with "--peer MODE".
#include <benchmark/benchmark.h>
#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "nxbase/registry.h"
#include "toolkit/application.h"

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

void PinToOneCpu(bool pinned) {
    cpu_set_t set;
    CPU_ZERO(&set);
    if (pinned) {
        CPU_SET(0, &set);
    } else {
        for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) CPU_SET(cpu, &set);
    }
    sched_setaffinity(0, sizeof set, &set);
}

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
void RawPingPong(benchmark::State& state, bool pinned, const std::string& request,
                 const std::string& answer) {
    PinToOneCpu(pinned);
    int sockets[2];
    ::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets);
    pid_t child = ::fork();
    if (child == 0) {
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
    PinToOneCpu(false);
}

// The raw one-way baseline: writes of `frame` into a child that reads and drops.
void RawWrites(benchmark::State& state, bool pinned, const std::string& frame) {
    PinToOneCpu(pinned);
    int sockets[2];
    ::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets);
    pid_t child = ::fork();
    if (child == 0) {
        ::close(sockets[0]);
        char buffer[65536];
        while (::read(sockets[1], buffer, sizeof buffer) > 0) {
        }
        ::_exit(0);
    }
    ::close(sockets[1]);
    for (auto _ : state) {
        if (::write(sockets[0], frame.data(), frame.size()) < 0) break;
    }
    ::close(sockets[0]);
    ::waitpid(child, nullptr, 0);
    PinToOneCpu(false);
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

pid_t StartPeer(const char* mode) {
    pid_t peer = ::fork();
    if (peer == 0) {
        ::execl("/proc/self/exe", "messaging_bench", "--peer", mode, nullptr);
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

// SendAndReceive to a post office that answers with its default handler.
void PostOfficeRoundTrip(benchmark::State& state, bool pinned) {
    PinToOneCpu(pinned);
    Scratch scratch;
    pid_t peer = StartPeer("server");
    WaitForSocket("LumaServer");
    PostOffice* office = PostOffice::CreatePostOffice("BenchClient");
    MyMemoryBlock request, answer;
    request.Put(Payload().data(), static_cast<long>(Payload().size()));
    office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, [] { return true; });
    for (auto _ : state) {
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, [] { return true; });
    }
    NxSingleton::DeleteAllSingleton();
    StopPeer(peer);
    PinToOneCpu(false);
}

// SendAndReceive to the same server reached by DDE on a private D-Bus bus.
void DdeRoundTrip(benchmark::State& state) {
    Scratch scratch;
    std::string address = "unix:path=" + scratch.directory + "/bus";
    pid_t daemon = ::fork();
    if (daemon == 0) {
        ::execl("/usr/bin/dbus-daemon", "dbus-daemon", "--session", "--nofork",
                ("--address=" + address).c_str(), nullptr);
        ::_exit(127);
    }
    for (int i = 0; i < 500 && !std::filesystem::exists(scratch.directory + "/bus"); ++i) ::usleep(10000);
    ::setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
    pid_t peer = StartPeer("server-dde");
    PostOffice* office = PostOffice::CreatePostOffice("BenchClient");
    MyMemoryBlock request, answer;
    request.Put(Payload().data(), static_cast<long>(Payload().size()));
    for (int i = 0; i < 500 && !office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer,
                                                       [] { return true; }); ++i) {
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
}

// One-way sends into a peer that drops them.
void PostOfficeSends(benchmark::State& state, bool pinned) {
    PinToOneCpu(pinned);
    Scratch scratch;
    pid_t peer = StartPeer("sink");
    WaitForSocket("BenchSink");
    PostOffice* office = PostOffice::CreatePostOffice("BenchClient");
    MyMemoryBlock request;
    request.Put(Payload().data(), static_cast<long>(Payload().size()));
    office->Send("BenchSink", GET_DEVICE_NAME, request);
    for (auto _ : state) office->Send("BenchSink", GET_DEVICE_NAME, request);
    NxSingleton::DeleteAllSingleton();
    StopPeer(peer);
    PinToOneCpu(false);
}

// The same exchange through Pipe with a peer process running its loop.
void PipeRoundTrip(benchmark::State& state, bool pinned) {
    PinToOneCpu(pinned);
    Scratch scratch;
    pid_t peer = StartPeer("echo");
    WaitForSocket(kPeerName);
    Pipe* pipe = Pipe::CreatePipe("BenchClient");
    pipe->SetReceiveFunction(CountAnswer);
    MyMemoryBlock data;
    data.Put(Payload().data(), static_cast<long>(Payload().size()));
    nxbase::EncodeBlock(data);
    Application& app = Application::Get();
    gReceived = 0;
    pipe->Send(kPeerName, "IS_READY", data);
    while (gReceived < 1) app.RunOneFor(std::chrono::milliseconds(10));
    for (auto _ : state) {
        int before = gReceived;
        pipe->Send(kPeerName, "GET_DEVICE_NAME", data);
        while (gReceived == before) app.RunOneFor(std::chrono::milliseconds(100));
    }
    Pipe::DeletePipe();
    StopPeer(peer);
    PinToOneCpu(false);
}

std::string EchoAnswerFrame() {
    std::string stuffed = nxbase::EncodeBytes(Payload().data(), Payload().size());
    return nxbase::EncodeFrame(nxbase::MessageBody(kPeerName, "ANSWER!GET_DEVICE_NAME", stuffed));
}

void BM_RawSocketPingPong_PipeFrames_Pinned(benchmark::State& state) {
    RawPingPong(state, true, RequestFrame(), EchoAnswerFrame());
}
void BM_PipeRoundTrip_Pinned(benchmark::State& state) { PipeRoundTrip(state, true); }
void BM_RawSocketPingPong_PipeFrames_Unpinned(benchmark::State& state) {
    RawPingPong(state, false, RequestFrame(), EchoAnswerFrame());
}
void BM_PipeRoundTrip_Unpinned(benchmark::State& state) { PipeRoundTrip(state, false); }

void BM_RawSocketPingPong_PostOfficeFrames_Pinned(benchmark::State& state) {
    RawPingPong(state, true, RequestFrame(), DefaultAnswerFrame());
}
void BM_PostOfficeSendAndReceive_Pinned(benchmark::State& state) { PostOfficeRoundTrip(state, true); }
void BM_RawSocketPingPong_PostOfficeFrames_Unpinned(benchmark::State& state) {
    RawPingPong(state, false, RequestFrame(), DefaultAnswerFrame());
}
void BM_PostOfficeSendAndReceive_Unpinned(benchmark::State& state) {
    PostOfficeRoundTrip(state, false);
}

void BM_PostOfficeSendAndReceive_OverSockets(benchmark::State& state) {
    PostOfficeRoundTrip(state, false);
}
void BM_PostOfficeSendAndReceive_OverDBus(benchmark::State& state) { DdeRoundTrip(state); }

void BM_RawSocketWrites_OneWay_Unpinned(benchmark::State& state) {
    RawWrites(state, false, RequestFrame());
}
void BM_PostOfficeSend_OneWay_Unpinned(benchmark::State& state) { PostOfficeSends(state, false); }

BENCHMARK(BM_RawSocketPingPong_PipeFrames_Pinned)->UseRealTime();
BENCHMARK(BM_PipeRoundTrip_Pinned)->UseRealTime();
BENCHMARK(BM_RawSocketPingPong_PipeFrames_Unpinned)->UseRealTime();
BENCHMARK(BM_PipeRoundTrip_Unpinned)->UseRealTime();
BENCHMARK(BM_RawSocketPingPong_PostOfficeFrames_Pinned)->UseRealTime();
BENCHMARK(BM_PostOfficeSendAndReceive_Pinned)->UseRealTime();
BENCHMARK(BM_RawSocketPingPong_PostOfficeFrames_Unpinned)->UseRealTime();
BENCHMARK(BM_PostOfficeSendAndReceive_Unpinned)->UseRealTime();
BENCHMARK(BM_RawSocketWrites_OneWay_Unpinned)->UseRealTime();
BENCHMARK(BM_PostOfficeSendAndReceive_OverSockets)->UseRealTime();
BENCHMARK(BM_PostOfficeSendAndReceive_OverDBus)->UseRealTime();
BENCHMARK(BM_PostOfficeSend_OneWay_Unpinned)->UseRealTime();

}  // namespace

void Ignore(VELTRAEvent&) {}

int RunPeer(const std::string& mode) {
    ::signal(SIGTERM, [](int) { Application::Get().Quit(); });
    if (mode == "server" || mode == "server-dde") {
        if (mode == "server-dde") Pipe::SetSocketListening(false);
        PostOffice::CreatePostOffice("LumaServer");  // answers with its default handler
    } else {
        Pipe* pipe = Pipe::CreatePipe(mode == "sink" ? "BenchSink" : kPeerName);
        pipe->SetReceiveFunction(mode == "sink" ? Ignore : EchoAnswer);
    }
    Application::Get().Execute();
    NxSingleton::DeleteAllSingleton();
    Pipe::DeletePipe();
    return 0;
}

int main(int argc, char** argv) {
    if (argc == 3 && std::strcmp(argv[1], "--peer") == 0) return RunPeer(argv[2]);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
