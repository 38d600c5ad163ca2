// DDE on a private D-Bus session bus that the test starts: pokes between two
// processes with their data intact, connects to foreign topics refused, the
// transports' choice of DDE for a peer without a request socket, and a peer
// that dies.
#include "nxbase/dde.h"

#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>

#include "log_test_util.h"
#include "messaging_test_util.h"
#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"

namespace {

using namespace std::chrono_literals;
using nxtest::RunUntil;

// A test here reads what DDE logged.
::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

std::vector<VELTRAEvent> gReceived;
void Record(VELTRAEvent& event) {
    gReceived.push_back(event);
}

std::string Shell(const std::string& command) {
    return nxtest::ShellOutput(command);
}

class DdeTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!sandbox.StartBus()) GTEST_SKIP() << "no dbus-daemon";
        sandbox.RegisterAbsentServer();
        peer = sandbox.AddPeer("EchoPeer", NXBASE_PIPE_PEER, "ddepeer");
        server = sandbox.CopyProgram(NXBASE_BINARY_DIR "/tools/lumaserver", "ddeserver");
        gReceived.clear();
        Application::Get().ResetQuit();
    }
    void TearDown() override {
        NxSingleton::DeleteAllSingleton();
        Pipe::DeletePipe();
        Pipe::SetSocketListening(true);
    }
    nxtest::MessagingSandbox sandbox{"dde"};
    std::string peer, server;
};

TEST_F(DdeTest, APokeReachesThePeerWithSenderCommandAndDataIntact) {
    // This process is reached by DDE only; the peer is started on demand.
    Pipe::SetSocketListening(false);
    Pipe* pipe = Pipe::CreatePipe("DdeTester");
    PostOfficeApplications applications("DdeTester");
    pipe->SetApplications(&applications);
    pipe->SetReceiveFunction(Record);
    DDE* dde = DDE::Instance();
    ASSERT_TRUE(dde->IsActive());
    EXPECT_FALSE(pipe->IsListening());
    EXPECT_FALSE(dde->IsAppRunning(nxbase::kDdeService, "EchoPeer"));

    std::string data("\x00\x01\x02\x01\x0A:x\x00", 8);
    MyMemoryBlock block(8);
    block.Put(data.data(), 8);
    nxbase::EncodeBlock(block);
    ASSERT_TRUE(pipe->Send("EchoPeer", "GET_DEVICE_NAME", block));
    EXPECT_TRUE(dde->IsAppRunning(nxbase::kDdeService, "EchoPeer"));
    ASSERT_TRUE(RunUntil([] { return !gReceived.empty(); }));
    EXPECT_EQ(gReceived[0].GetSender(), "EchoPeer");
    EXPECT_EQ(gReceived[0].GetCommand(), "ANSWER!GET_DEVICE_NAME");
    EXPECT_EQ(std::string(gReceived[0].GetData().GetDatenZeiger(),
                          static_cast<std::size_t>(gReceived[0].GetData().Len())),
              data);

    // Connects only for the service and one of the receiver's own topics.
    std::string call =
        "dbus-send --session --print-reply --dest=" + nxbase::DdeBusName("EchoPeer") + " " +
        nxbase::kDdeObjectPath + " " + nxbase::kDdeInterface +
        ".Connect string:VELTRAApplication string:";
    EXPECT_THAT(Shell(call + "EchoPeer"), HasSubstr("boolean true"));
    EXPECT_THAT(Shell(call + "SomeoneElse"), HasSubstr("boolean false"));
    EXPECT_FALSE(dde->IsAppRunning(nxbase::kDdeService, "SomeoneElse"));
    EXPECT_FALSE(dde->IsAppRunning("OtherService", "EchoPeer"));

    // Execute hands at most 500 bytes to the execute function, on the loop.
    std::string executed;
    dde->SetExecuteFunction([&](const std::string& text) { executed = text; });
    std::string bytes;
    for (int i = 0; i < 600; ++i) bytes += (i ? ",0x" : "0x") + std::string(i % 2 ? "41" : "42");
    std::string execute =
        "dbus-send --session --print-reply --dest=" + nxbase::DdeBusName("DdeTester") + " " +
        nxbase::kDdeObjectPath + " " + nxbase::kDdeInterface +
        ".Execute string:DdeTester array:byte:" + bytes + " > /dev/null 2>&1 &";
    ASSERT_EQ(std::system(execute.c_str()), 0);
    ASSERT_TRUE(RunUntil([&] { return !executed.empty(); }));
    EXPECT_EQ(executed.size(), 500u);
    EXPECT_EQ(executed.substr(0, 4), "BABA");
}

TEST_F(DdeTest, AServerReachedOnlyByDdeAnswersAsOverSocketsAndADeadOneFailsTheSend) {
    ASSERT_EQ(std::system((server + " --dde-only &").c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("Tester");  // with its socket
    ASSERT_TRUE(
        RunUntil([&] { return DDE::Instance()->IsAppRunning(nxbase::kDdeService, "LumaServer"); }));
    EXPECT_FALSE(std::filesystem::exists(sandbox.runtime() + "/PipeRequest-LumaServer"));
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer,
                                       [] { return true; }));
    MyMemoryBlock expected;
    expected << static_cast<signed char>(0) << String("LumaSpectro Emulator");
    EXPECT_EQ(std::string(answer.GetDatenZeiger(), static_cast<std::size_t>(answer.Len())),
              std::string(expected.GetDatenZeiger(), static_cast<std::size_t>(expected.Len())));

    // Killed: the next send fails (its registered path does not exist), and
    // the loop goes on.
    Shell("pkill -9 -f " + server);
    ASSERT_TRUE(RunUntil([&] { return !nxtest::ProcessRunning(server); }, 5s));
    // Pokes are one way: the bus must have seen the death (the name freed)
    // before a send can know.
    ASSERT_TRUE(RunUntil(
        [] { return !DDE::Instance()->IsAppRunning(nxbase::kDdeService, "LumaServer"); }, 5s));
    MyMemoryBlock none;
    EXPECT_FALSE(office->Send("LumaServer", IS_APP_READY, none));
    EXPECT_TRUE(RunUntil([] { return true; }));
}

TEST_F(DdeTest, ABusThatGoesAwayTurnsDdeOffTheSocketsServeOnAndItsReturnIsJoined) {
    nxtest::LogSince log;
    ASSERT_EQ(std::system((server + " &").c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    ASSERT_TRUE(RunUntil([] { return nxbase::IsApplicationRunning("LumaServer"); }));
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer,
                                       [] { return true; }));
    ASSERT_TRUE(DDE::Instance()->IsActive());
    // A logout, a restarted bus: neither this process nor the server ends.
    sandbox.StopBus();
    EXPECT_TRUE(RunUntil([] { return !DDE::Instance()->IsActive(); }, 5s));
    RunUntil([] { return false; }, 300ms);
    EXPECT_TRUE(nxtest::ProcessRunning(server));
    EXPECT_TRUE(
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, nxtest::For(5s)))
        << office->GetLastError();
    EXPECT_THAT(log.Text(), HasSubstr("DDE is off: the session bus was lost"));
    // The bus comes back at its address: this process and the server join it again.
    ASSERT_TRUE(sandbox.StartBus());
    EXPECT_TRUE(RunUntil([] { return DDE::Instance()->IsActive(); }, 20s));
    EXPECT_TRUE(RunUntil(
        [] { return DDE::Instance()->IsAppRunning(nxbase::kDdeService, "LumaServer"); }, 20s));
    EXPECT_THAT(log.Text(), HasSubstr("DDE is on again: the session bus is back"));
}

TEST_F(DdeTest, AnOfficeMadeWhileTheBusRestartsServesOnSocketsAndJoinsItLater) {
    sandbox.StopBus();  // the address is set, its daemon gone
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    EXPECT_FALSE(Application::Get().IsQuitting());
    EXPECT_FALSE(DDE::Instance()->IsActive());
    MyMemoryBlock request, answer;
    EXPECT_TRUE(office->SendAndReceive("EchoPeer", GET_APP_VERSION, request, answer, [] {
        return true;
    })) << office->GetLastError();
    ASSERT_TRUE(sandbox.StartBus());
    EXPECT_TRUE(RunUntil([] { return DDE::Instance()->IsActive(); }, 20s));
}

TEST_F(DdeTest, TwoPeopleOnOneBusEachRunAServerAndATakenNameLeavesTheSockets) {
    // alice's and bob's servers on one login and one bus: names of their own.
    for (const char* person : {"alice", "bob"}) {
        std::string start = "USERNAME=" + std::string(person) + " " + server + " &";
        ASSERT_EQ(std::system(start.c_str()), 0);
    }
    for (const char* person : {"alice", "bob"}) {
        std::string socket = sandbox.runtime() + "/PipeRequest-LumaServer_" + person;
        EXPECT_TRUE(RunUntil([&] { return nxtest::Accepts(socket); }, 5s)) << person;
    }
    RunUntil([] { return false; }, 300ms);
    EXPECT_EQ(nxtest::ProcessesNamed(server).size(), 2u);
    // Both gone before the name is taken: a server still ending holds it.
    Shell("pkill -f " + server);
    ASSERT_TRUE(RunUntil([&] { return nxtest::ProcessesNamed(server).empty(); }, 5s));
    // The server's bus name held by somebody else: it serves on its socket.
    auto holder = sdbus::createSessionBusConnection(nxbase::DdeBusName("LumaServer"));
    ASSERT_EQ(std::system((server + " &").c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    ASSERT_TRUE(RunUntil([] { return nxbase::IsApplicationRunning("LumaServer"); }));
    MyMemoryBlock request, answer;
    EXPECT_TRUE(
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer, nxtest::For(5s)));
}

TEST_F(DdeTest, APokeSpeaksOnlyForTheConnectionThatOwnsItsName) {
    ASSERT_EQ(std::system((server + " &").c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("AppA");
    ASSERT_TRUE(RunUntil([] { return nxbase::IsApplicationRunning("LumaServer"); }));
    MyMemoryBlock level, lock, answer;
    level << static_cast<unsigned char>(2);
    lock << static_cast<unsigned char>(0);
    ASSERT_TRUE(office->SendAndReceive("LumaServer", CONNECT, level, answer, [] { return true; }));
    ASSERT_TRUE(office->SendAndReceive("LumaServer", LOCK, lock, answer, [] { return true; }));
    // Somebody on the bus claims to be AppA, connected over the sockets, and
    // says goodbye for it: refused, and the server stays for AppA.
    std::string spoof =
        "dbus-send --session --print-reply --dest=" + nxbase::DdeBusName("LumaServer") + " " +
        nxbase::kDdeObjectPath + " " + nxbase::kDdeInterface +
        ".Poke string:LumaServer string:DISCONNECT array:byte:0x41,0x70,0x70,0x41,0x3a";
    EXPECT_THAT(Shell(spoof), HasSubstr("boolean false"));
    RunUntil([] { return false; }, 1500ms);
    EXPECT_TRUE(nxtest::ProcessRunning(server));
    ASSERT_TRUE(
        office->SendAndReceive("LumaServer", GET_DEVICE_NAME, level, answer, [] { return true; }));
}

TEST_F(DdeTest, ALargePokeIsHeldAtMostTwiceByItsReceiver) {
    ASSERT_EQ(std::system((server + " --dde-only &").c_str()), 0);
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    ASSERT_TRUE(
        RunUntil([&] { return DDE::Instance()->IsAppRunning(nxbase::kDdeService, "LumaServer"); }));
    const std::string status =
        "/proc/" + std::to_string(std::stol(Shell("pgrep -f " + server))) + "/status";
    MyMemoryBlock small, answer;
    auto ask = [&](MyMemoryBlock& request) {
        return office->SendAndReceive("LumaServer", GET_DEVICE_NAME, request, answer,
                                      [] { return true; });
    };
    ASSERT_TRUE(ask(small));
    const long base = nxtest::ProcStatusField(status, "VmHWM");
    constexpr long kBytes = 60L << 20;
    MyMemoryBlock large(kBytes);
    large.Put(std::string(kBytes, 'a').data(), kBytes);
    ASSERT_TRUE(ask(large));
    const long held = nxtest::ProcStatusField(status, "VmHWM") - base;
    std::printf("a 60 MiB poke raised the receiver by %ld KiB\n", held);
    if (!nxtest::kSanitized) {
        EXPECT_LT(held, 2 * (kBytes >> 10) + 8 * 1024);
    }
}

}  // namespace
