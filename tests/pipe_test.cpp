// The Unix-socket transport between real processes: frames on the wire, a
// peer started on demand, bad input from raw sockets, foreign users refused.
#include "nxbase/pipe.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <random>
#include <thread>

#include "log_test_util.h"
#include "messaging_test_util.h"
#include "nxbase/language.h"
#include "nxbase/msgcat.h"
#include "nxbase/poapps.h"
#include "nxbase/registry.h"
#include "test_util.h"
#include "toolkit/application.h"
#include "toolkit/unixsocket.h"

namespace {

using namespace std::chrono_literals;

// A test here reads what the pipe logged.
::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

std::vector<VELTRAEvent> gReceived;

void Record(VELTRAEvent& event) {
    gReceived.push_back(event);
}

using nxtest::Block;
using nxtest::Bytes;
using nxtest::Hex;
using nxtest::RunUntil;

TEST(PipeWire, FramesAndTheHandshakeByteForByte) {
    std::string stuffed = nxbase::EncodeBytes("\x00\x01\x02", 3);
    EXPECT_EQ(Hex(nxbase::EncodeFrame(nxbase::MessageBody("App", "LOCK", stuffed))),
              "0e000000417070004c4f434b00010a010102");
    EXPECT_EQ(Hex(nxbase::EncodeFrame("App_42")), "060000004170705f3432");
    EXPECT_EQ(Hex(nxbase::EncodeFrame(std::string(300, 'x')).substr(0, 4)), "2c010000");
    {
        nxtest::ScopedEnv user("USERNAME", "");
        EXPECT_EQ(nxbase::PipeName("PipeRequest-LumaServer"), "PipeRequest-LumaServer");
    }
    nxtest::ScopedEnv user("USERNAME", "anna");
    EXPECT_EQ(nxbase::PipeName("PipeRequest-LumaServer"), "PipeRequest-LumaServer_anna");

    std::string sender, command, data;
    ASSERT_TRUE(nxbase::SplitMessageBody(std::string("A\0B\0", 4), sender, command, data));
    EXPECT_EQ(command, "B");
    EXPECT_EQ(data, "");
    EXPECT_FALSE(nxbase::SplitMessageBody(std::string("A\0B", 3), sender, command, data));
}

TEST(PipeWire, TheFrameReaderTakesBytesInAnyPiecesAndRefusesHugeLengths) {
    std::string stream = nxbase::EncodeFrame("one") + nxbase::EncodeFrame("") +
                         nxbase::EncodeFrame(std::string(5000, 'z')) + nxbase::EncodeFrame("two");
    nxbase::FrameReader reader;
    std::vector<std::string> bodies;
    std::string body;
    for (char c : stream) {  // one byte at a time
        reader.Append(&c, 1);
        while (reader.Next(body) == nxbase::FrameReader::Result::kFrame) bodies.push_back(body);
    }
    ASSERT_EQ(bodies.size(), 3u);  // the empty frame is consumed, not delivered
    EXPECT_EQ(bodies[0], "one");
    EXPECT_EQ(bodies[1].size(), 5000u);
    EXPECT_EQ(bodies[2], "two");
    EXPECT_EQ(reader.Buffered(), 0u);

    nxbase::FrameReader huge;
    std::string limit = nxbase::EncodeFrame("");
    std::uint32_t length = nxbase::kMaxFrameLength + 1;
    std::memcpy(limit.data(), &length, 4);  // little-endian host
    huge.Append(limit.data(), limit.size());
    EXPECT_EQ(huge.Next(body), nxbase::FrameReader::Result::kMalformed);
    huge.Append("more", 4);
    EXPECT_EQ(huge.Next(body), nxbase::FrameReader::Result::kMalformed);
}

class PipeTest : public ::testing::Test {
  protected:
    void SetUp() override {
        sandbox.RegisterAbsentServer();
        applications = std::make_unique<PostOfficeApplications>("PipeTestClient");
        pipe = Pipe::CreatePipe("PipeTestClient");
        pipe->SetReceiveFunction(Record);
        pipe->SetApplications(applications.get());
        // Started peers get the current language's country code.
        nxtest::WriteFile(root + "/Texte1.lng", "");
        nxtest::WriteFile(root + "/Texte49.lng", "");
        Language::CreateLanguage(nullptr, FileLanguageAccessChecker(String(root + "/Texte")));
        Language::Instance()->SetLanguageByCountryCode(static_cast<LanguageCode>(49));
        gReceived.clear();
        Application::Get().ResetQuit();
    }

    void TearDown() override {
        if (pipe->HasChannel("EchoPeer")) {
            MyMemoryBlock none;
            pipe->Send("EchoPeer", "QUIT", none);
            RunUntil([&] { return !pipe->HasChannel("EchoPeer"); }, 5s);
        }
        Pipe::DeletePipe();
        NxSingleton::DeleteAllSingleton();
    }

    // Sends `data` as GET_DEVICE_NAME to the echo peer and waits for the echo.
    std::string RoundTrip(const std::string& data) {
        std::size_t before = gReceived.size();
        MyMemoryBlock block = Block(data);
        nxbase::EncodeBlock(block);
        if (!pipe->Send("EchoPeer", "GET_DEVICE_NAME", block)) return "<send failed>";
        if (!RunUntil([&] { return gReceived.size() > before; })) return "<no answer>";
        return Bytes(gReceived.back().GetData());
    }

    // A raw connection to our own request socket, handshake done.
    int RawClient(const std::string& name) {
        const int fd = nxtest::ConnectUnix(pipe->GetSocketPath());
        EXPECT_GE(fd, 0);
        std::string request = nxbase::EncodeFrame(name + "_1");
        EXPECT_EQ(::write(fd, request.data(), request.size()),
                  static_cast<ssize_t>(request.size()));
        EXPECT_TRUE(RunUntil([&] { return pipe->HasChannel(name); }));
        char reply[256];
        ssize_t n = ::recv(fd, reply, sizeof reply, 0);
        EXPECT_GT(n, 4);
        EXPECT_EQ(std::string(reply + 4, static_cast<std::size_t>(n) - 4),
                  "DirectPipe-PipeTestClient_" + std::to_string(::getpid()));
        return fd;
    }

    nxtest::MessagingSandbox sandbox{"pipe"};
    const std::string root = sandbox.root(), runtime = sandbox.runtime(),
                      peerProgram = sandbox.AddPeer("EchoPeer", NXBASE_PIPE_PEER, "echopeer");
    std::unique_ptr<PostOfficeApplications> applications;
    Pipe* pipe = nullptr;
};

TEST_F(PipeTest, APeerIsStartedOnDemandAndFramesOfEverySizeComeBackIntact) {
    EXPECT_TRUE(pipe->IsListening());
    EXPECT_EQ(pipe->GetSocketPath(), runtime + "/PipeRequest-PipeTestClient");
    struct stat info {};
    ASSERT_EQ(::stat(runtime.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0700u);

    std::string pattern;
    for (int i = 0; i < (1 << 20); ++i) pattern += static_cast<char>((i * 7 + i / 251) & 0xFF);
    for (std::size_t size : {0u, 1u, 4095u, 4096u, 4097u, 1u << 20}) {
        std::string data = pattern.substr(0, size);
        EXPECT_EQ(RoundTrip(data), data) << size;
    }
    ASSERT_EQ(gReceived.size(), 6u);
    EXPECT_EQ(gReceived[0].GetSender(), "EchoPeer");
    EXPECT_EQ(gReceived[0].GetCommand(), "ANSWER!GET_DEVICE_NAME");
    // A frame one byte longer than a reader takes is refused here, and the
    // channel stays ("PipeTestClient", "IS_READY" and two zero bytes).
    const std::string over(nxbase::kMaxFrameLength - 14 - 8 - 2 + 1, 'x');
    Pipe::SendScope overScope(pipe, nullptr);
    EXPECT_FALSE(pipe->Send("EchoPeer", "IS_READY", over));
    EXPECT_TRUE(overScope.Hopeless()) << "retrying cannot make it fit";
    EXPECT_EQ(pipe->GetLastError(), "a message of " + std::to_string(nxbase::kMaxFrameLength + 1) +
                                        " bytes is above the frame limit of 64 MiB");
    EXPECT_TRUE(pipe->HasChannel("EchoPeer"));

    // It was started with the start line, in its own directory.
    std::vector<std::string> started = nxtest::ReadLines(runtime + "/EchoPeer.started");
    ASSERT_EQ(started.size(), 2u);
    EXPECT_EQ(started[0], peerProgram + " -S -LNG 49");
    EXPECT_EQ(started[1], root + "/bin");
    EXPECT_TRUE(nxbase::IsApplicationRunning("EchoPeer"));

    // A second process under a name that is taken fails to listen and leaves
    // ours alone.
    EXPECT_NE(nxtest::InChild([] {
                  ::execl(NXBASE_PIPE_PEER, NXBASE_PIPE_PEER, "PipeTestClient", nullptr);
                  return 127;
              }),
              0);
    EXPECT_EQ(RoundTrip("still here"), "still here");
}

// Back-to-back frames in any pieces: see the random streams below.
TEST_F(PipeTest, BadInputClosesOnlyItsChannel) {
    ASSERT_EQ(RoundTrip("warm"), "warm");
    std::string random(4096, '\0');
    unsigned state = 12345;
    for (char& c : random) c = static_cast<char>((state = state * 1103515245u + 12345u) >> 16);
    std::string huge = "\xFF\xFF\xFF\xFF";
    const std::vector<std::pair<std::string, std::string>> bad = {
        {"length above the limit", huge},
        {"a body without its zero bytes", nxbase::EncodeFrame("no zeros here")},
        {"a frame cut short", nxbase::EncodeFrame(std::string(100, 'x')).substr(0, 30)},
        {"random bytes", random},
    };
    for (const auto& [what, bytes] : bad) {
        int raw = RawClient("Bad");
        std::size_t channels = pipe->ChannelCount();
        ASSERT_EQ(::write(raw, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
        if (what == "a frame cut short") ::shutdown(raw, SHUT_WR);
        EXPECT_TRUE(RunUntil([&] { return pipe->ChannelCount() == channels - 1; }, 3s)) << what;
        EXPECT_FALSE(pipe->HasChannel("Bad")) << what;
        EXPECT_EQ(RoundTrip(what), what) << "after " << what;
        ::close(raw);
    }
}

// Random streams from raw clients: frames of every size cut into random
// writes, the loop turning between them or not, and the stream ended by a
// shutdown, a close or not at all right behind its last bytes or after a
// turn that read part of them. Every frame
// must arrive whole and in order, and the channel must end exactly when its
// stream did, however the end shared a wake-up with the last bytes.
TEST_F(PipeTest, RandomStreamsArriveWholeAndEveryEndIsSeen) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    auto draw = [&](std::size_t low, std::size_t high) {
        return std::uniform_int_distribution<std::size_t>(low, high)(random);
    };
    for (int round = 0; round < 200; ++round) {
        const std::string name = "Rnd" + std::to_string(round);
        const int fd = RawClient(name);
        ASSERT_EQ(::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK), 0);
        // Room for more than one turn's reads, so that some are cut off.
        const int room = 1 << 20;
        ::setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &room, sizeof room);
        std::vector<std::string> sent;
        std::string stream;
        for (std::size_t frames = draw(1, 6); frames > 0; --frames) {
            const std::size_t sizes[] = {draw(0, 64), draw(16000, 16800), draw(20000, 300000)};
            std::string payload(sizes[draw(0, 9) / 4], '\0');
            for (char& c : payload) c = static_cast<char>(draw(0, 255));
            sent.push_back(payload);
            stream += nxbase::EncodeFrame(nxbase::MessageBody(
                name, "IS_READY", nxbase::EncodeBytes(payload.data(), payload.size())));
        }
        for (std::size_t at = 0; at < stream.size();) {
            const ssize_t n =
                ::write(fd, stream.data() + at, std::min(draw(1, 70000), stream.size() - at));
            if (n > 0) at += static_cast<std::size_t>(n);
            ASSERT_TRUE(n > 0 || errno == EAGAIN) << std::strerror(errno);
            for (std::size_t turns = n > 0 ? draw(0, 1) : 1; turns > 0; --turns)
                Application::Get().RunOneFor(std::chrono::milliseconds(draw(0, 2)));
        }
        // Now and then one turn before the end: it reads part of what is
        // there, and the end comes between that turn and the next.
        if (draw(0, 3) == 0) Application::Get().RunOneFor(std::chrono::milliseconds(0));
        const std::size_t ending = draw(0, 2);  // open, shut down, closed
        if (ending == 1) ::shutdown(fd, SHUT_WR);
        if (ending == 2) ::close(fd);
        auto count = [&] {
            return static_cast<std::size_t>(
                std::count_if(gReceived.begin(), gReceived.end(),
                              [&](const VELTRAEvent& e) { return e.GetSender() == name; }));
        };
        EXPECT_TRUE(RunUntil(
            [&] { return count() == sent.size() && (ending == 0) == pipe->HasChannel(name); }, 10s))
            << "round " << round << ", ending " << ending << ": " << count() << " of "
            << sent.size() << " frames, channel " << (pipe->HasChannel(name) ? "open" : "closed");
        std::vector<std::string> got;
        for (const VELTRAEvent& e : gReceived)
            if (e.GetSender() == name) got.push_back(Bytes(e.GetData()));
        EXPECT_TRUE(got == sent) << "round " << round;
        if (ending != 2) ::close(fd);
        ASSERT_TRUE(RunUntil([&] { return !pipe->HasChannel(name); })) << "round " << round;
        gReceived.clear();
    }
}

TEST_F(PipeTest, ALostPeerIsReportedAndTheNextSendStartsItAgain) {
    std::vector<std::string> lost;
    pipe->SetChannelLostFunction([&](const std::string& peer) { lost.push_back(peer); });
    ASSERT_EQ(RoundTrip("one"), "one");
    MyMemoryBlock none;
    ASSERT_TRUE(pipe->Send("EchoPeer", "QUIT", none));
    ASSERT_TRUE(RunUntil([&] { return !lost.empty(); }));
    EXPECT_EQ(lost, std::vector<std::string>{"EchoPeer"});
    EXPECT_FALSE(pipe->HasChannel("EchoPeer"));
    RunUntil([&] { return !nxbase::IsApplicationRunning("EchoPeer"); }, 5s);
    EXPECT_EQ(RoundTrip("two"), "two");
    // An application nobody registered is not started and the send fails.
    EXPECT_FALSE(pipe->Send("Nobody", "IS_READY", none));
    pipe->SetChannelLostFunction(nullptr);
    // A connection's id is never used again, not even by a new transport:
    // a request that names one of the old transport matches nothing new.
    const std::uint64_t last = pipe->ChannelId("EchoPeer");
    Pipe::DeletePipe();
    pipe = Pipe::CreatePipe("PipeTestClient");
    pipe->SetReceiveFunction(Record);
    pipe->SetApplications(applications.get());
    EXPECT_EQ(RoundTrip("three"), "three");
    EXPECT_GT(pipe->ChannelId("EchoPeer"), last);
}

TEST_F(PipeTest, AConnectionMustSayWhoItIsAndAStoppedPeerNeverBlocksTheLoop) {
    // Silent, or a request without a process id: closed, the silent one after 5 s.
    std::size_t channels = pipe->ChannelCount();
    auto connect = [&] {
        const int fd = nxtest::ConnectUnix(pipe->GetSocketPath());
        EXPECT_GE(fd, 0);
        return fd;
    };
    int silent = connect();
    int nameless = connect();
    std::string request = nxbase::EncodeFrame("NoProcessId");
    ASSERT_EQ(::write(nameless, request.data(), request.size()),
              static_cast<ssize_t>(request.size()));
    ASSERT_TRUE(RunUntil([&] { return pipe->ChannelCount() == channels + 1; }, 2s));
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(RunUntil([&] { return pipe->ChannelCount() == channels; }, 8s));
    EXPECT_GE(std::chrono::steady_clock::now() - start, 4s);
    ::close(silent);
    ::close(nameless);

    // A peer stopped before it could answer the handshake: the caller's
    // keep-waiting function ends the wait when it says so, not the transport.
    ASSERT_EQ(RoundTrip("start it"), "start it");
    pid_t peer = nxtest::FindProcess(peerProgram);
    ASSERT_GT(peer, 0);
    ASSERT_EQ(::kill(peer, SIGSTOP), 0);
    Pipe::DeletePipe();  // a fresh transport must open a new channel
    pipe = Pipe::CreatePipe("PipeTestClient");
    pipe->SetApplications(applications.get());
    start = std::chrono::steady_clock::now();
    {
        Pipe::SendScope scope(pipe, [&] { return std::chrono::steady_clock::now() - start < 3s; });
        MyMemoryBlock none;
        EXPECT_FALSE(pipe->Send("EchoPeer", "IS_READY", none));
    }
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, 2900ms);
    EXPECT_LT(took, 3500ms);
    EXPECT_THAT(pipe->GetLastError(), HasSubstr("EchoPeer")) << pipe->GetLastError();
    ::kill(peer, SIGCONT);
    pipe->SetReceiveFunction(Record);
    EXPECT_EQ(RoundTrip("goes on"), "goes on");
}

// Socket calls that fail on demand, the system's otherwise.
class FailingSockets : public toolkit::SocketCalls {
  public:
    int failSends = 0;
    bool refuseConnects = false;
    ssize_t Send(int fd, const char* data, std::size_t size) override {
        if (failSends > 0) {
            --failSends;
            errno = EIO;
            return -1;
        }
        return SocketCalls::Send(fd, data, size);
    }
    int Connect(const std::string& path) override {
        if (!refuseConnects) return SocketCalls::Connect(path);
        errno = ECONNREFUSED;
        return -1;
    }
};

TEST_F(PipeTest, PeersThatNeverReadAreCappedTogether) {
    // Three peers that never read, each under its own limit, over the sum's:
    // the one with the most waiting goes, the others stay.
    constexpr std::size_t kEach = nxbase::kMaxAllQueuedBytes / 3 + (1u << 20);
    static_assert(kEach < nxbase::kMaxQueuedBytes);
    std::string big(kEach, 'x');
    std::vector<int> peers;
    for (const char* name : {"Deaf1", "Deaf2", "Deaf3"}) peers.push_back(RawClient(name));
    EXPECT_TRUE(pipe->Send("Deaf1", "IS_READY", big));
    EXPECT_TRUE(pipe->Send("Deaf2", "IS_READY", big));
    EXPECT_FALSE(pipe->Send("Deaf3", "IS_READY", big + "more"));
    EXPECT_THAT(pipe->GetLastError(), HasSubstr("outgoing frames of all channels"))
        << pipe->GetLastError();
    EXPECT_TRUE(pipe->HasChannel("Deaf1"));
    EXPECT_TRUE(pipe->HasChannel("Deaf2"));
    EXPECT_FALSE(pipe->HasChannel("Deaf3"));
    // The kept total: the two queues left, within the cap.
    EXPECT_GT(pipe->QueuedBytes(), kEach);
    EXPECT_LE(pipe->QueuedBytes(), nxbase::kMaxAllQueuedBytes);
    for (int fd : peers) ::close(fd);
}

TEST_F(PipeTest, AFailedWriteClosesOnlyItsChannelAndSaysWhy) {
    ASSERT_EQ(RoundTrip("before"), "before");
    FailingSockets failing;
    toolkit::SocketCalls* previous = toolkit::SetSocketCalls(&failing);
    failing.failSends = 1;
    MyMemoryBlock none;
    EXPECT_FALSE(pipe->Send("EchoPeer", "IS_READY", none));
    EXPECT_THAT(pipe->GetLastError(), HasSubstr("Input/output error")) << pipe->GetLastError();
    EXPECT_FALSE(pipe->HasChannel("EchoPeer"));
    // The next send opens a new channel to the peer, which still runs.
    EXPECT_EQ(RoundTrip("after"), "after");
    // A peer that runs but refuses connections is not started a second time.
    pipe->SetChannelLostFunction(nullptr);
    Pipe::DeletePipe();
    pipe = Pipe::CreatePipe("PipeTestClient");
    pipe->SetApplications(applications.get());
    failing.refuseConnects = true;
    auto startedAt = std::filesystem::last_write_time(runtime + "/EchoPeer.started");
    std::this_thread::sleep_for(20ms);  // a start now would show in the time
    auto start = std::chrono::steady_clock::now();
    {
        Pipe::SendScope scope(pipe,
                              [&] { return std::chrono::steady_clock::now() - start < 500ms; });
        EXPECT_FALSE(pipe->Send("EchoPeer", "IS_READY", none));
    }
    EXPECT_GE(std::chrono::steady_clock::now() - start, 450ms);  // it waited for the running one
    RunUntil([] { return false; }, 200ms);
    EXPECT_EQ(std::filesystem::last_write_time(runtime + "/EchoPeer.started"), startedAt);
    toolkit::SetSocketCalls(previous);
    pipe->SetReceiveFunction(Record);
    // Stopping frees the name: no socket, no lock file left behind.
    Pipe::DeletePipe();
    EXPECT_FALSE(std::filesystem::exists(runtime + "/PipeRequest-PipeTestClient"));
    EXPECT_FALSE(std::filesystem::exists(runtime + "/PipeRequest-PipeTestClient.lock"));
    pipe = Pipe::CreatePipe("PipeTestClient");
    pipe->SetReceiveFunction(Record);
}

TEST_F(PipeTest, ARefusedRuntimeDirectoryIsAnErrorTheUserSees) {
    Pipe::DeletePipe();
    ASSERT_EQ(::chmod(runtime.c_str(), 0755), 0);
    pipe = Pipe::CreatePipe("PipeTestClient");
    EXPECT_FALSE(pipe->IsListening());
    EXPECT_THAT(pipe->GetRefusal(), HasSubstr("open to other users")) << pipe->GetRefusal();
    MyMemoryBlock none;
    EXPECT_FALSE(pipe->Send("EchoPeer", "IS_READY", none));
    EXPECT_THAT(pipe->GetLastError(), HasSubstr("runtime directory refused"))
        << pipe->GetLastError();
    // The server says so and ends instead of running without a socket.
    if (::access(NXBASE_BINARY_DIR "/tools/lumaserver", X_OK) != 0) return;  // tools not built
    const nxtest::ShellResult server = nxtest::Shell(NXBASE_BINARY_DIR "/tools/lumaserver");
    EXPECT_GT(server.status, 0);
    EXPECT_THAT(server.out, HasSubstr("open to other users")) << server.out;
    ::chmod(runtime.c_str(), 0700);
}

// A peer that finds the socket file must be able to connect at once: a
// listener that showed its name before it listened refused such a peer.
TEST_F(PipeTest, AListenerAcceptsTheMomentItsSocketAppears) {
    for (int round = 0; round < 20; ++round) {
        const std::string name = "Racer" + std::to_string(round);
        const std::string path = nxbase::RequestSocketPath(name);
        const pid_t peer = nxtest::Fork([&] {
            ::execl(NXBASE_PIPE_PEER, NXBASE_PIPE_PEER, name.c_str(), nullptr);
            return 127;
        });
        auto deadline = std::chrono::steady_clock::now() + 10s;
        while (!std::filesystem::exists(path) && std::chrono::steady_clock::now() < deadline) {
        }
        EXPECT_TRUE(nxtest::Accepts(path)) << "round " << round;
        ::kill(peer, SIGKILL);
        ::waitpid(peer, nullptr, 0);
    }
}

TEST_F(PipeTest, APeerOfAnotherUserIsRefusedBeforeAnyByteIsRead) {
    nxtest::LogSince log;
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
    // Let user 65534 reach the socket, so that only the credential check stands.
    ::chmod(root.c_str(), 0711);
    ::chmod(runtime.c_str(), 0711);
    ::chmod(pipe->GetSocketPath().c_str(), 0666);
    std::size_t channels = pipe->ChannelCount();
    const pid_t child = nxtest::Fork([&] {
        if (!nxtest::DropRoot()) return 3;
        const int fd = nxtest::ConnectUnix(pipe->GetSocketPath());
        if (fd < 0) return 4;
        std::string request = nxbase::EncodeFrame("Intruder_1");
        (void)!::send(fd, request.data(), request.size(), MSG_NOSIGNAL);
        char reply[64];
        return ::recv(fd, reply, sizeof reply, 0) <= 0 ? 0 : 5;  // closed without a reply
    });
    EXPECT_EQ(nxtest::ExitWhileLooping(child), 0);
    EXPECT_EQ(pipe->ChannelCount(), channels);
    EXPECT_FALSE(pipe->HasChannel("Intruder"));
    EXPECT_THAT(log.Text(), Not(HasSubstr("Intruder")));
}

}  // namespace
