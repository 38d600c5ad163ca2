// lumaserver in a child process, reached through the post office of the test
// process: every message byte for byte, notices to subscribers only, start
// on demand and the end one second after the last peer, nxmsg, and a soak of
// four client processes.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <random>
#include <sstream>

#include "color_test_util.h"
#include "messaging_test_util.h"
#include "nxbase/lumaclient.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "nxbase/progress.h"
#include "nxbase/registry.h"
#include "test_util.h"
#include "toolkit/application.h"

namespace {

using namespace std::chrono_literals;

using nxtest::RunUntil;

std::string Hex(const MyMemoryBlock& block) {
    return nxtest::Hex(nxtest::Bytes(block));
}

std::string HexOf(const std::string& text) {
    MyMemoryBlock block;
    block << String(text);
    return Hex(block);
}

struct Notices {
    std::vector<std::pair<std::string, int>> received;
    long Handle(void* event) {
        MyMemoryBlock data = static_cast<VELTRAEvent*>(event)->GetData();
        String id;
        int index = -1;
        data >> id >> index;
        received.emplace_back(id.str(), index);
        return 0;
    }
};

class LumaServerTest : public ::testing::Test {
  protected:
    void SetUp() override { Application::Get().ResetQuit(); }
    void TearDown() override { NxSingleton::DeleteAllSingleton(); }
    MyMemoryBlock Ask(int message, MyMemoryBlock request = MyMemoryBlock()) {
        MyMemoryBlock answer;
        EXPECT_TRUE(PostOffice::Instance()->SendAndReceive("LumaServer", message, request, answer))
            << nxbase::MessageName(message);
        return answer;
    }
    void Connect() {
        MyMemoryBlock level;
        level << static_cast<unsigned char>(2);
        EXPECT_EQ(Hex(Ask(CONNECT, level)), "02");
    }

    nxtest::MessagingSandbox sandbox{"luma"};
    const std::string root = sandbox.root(), lumaserver = sandbox.AddServer();
};

TEST_F(LumaServerTest, EveryMessageIsAnsweredByteForByte) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    EXPECT_FALSE(nxtest::ProcessRunning(lumaserver));
    Connect();  // starts the server on demand
    EXPECT_TRUE(nxtest::ProcessRunning(lumaserver));
    for (int message : {IS_APP_READY, CANCEL_REQUEST, EXEC_WHITE_MEASUREMENT}) {
        EXPECT_EQ(Hex(Ask(message)), "00") << nxbase::MessageName(message);
    }
    EXPECT_EQ(Hex(Ask(GET_APP_VERSION)), "00" + HexOf("3.0"));
    EXPECT_EQ(Hex(Ask(GET_SERIE_NR)), "00" + HexOf("EMU-0001"));
    EXPECT_EQ(Hex(Ask(GET_DEVICE_NAME)), "00" + HexOf("LumaSpectro Emulator"));
    EXPECT_EQ(Hex(Ask(GET_SW_VERSION)), "00" + HexOf("lumaserver 3.0 (NxBase emulator)"));
    EXPECT_EQ(Hex(Ask(GET_DEVICE_TYPE)), "000100");
    EXPECT_EQ(Hex(Ask(SPECTRUM_REQUEST)), "01");  // nothing measured yet
    EXPECT_EQ(Hex(Ask(MOVE_HOME)), "02");         // not supported

    // The chart's patches in turn, and the first again after the last.
    const std::vector<nxtest::CsvRow> chart = nxtest::ReadPatchCsv(nxtest::ChartPath());
    ASSERT_EQ(chart.size(), 24u);
    for (int i = 0; i < 25; ++i) {
        MyMemoryBlock measured = Ask(EXEC_MEASUREMENT);
        signed char status = -1;
        String id;
        int index = -1;
        measured >> status >> id >> index;
        ASSERT_EQ(status, 0);
        EXPECT_EQ(index, i % 24);
        MyMemoryBlock spectrum = Ask(SPECTRUM_REQUEST);
        String spectrumId;
        int count = 0;
        spectrum >> status >> spectrumId >> count;
        EXPECT_EQ(spectrumId, id);
        ASSERT_EQ(count, 36);
        for (double expected : chart[static_cast<std::size_t>(i % 24)].values) {
            int value = 0;
            spectrum >> value;
            EXPECT_EQ(value, std::lround(static_cast<float>(expected) * 100000.0)) << i;
        }
        EXPECT_FALSE(spectrum.ReadPastEnd());
        EXPECT_EQ(spectrum.Remaining(), 0);
    }
    (void)office;
}

TEST_F(LumaServerTest, NoticesGoToSubscribersOnlyAndTheServerEndsAfterTheLastPeer) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    Notices notices;
    Link handler = LINK(Notices, &notices, Handle);
    office->ChangeMessageHdl(MESSUNG_AUSGELOEST, handler);
    Connect();
    EXPECT_EQ(Hex(Ask(EXEC_MEASUREMENT)).substr(0, 2), "00");
    RunUntil([] { return false; }, 200ms);
    EXPECT_TRUE(notices.received.empty()) << "a notice before subscribing";
    EXPECT_EQ(Hex(Ask(NOTIFY_MESSUNG)), "00");
    Ask(EXEC_MEASUREMENT);
    ASSERT_TRUE(RunUntil([&] { return notices.received.size() == 1; }));
    EXPECT_EQ(notices.received[0], std::make_pair(std::string("2 light skin"), 1));
    EXPECT_EQ(Hex(Ask(NOTIFY_MESSUNG_AUS)), "00");
    Ask(EXEC_MEASUREMENT);
    RunUntil([] { return false; }, 200ms);
    EXPECT_EQ(notices.received.size(), 1u);

    MyMemoryBlock none;
    ASSERT_TRUE(office->Send("LumaServer", DISCONNECT, none));
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(RunUntil([&] { return !nxtest::ProcessRunning(lumaserver); }, 5s));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, 900ms);
    EXPECT_LT(took, 3s);
}

TEST_F(LumaServerTest, APeerThatDiesCountsAsDisconnectedAndFreesTheLock) {
    ASSERT_EQ(nxtest::InChild([] {
                  nxtest::LoopOfItsOwn();
                  PostOffice* office = PostOffice::CreatePostOffice("Crasher");
                  MyMemoryBlock level, lock, answer;
                  level << static_cast<unsigned char>(2);
                  lock << static_cast<unsigned char>(0);
                  bool ok = office->SendAndReceive("LumaServer", CONNECT, level, answer) &&
                            office->SendAndReceive("LumaServer", LOCK, lock, answer);
                  return ok ? 0 : 1;  // no UNLOCK, no DISCONNECT
              }),
              0);
    // Nobody else is connected: the server ends about a second later.
    EXPECT_TRUE(nxtest::WaitFor([&] { return !nxtest::ProcessRunning(lumaserver); }));
}

TEST_F(LumaServerTest, TheTriggerKeyNotifiesWithoutARequest) {
    std::string command = lumaserver + " --trigger-every 50 &";
    ASSERT_EQ(std::system(command.c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    Notices notices;
    Link handler = LINK(Notices, &notices, Handle);
    office->ChangeMessageHdl(MESSUNG_AUSGELOEST, handler);
    // Listening, not merely started: otherwise the send starts a second one.
    ASSERT_TRUE(RunUntil([] { return nxtest::Accepts(nxbase::RequestSocketPath("LumaServer")); }));
    Connect();
    EXPECT_EQ(Hex(Ask(NOTIFY_MESSUNG)), "00");
    ASSERT_TRUE(RunUntil([&] { return notices.received.size() >= 3; }));
    // Consecutive patches.
    EXPECT_EQ((notices.received[1].second - notices.received[0].second + 24) % 24, 1);
    // A measurement by the same application connects and disconnects once:
    // the subscriber's own CONNECT keeps the server and its notices.
    std::vector<nxbase::MeasuredSpectrum> measured;
    std::string error;
    ASSERT_TRUE(nxbase::MeasureWithLumaServer(*office, 1, &measured, &error)) << error;
    std::size_t before = notices.received.size();
    RunUntil([] { return false; }, 1500ms);
    EXPECT_TRUE(nxtest::ProcessRunning(lumaserver));
    EXPECT_GT(notices.received.size(), before + 5);
}

TEST_F(LumaServerTest, AnIdleServerSleeps) {
    PostOffice::CreatePostOffice("Tester");
    Connect();  // started on demand, with its check for being unused
    pid_t server = nxtest::FindProcess(lumaserver);
    ASSERT_NE(server, 0);
    const std::string status = "/proc/" + std::to_string(server) + "/status";
    RunUntil([] { return false; }, 300ms);
    long before = nxtest::ProcStatusField(status, "voluntary_ctxt_switches");
    RunUntil([] { return false; }, 3s);
    long woken = nxtest::ProcStatusField(status, "voluntary_ctxt_switches") - before;
    EXPECT_LE(woken, 2) << "wake-ups of an idle lumaserver in 3 s";
    std::printf("idle lumaserver: %ld voluntary context switches in 3 s\n", woken);
}

TEST_F(LumaServerTest, ASubscriberThatCannotBeReachedHoldsNobodyUp) {
    PostOffice::CreatePostOffice("Third");
    Connect();
    // Deaf listens under its name but never accepts; it subscribed on a
    // channel that it then closed.
    const std::string path = nxbase::RequestSocketPath("Deaf");
    const int deaf = nxtest::ConnectUnix(path, true);
    ASSERT_EQ(::listen(deaf, 4), 0);
    const int channel = nxtest::ConnectUnix(nxbase::RequestSocketPath("LumaServer"));
    ASSERT_GE(channel, 0);
    std::string frames = nxbase::EncodeFrame("Deaf_1") +
                         nxbase::EncodeFrame(nxbase::MessageBody("Deaf", "NOTIFY_MESSUNG", ""));
    ASSERT_EQ(::send(channel, frames.data(), frames.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(frames.size()));
    nxbase::FrameReader reader;
    std::string body;
    ASSERT_TRUE(RunUntil([&] {
        char bytes[512];
        ssize_t n = ::recv(channel, bytes, sizeof bytes, MSG_DONTWAIT);
        if (n > 0) reader.Append(bytes, static_cast<std::size_t>(n));
        return reader.Next(body) == nxbase::FrameReader::Result::kFrame &&
               reader.Next(body) == nxbase::FrameReader::Result::kFrame;  // reply, then answer
    }));
    ::close(channel);
    RunUntil([] { return false; }, 200ms);
    // A third application measures and asks: the notices hold neither up.
    auto start = std::chrono::steady_clock::now();
    Ask(EXEC_MEASUREMENT);
    Ask(GET_APP_VERSION);
    EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
    ::close(deaf);
    ::unlink(path.c_str());
}

// Kills the server when patch `at` has been measured.
struct KillAtPatch : ProgressListener {
    KillAtPatch(std::string name, int at, int count)
        : name(std::move(name)), at(at), count(count) {}
    void DisplayProgress(double fraction) override {
        if (static_cast<int>(std::lround(fraction * count)) == at) Kill();
    }
    void Kill() {
        if (pid_t server = nxtest::FindProcess(name)) ::kill(server, SIGKILL);
    }
    std::string name;
    int at, count;
};

TEST_F(LumaServerTest, AServerLostMidMeasurementFailsItAndIsNotStartedAgain) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    // Blocking: killed after patch 8, the measurement fails at patch 9 and
    // what came before stays; neither the next request nor the cleanup
    // starts a server, which would measure from the first patch again.
    KillAtPatch killer(lumaserver, 8, 24);
    std::vector<nxbase::MeasuredSpectrum> measured;
    std::string error;
    EXPECT_FALSE(nxbase::MeasureWithLumaServer(*office, 24, &measured, &error, &killer));
    EXPECT_EQ(error, "LumaServer was lost at patch 9 of 24");
    ASSERT_EQ(measured.size(), 8u);
    EXPECT_EQ(measured[7].id, "8 purplish blue");
    RunUntil([] { return false; }, 300ms);
    EXPECT_FALSE(nxtest::ProcessRunning(lumaserver));

    // Asynchronous: the same, a call-back per patch.
    std::vector<std::string> ids;
    std::optional<std::string> done;
    nxbase::MeasurementSession session(
        *office, 24,
        [&](const nxbase::MeasuredSpectrum& patch, int number, int count) {
            ids.push_back(patch.id.substr(0, patch.id.find(' ')));
            EXPECT_EQ(count, 24);
            EXPECT_EQ(number, static_cast<int>(ids.size()));
            if (number == 5) killer.Kill();
        },
        [&](bool ok, const std::string& why) { done = ok ? "ok" : why; });
    session.Start();  // starts the server again: a new conversation may
    ASSERT_TRUE(RunUntil([&] { return done.has_value(); }));
    EXPECT_EQ(*done, "LumaServer was lost at patch 6 of 24");
    EXPECT_EQ(ids, (std::vector<std::string>{"1", "2", "3", "4", "5"}));
    RunUntil([] { return false; }, 300ms);
    EXPECT_FALSE(nxtest::ProcessRunning(lumaserver));

    // Undisturbed, it measures every patch in turn and releases the server.
    ids.clear();
    done.reset();
    nxbase::MeasurementSession whole(
        *office, 3,
        [&](const nxbase::MeasuredSpectrum& patch, int, int) {
            ids.push_back(patch.id.substr(0, patch.id.find(' ')));
        },
        [&](bool ok, const std::string& why) { done = ok ? "ok" : why; });
    whole.Start();
    ASSERT_TRUE(RunUntil([&] { return done.has_value(); }));
    EXPECT_EQ(*done, "ok");
    EXPECT_EQ(ids, (std::vector<std::string>{"1", "2", "3"}));
    // Nothing to measure is an error, not a success with no patches.
    EXPECT_FALSE(nxbase::MeasureWithLumaServer(*office, 0, &measured, &error));
    EXPECT_THAT(error, HasSubstr("at least 1")) << error;
    EXPECT_TRUE(RunUntil([&] { return !nxtest::ProcessRunning(lumaserver); }, 5s));
}

TEST_F(LumaServerTest, NxmsgSendsTypedValuesAndPrintsTheAnswer) {
    auto run = [&](const std::string& arguments, int& status) {
        const nxtest::ShellResult result =
            nxtest::Shell(NXBASE_BINARY_DIR "/tools/nxmsg " + arguments);
        status = result.status;
        return result.out;
    };
    int status = -1;
    EXPECT_EQ(run("--expect str LumaServer GET_DEVICE_NAME", status),
              "status 0\nbytes  00 4c 75 6d 61 53 70 65 63 74 72 6f 20 45 6d 75 6c 61 74 6f 72 00\n"
              "values \"LumaSpectro Emulator\"\n");
    EXPECT_EQ(status, 0);
    EXPECT_EQ(run("--expect s LumaServer 13", status), "status 0\nbytes  00 01 00\nvalues 1\n");
    run("LumaServer MOVE_HOME b:5 s:49 i:-3 str:x hex:0a0b", status);
    EXPECT_EQ(status, 1);  // answered with status 2
    for (const char* usage :
         {"LumaServer", "LumaServer IS_READY q:1", "LumaServer IS_READY hex:abc",
          "LumaServer IS_READY b:300", "LumaServer 135"}) {
        run(usage, status);
        EXPECT_EQ(status, 2) << usage;
    }
    EXPECT_THAT(run("LumaServer NO_SUCH", status), HasSubstr("not a message name: NO_SUCH"));
    EXPECT_EQ(status, 2);
    // Every argument is checked before anything is sent: a bad --expect type
    // must not let the measurement run first.
    const std::string badType = run("--expect q LumaServer EXEC_MEASUREMENT", status);
    EXPECT_EQ(status, 2);
    EXPECT_THAT(badType, HasSubstr("unknown type in --expect: \"q\"")) << badType;
    EXPECT_THAT(badType, Not(HasSubstr("status"))) << badType;
    EXPECT_THAT(run("--timeout 1 Nobody IS_READY", status),
                HasSubstr("Nobody is not registered and not running"));
    EXPECT_EQ(status, 3);
    // A stopped server: --timeout bounds the whole exchange, CONNECT included.
    PostOffice::CreatePostOffice("Tester");
    Connect();
    pid_t server = nxtest::FindProcess(lumaserver);
    ASSERT_NE(server, 0);
    ::kill(server, SIGSTOP);
    auto start = std::chrono::steady_clock::now();
    run("--timeout 2 LumaServer GET_DEVICE_NAME", status);
    auto took = std::chrono::steady_clock::now() - start;
    ::kill(server, SIGCONT);
    EXPECT_EQ(status, 3);
    EXPECT_GE(took, 1900ms);
    EXPECT_LT(took, 3s);
    // A listener prints what comes and answers with the default handler.
    int output[2];
    ASSERT_EQ(::pipe(output), 0);
    const pid_t listener = nxtest::Fork([&] {
        ::dup2(output[1], 1);
        ::execl(NXBASE_BINARY_DIR "/tools/nxmsg", "nxmsg", "--listen", "Listener", nullptr);
        return 127;
    });
    ::close(output[1]);
    ASSERT_TRUE(RunUntil([] { return nxbase::IsApplicationRunning("Listener"); }, 5s));
    EXPECT_EQ(run("--timeout 5 Listener GET_DEVICE_TYPE", status), "status 2\nbytes  02\n");
    ::kill(listener, SIGTERM);
    ::waitpid(listener, nullptr, 0);
    char printed[4096] = {};
    EXPECT_GT(::read(output[0], printed, sizeof printed - 1), 0);
    ::close(output[0]);
    EXPECT_THAT(std::string(printed), HasSubstr("nxmsg -> GET_DEVICE_TYPE")) << printed;
}

TEST_F(LumaServerTest, NxcolorMeasuresTheChartThroughTheServer) {
    // nxcolor starts the registered server on demand, measures three patches
    // and prints their colours; the server then ends by itself.
    const auto [status, output] =
        nxtest::Shell(NXBASE_BINARY_DIR "/tools/nxcolor --measure 3 -f csv -p 2");
    EXPECT_EQ(status, 0) << output;
    EXPECT_EQ(std::count(output.begin(), output.end(), '\n'), 4) << output;
    EXPECT_THAT(output, HasSubstr("id,name,X,Y,Z,L*,a*,b*,C*,h\n")) << output;
    // The emulator measures the built-in chart: dark skin's values, to the
    // 1e-5 the server's integers keep.
    EXPECT_THAT(output, HasSubstr(",11.81,10.33,5.17,38.42,13.69,14.42,19.88,46.50\n")) << output;
}

// The server's highest resident memory so far, in KiB.
long HighWaterKiB(pid_t pid) {
    return nxtest::ProcStatusField("/proc/" + std::to_string(pid) + "/status", "VmHWM");
}

// Ends a child process when the test ends, however it ends.
struct Reaper {
    pid_t pid;
    ~Reaper() {
        if (pid <= 0) return;
        ::kill(pid, SIGKILL);
        ::waitpid(pid, nullptr, 0);
    }
};

// A blocking client on the server's socket, handshake done.
int RawClient(const std::string& name) {
    const int fd = nxtest::ConnectUnix(nxbase::RequestSocketPath("LumaServer"));
    if (fd < 0) return -1;
    std::string request = nxbase::EncodeFrame(name + "_1");
    if (::send(fd, request.data(), request.size(), MSG_NOSIGNAL) < 0) return -1;
    char reply[256];
    if (::recv(fd, reply, sizeof reply, 0) <= 4) return -1;
    return fd;
}

bool SendAll(int fd, const std::string& bytes) {
    for (std::size_t done = 0; done < bytes.size();) {
        ssize_t n = ::send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (n <= 0) return false;
        done += static_cast<std::size_t>(n);
    }
    return true;
}

TEST_F(LumaServerTest, LargeFramesAreHeldAtMostTwiceAndPartlyReadOnesAreCapped) {
    const pid_t server = nxtest::Fork([&] {
        ::execl(lumaserver.c_str(), lumaserver.c_str(), nullptr);
        return 127;
    });
    Reaper reaper{server};
    ASSERT_TRUE(RunUntil([] { return nxtest::Accepts(nxbase::RequestSocketPath("LumaServer")); }));
    long base = HighWaterKiB(server);
    // One legal message just under the limit, with no byte to stuff.
    int client = RawClient("Large");
    ASSERT_GE(client, 0);
    std::string body = nxbase::MessageBody("Large", "GET_DEVICE_TYPE",
                                           std::string(nxbase::kMaxFrameLength - 32, 'a'));
    ASSERT_TRUE(SendAll(client, nxbase::EncodeFrame(body)));
    body.clear();
    body.shrink_to_fit();
    char answer[64];
    ASSERT_GT(::recv(client, answer, sizeof answer, 0), 4);
    ::close(client);
    long once = HighWaterKiB(server) - base;
    if (!nxtest::kSanitized) {
        EXPECT_LT(once, 160 * 1024) << "KiB for one 64 MiB message";
    }

    // Eight peers each stop inside a 64 MiB frame after 63 MiB: the server
    // closes channels rather than hold all of it, and serves the others.
    std::vector<pid_t> peers;
    for (int i = 0; i < 8; ++i) {
        peers.push_back(nxtest::Fork([&] {
            int fd = RawClient("Partial" + std::to_string(i));
            std::string head = nxbase::EncodeFrame(std::string()).substr(0, 0);
            std::uint32_t length = nxbase::kMaxFrameLength;
            head.append(reinterpret_cast<const char*>(&length), 4);  // little-endian host
            bool sent = fd >= 0 && SendAll(fd, head) && SendAll(fd, std::string(63u << 20, 'p'));
            char byte;
            while (sent && ::recv(fd, &byte, 1, 0) > 0) {
            }
            return 0;  // closed by the server
        }));
    }
    struct PeersReaper {
        std::vector<pid_t>& peers;
        ~PeersReaper() {
            for (pid_t peer : peers) Reaper{peer};
        }
    } peersReaper{peers};
    std::size_t ended = 0;
    RunUntil(
        [&] {
            for (pid_t& peer : peers) {
                if (peer > 0 && ::waitpid(peer, nullptr, WNOHANG) == peer) {
                    peer = -1;
                    ++ended;
                }
            }
            return ended >= 4;
        },
        nxtest::kSanitized ? 120s : 30s);  // 500 MiB through instrumented copies
    EXPECT_GE(ended, 4u);
    if (!nxtest::kSanitized) {
        EXPECT_LT(HighWaterKiB(server) - base, 400 * 1024) << "KiB with eight partial frames";
    }
    int other = RawClient("Other");
    ASSERT_GE(other, 0);
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(
        SendAll(other, nxbase::EncodeFrame(nxbase::MessageBody("Other", "GET_DEVICE_TYPE", ""))));
    EXPECT_GT(::recv(other, answer, sizeof answer, 0), 4);
    EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
    ::close(other);
}

// CPU seconds the process has used so far.
double CpuSeconds(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    std::istringstream fields(text.substr(text.rfind(')') + 2));
    std::string field;
    long ticks = 0;
    for (int i = 3; i <= 15 && fields >> field; ++i) {
        if (i == 14 || i == 15) ticks += std::stol(field);  // utime, stime
    }
    return static_cast<double>(ticks) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

TEST_F(LumaServerTest, OutOfDescriptorsTheServerBacksOffAndServesAgainOnceFreed) {
    const pid_t server = nxtest::Fork([&] {
        int errors = ::open((root + "/server.err").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        ::dup2(errors, 2);
        ::close(errors);
        rlimit limit{24, 24};
        ::setrlimit(RLIMIT_NOFILE, &limit);
        ::execl(lumaserver.c_str(), lumaserver.c_str(), nullptr);
        return 127;
    });
    Reaper reaper{server};
    ASSERT_TRUE(RunUntil([] { return nxtest::Accepts(nxbase::RequestSocketPath("LumaServer")); }));
    std::vector<int> idle;
    for (int i = 0; i < 40; ++i) {
        const int fd = nxtest::ConnectUnix(nxbase::RequestSocketPath("LumaServer"));
        if (fd >= 0) idle.push_back(fd);
    }
    RunUntil([] { return false; }, 300ms);
    double before = CpuSeconds(server);
    RunUntil([] { return false; }, 1s);
    EXPECT_LT(CpuSeconds(server) - before, 0.2) << "the accept loop spins";
    // The log cannot open its file without descriptors; stderr says it.
    EXPECT_THAT(nxtest::ReadFile(root + "/server.err"), HasSubstr("accepting a connection failed"));
    for (int fd : idle) ::close(fd);
    // The closed ones free their descriptors; a new peer is served.
    int client = RawClient("Later");
    ASSERT_GE(client, 0);
    std::string request = nxbase::EncodeFrame(nxbase::MessageBody("Later", "GET_DEVICE_TYPE", ""));
    ASSERT_TRUE(SendAll(client, request));
    char answer[64];
    EXPECT_GT(::recv(client, answer, sizeof answer, 0), 4);
    ::close(client);
}

TEST_F(LumaServerTest, StartOnDemandSeesOnlyThisUsersServerAndStartsAtMostOncePerSend) {
    // A process of the server's name elsewhere does not count as the server.
    std::filesystem::create_directories(root + "/decoy");
    const std::string program =
        root + "/decoy/" + std::filesystem::path(lumaserver).filename().string();
    std::filesystem::copy_file("/bin/sleep", program);
    const pid_t decoy = nxtest::Fork([&] {
        ::execl(program.c_str(), program.c_str(), "30", nullptr);
        return 127;
    });
    Reaper decoyReaper{decoy};
    PostOffice::CreatePostOffice("Tester");
    Connect();
    EXPECT_TRUE(nxbase::IsApplicationRunning("LumaServer"));
    MyMemoryBlock none;
    PostOffice::Instance()->Send("LumaServer", DISCONNECT, none);
    ASSERT_TRUE(RunUntil([] { return !nxbase::IsApplicationRunning("LumaServer"); }, 5s));
    // DISCONNECT never starts a server.
    EXPECT_FALSE(PostOffice::Instance()->Send("LumaServer", DISCONNECT, none));
    EXPECT_FALSE(nxbase::IsApplicationRunning("LumaServer"));

    // A wrapper script as the registered executable is started once.
    auto reRegister = [&](const std::string& script) {
        std::string path = root + "/bin/wrapper.sh";
        nxtest::WriteFile(path, "#!/bin/sh\necho started >> " + root + "/starts\n" + script + "\n");
        ::chmod(path.c_str(), 0755);
        sandbox.Register("Software\\K-Lume\\LumaServer", "Executable", path);
        NxSingleton::DeleteAllSingleton();
        PostOffice::CreatePostOffice("Tester");
    };
    reRegister("exec " + lumaserver + " \"$@\"");
    Connect();
    EXPECT_EQ(nxtest::ReadLines(root + "/starts").size(), 1u);
    PostOffice::Instance()->Send("LumaServer", DISCONNECT, none);
    ASSERT_TRUE(RunUntil([] { return !nxbase::IsApplicationRunning("LumaServer"); }, 5s));

    // One that ends at once fails the send at once, and says how it ended.
    std::filesystem::remove(root + "/starts");
    reRegister("exit 3");
    auto start = std::chrono::steady_clock::now();
    MyMemoryBlock level, answer;
    level << static_cast<unsigned char>(2);
    EXPECT_FALSE(PostOffice::Instance()->SendAndReceive("LumaServer", CONNECT, level, answer));
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
    EXPECT_THAT(PostOffice::Instance()->GetLastError(), HasSubstr("exited with status 3"))
        << PostOffice::Instance()->GetLastError();
    EXPECT_EQ(nxtest::ReadLines(root + "/starts").size(), 1u);
}

TEST_F(LumaServerTest, FourClientProcessesLoseNoAnswerAndGetNoneTwice) {
    constexpr int kClients = 4;
    constexpr int kRounds = 10000;
    pid_t children[kClients];
    for (int c = 0; c < kClients; ++c) {
        children[c] = nxtest::Fork([&] {
            nxtest::LoopOfItsOwn();
            PostOffice* office = PostOffice::CreatePostOffice(String("Soak" + std::to_string(c)));
            MyMemoryBlock level, answer;
            level << static_cast<unsigned char>(2);
            if (!office->SendAndReceive("LumaServer", CONNECT, level, answer)) return 90;
            const int messages[3] = {GET_SERIE_NR, GET_DEVICE_TYPE, GET_APP_VERSION};
            const char* expected[3] = {"00454d552d3030303100", "000100", "00332e3000"};
            int failures = 0;
            for (int i = 0; i < kRounds; ++i) {
                MyMemoryBlock request, reply;
                request << i;
                failures +=
                    !office->SendAndReceive("LumaServer", messages[i % 3], request, reply) ||
                    Hex(reply) != expected[i % 3];
            }
            MyMemoryBlock none;
            office->Send("LumaServer", DISCONNECT, none);
            NxSingleton::DeleteAllSingleton();
            return failures == 0 ? 0 : 1;
        });
    }
    for (pid_t child : children) EXPECT_EQ(nxtest::WaitExit(child), 0);
}

// The spectrum answer against a model of it: decoded only when whole, of 36
// values, each a reflectance factor no further from 0 than the plausible
// bound; then bit for bit the server's integers over 100000.
TEST(LumaSpectrumAnswer, DecodesExactlyTheAnswersItShouldOverRandomInput) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_int_distribution<int> plausible(-200000, 200000), wild(-2147483647, 2147483647);
    for (int round = 0; round < 3000; ++round) {
        const int count = round % 7 == 0 ? static_cast<int>(random() % 40) : 36;
        std::vector<int> values(static_cast<std::size_t>(std::max(count, 0)));
        for (int& v : values) v = round % 5 == 0 ? wild(random) : plausible(random);
        MyMemoryBlock block;
        block << String("patch " + std::to_string(round)) << count;
        const std::size_t written =
            round % 11 == 0 ? random() % (values.size() + 1) : values.size();
        for (std::size_t k = 0; k < written; ++k) block << values[k];
        bool expected = count == 36 && written == values.size();
        for (const int v : values) expected = expected && std::abs(v / 100000.0) <= 2.0;
        nxbase::MeasuredSpectrum out;
        out.id = "untouched";
        std::string error;
        ASSERT_EQ(nxbase::DecodeSpectrumAnswer(block, &out, &error), expected) << round << error;
        if (!expected) {
            EXPECT_EQ(out.id, "untouched");
            EXPECT_FALSE(error.empty());
            continue;
        }
        EXPECT_EQ(out.id, "patch " + std::to_string(round));
        for (int k = 0; k < 36; ++k)
            ASSERT_EQ(out.values[k], static_cast<float>(values[k] / 100000.0)) << k;
    }
}

}  // namespace
