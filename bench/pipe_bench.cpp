// One message there and back between two processes: through Pipe (frame,
// byte stuffing, event loop, delivery) against a raw Unix-socket ping-pong of
// the same frame bytes, both with the two processes pinned to one CPU and
// free to run on any. The peer is this program started again with "--peer".
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

// The raw baseline: a child echoing frames on a socket pair.
void RawPingPong(benchmark::State& state, bool pinned) {
    PinToOneCpu(pinned);
    std::string stuffed = nxbase::EncodeBytes(Payload().data(), Payload().size());
    std::string frame =
        nxbase::EncodeFrame(nxbase::MessageBody("BenchClient", "GET_DEVICE_NAME", stuffed));
    int sockets[2];
    ::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets);
    pid_t child = ::fork();
    if (child == 0) {
        ::close(sockets[0]);
        std::string buffer(frame.size(), '\0');
        while (ReadExactly(sockets[1], buffer.data(), buffer.size())) {
            if (::write(sockets[1], buffer.data(), buffer.size()) < 0) break;
        }
        ::_exit(0);
    }
    ::close(sockets[1]);
    std::string answer(frame.size(), '\0');
    for (auto _ : state) {
        if (::write(sockets[0], frame.data(), frame.size()) < 0) break;
        ReadExactly(sockets[0], answer.data(), answer.size());
    }
    ::close(sockets[0]);
    ::waitpid(child, nullptr, 0);
    PinToOneCpu(false);
}

// The same exchange through Pipe with a peer process running its loop.
void PipeRoundTrip(benchmark::State& state, bool pinned) {
    PinToOneCpu(pinned);
    char pattern[] = "/tmp/nxbase-bench-XXXXXX";
    std::string runtime = ::mkdtemp(pattern);
    ::setenv("NXBASE_RUNTIME_DIR", runtime.c_str(), 1);
    ::setenv("NXBASE_LOG_PATH", (runtime + "/log").c_str(), 1);
    ::unsetenv("USERNAME");
    Pipe* pipe = Pipe::CreatePipe("BenchClient");
    pipe->SetReceiveFunction(CountAnswer);
    pid_t peer = ::fork();
    if (peer == 0) {
        ::execl("/proc/self/exe", "pipe_bench", "--peer", nullptr);
        ::_exit(127);
    }
    MyMemoryBlock data;
    data.Put(Payload().data(), static_cast<long>(Payload().size()));
    nxbase::EncodeBlock(data);
    // Wait until the peer listens.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!pipe->Send(kPeerName, "IS_READY", data) && std::chrono::steady_clock::now() < deadline) {
        ::usleep(10000);
    }
    Application& app = Application::Get();
    gReceived = 0;
    while (gReceived < 1 && std::chrono::steady_clock::now() < deadline) app.RunOneFor(std::chrono::milliseconds(10));
    for (auto _ : state) {
        int before = gReceived;
        pipe->Send(kPeerName, "GET_DEVICE_NAME", data);
        while (gReceived == before) app.RunOneFor(std::chrono::milliseconds(100));
    }
    Pipe::DeletePipe();  // the peer sees its channel close and ends
    ::kill(peer, SIGTERM);
    ::waitpid(peer, nullptr, 0);
    std::filesystem::remove_all(runtime);
    PinToOneCpu(false);
}

void BM_RawSocketPingPong_Pinned(benchmark::State& state) { RawPingPong(state, true); }
void BM_RawSocketPingPong_Unpinned(benchmark::State& state) { RawPingPong(state, false); }
void BM_PipeRoundTrip_Pinned(benchmark::State& state) { PipeRoundTrip(state, true); }
void BM_PipeRoundTrip_Unpinned(benchmark::State& state) { PipeRoundTrip(state, false); }

BENCHMARK(BM_RawSocketPingPong_Pinned)->UseRealTime();
BENCHMARK(BM_PipeRoundTrip_Pinned)->UseRealTime();
BENCHMARK(BM_RawSocketPingPong_Unpinned)->UseRealTime();
BENCHMARK(BM_PipeRoundTrip_Unpinned)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
    if (argc == 2 && std::strcmp(argv[1], "--peer") == 0) {
        Pipe::CreatePipe(kPeerName)->SetReceiveFunction(EchoAnswer);
        Pipe::Instance()->SetChannelLostFunction([](const std::string&) { Application::Get().Quit(); });
        Application::Get().Execute();
        Pipe::DeletePipe();
        return 0;
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
