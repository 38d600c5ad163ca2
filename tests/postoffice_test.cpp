// The post office against raw peers on its own socket and a real peer
// process: the protocol messages, the lock, the queue, waiting for answers.
#include "nxbase/postoffice.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iostream>
#include <thread>

#include "log_test_util.h"
#include "messaging_test_util.h"
#include "nxbase/applock.h"
#include "nxbase/language.h"
#include "nxbase/pipe.h"
#include "nxbase/registry.h"
#include "test_util.h"
#include "toolkit/userinterface.h"

namespace {

using namespace std::chrono_literals;

using nxtest::RunUntil;

// Tests here read what the post office logged.
::testing::Environment* const kLogDir = ::testing::AddGlobalTestEnvironment(
    new nxtest::LogDirEnvironment("Communication,ApplicationLock"));

// A peer speaking the wire protocol by hand on a connection to the post office.
class RawPeer {
  public:
    RawPeer(const std::string& name, const std::string& socketPath) : name_(name) {
        fd_ = nxtest::ConnectUnix(socketPath);
        EXPECT_GE(fd_, 0);
        Write(nxbase::EncodeFrame(name + "_7"));
        Next();  // the "DirectPipe-..." reply
    }
    ~RawPeer() { ::close(fd_); }

    void Send(const std::string& command, const std::string& data) { SendAs(name_, command, data); }
    // Sends `command` and answers the next frame's command and data.
    std::pair<std::string, std::string> Ask(const std::string& command,
                                            const std::string& data = "") {
        Send(command, data);
        return Next();
    }
    // A frame whose sender field names `sender`, whoever this peer is.
    void SendAs(const std::string& sender, const std::string& command, const std::string& data) {
        std::string stuffed = nxbase::EncodeBytes(data.data(), data.size());
        Write(nxbase::EncodeFrame(nxbase::MessageBody(sender, command, stuffed)));
    }
    // The next frame's command and decoded data, the loop running meanwhile;
    // "<none>" when nothing came within the time.
    std::pair<std::string, std::string> Next(std::chrono::milliseconds limit = 3s) {
        std::string body;
        bool got = RunUntil(
            [&] {
                char buffer[4096];
                ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
                if (n > 0) reader_.Append(buffer, static_cast<std::size_t>(n));
                return reader_.Next(body) == nxbase::FrameReader::Result::kFrame;
            },
            limit);
        if (!got) return {"<none>", ""};
        std::string sender, command, data;
        if (!nxbase::SplitMessageBody(body, sender, command, data)) return {body, ""};
        return {command, nxbase::DecodeBytes(data.data(), data.size())};
    }

  private:
    void Write(const std::string& bytes) {
        ASSERT_EQ(::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL),
                  static_cast<ssize_t>(bytes.size()));
    }
    std::string name_;
    int fd_ = -1;
    nxbase::FrameReader reader_;
};

class PostOfficeTest : public ::testing::Test {
  protected:
    void SetUp() override {
        sandbox.RegisterAbsentServer();
        Application::Get().ResetQuit();
    }
    void TearDown() override {
        NxSingleton::DeleteAllSingleton();
        sandbox.EndPrograms();
        while (::waitpid(-1, nullptr, 0) > 0) {  // the scripts' children too
        }
        Application::Get().ResetQuit();
    }
    std::string Log() { return ownLog.Text(); }
    // Registers `id` as a peer whose program is the shell script `body`.
    void RegisterScript(const char* id, const std::string& file, const std::string& body,
                        std::filesystem::perms perms = std::filesystem::perms::owner_all) {
        std::ofstream(root + "/bin/" + file) << "#!/bin/sh\n" << body;
        std::filesystem::permissions(root + "/bin/" + file, perms);
        sandbox.Register("Software\\K-Lume\\ChromaLink\\Applications", id, root + "/bin/" + file);
    }

    nxtest::MessagingSandbox sandbox{"po"};
    nxtest::LogSince ownLog;
    const std::string root = sandbox.root(),
                      echoPeer = sandbox.AddPeer("EchoPeer", NXBASE_PIPE_PEER, "popeer");
    std::shared_ptr<RecordingUserInterface> ui = std::make_shared<RecordingUserInterface>();
    ScopedUserInterface scopedUi{ui};
};

using Answer = std::pair<std::string, std::string>;

TEST_F(PostOfficeTest, ConnectLevelsUnknownNamesAndTheDefaultHandler) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    EXPECT_FALSE(office->IsLPMServer());
    EXPECT_TRUE(office->HasApplication("LumaServer"));
    nxtest::WriteFile(root + "/Texte1.lng", "");
    nxtest::WriteFile(root + "/Texte49.lng", "");
    Language::CreateLanguage(nullptr, FileLanguageAccessChecker(String(root + "/Texte")));
    Language::Instance()->SetLanguageByCountryCode(static_cast<LanguageCode>(1));
    RawPeer peer("Peer", Pipe::Instance()->GetSocketPath());
    peer.Send("CONNECT", std::string("\x05\x31\x00", 3));  // level 5, then the code 49
    EXPECT_EQ(peer.Next(), Answer("ANSWER!CONNECT", "\x03"));
    EXPECT_EQ(Language::Instance()->GetCountryCode(), 49);
    peer.Send("CONNECT", std::string("\x00\x02", 2));  // level 0: the next byte counts
    EXPECT_EQ(peer.Next(), Answer("ANSWER!CONNECT", "\x02"));
    EXPECT_EQ(office->GetConnectionCount(), 2);
    EXPECT_EQ(peer.Ask("NO_SUCH_MESSAGE"), Answer("ANSWER!NO_SUCH_MESSAGE", "\x01"));
    peer.Send("ANSWER!NO_SUCH_MESSAGE", "");  // never answered back
    EXPECT_EQ(peer.Ask("GET_DEVICE_TYPE"), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
    EXPECT_EQ(peer.Ask("DISCONNECT"), Answer("ANSWER!DISCONNECT", std::string("\x00", 1)));
    EXPECT_EQ(office->GetConnectionCount(), 1);
    EXPECT_THAT(Log(), HasSubstr("Botschafent Handler (Message nr: GET_DEVICE_TYPE"));
}

TEST_F(PostOfficeTest, APeersLockRefusesOthersUntilItUnlocks) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    RawPeer peer("Peer", Pipe::Instance()->GetSocketPath());
    RawPeer other("Other", Pipe::Instance()->GetSocketPath());
    EXPECT_EQ(peer.Ask("LOCK", "\x01"), Answer("ANSWER!LOCK", std::string("\x00", 1)));
    EXPECT_EQ(office->GetLockOwner(), "Peer");
    EXPECT_EQ(office->GetLockCount(), 1);
    EXPECT_EQ(other.Ask("GET_DEVICE_TYPE"),
              Answer("ANSWER!GET_DEVICE_TYPE", "\x01"));  // locked by Peer
    EXPECT_EQ(peer.Ask("GET_DEVICE_TYPE"),
              Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));  // the owner is served
    {
        ApplicationLockHolder holder("while locked");
        EXPECT_FALSE(holder.Lock());
    }
    EXPECT_EQ(peer.Ask("UNLOCK"), Answer("ANSWER!UNLOCK", std::string("\x00", 1)));
    EXPECT_EQ(office->GetLockOwner(), "0");
    EXPECT_EQ(ui->Events(), (std::vector<std::string>{"wait 1", "enable 0", "wait 0", "enable 1"}));
    // UNLOCK without LOCK drives the count below zero and leaves the owner.
    EXPECT_EQ(peer.Ask("UNLOCK").first, "ANSWER!UNLOCK");
    EXPECT_EQ(office->GetLockCount(), -1);
    EXPECT_EQ(office->GetLockOwner(), "0");

    // The local lock does not nest; the inner holder leaves the outer's lock.
    {
        ApplicationLockHolder outer("outer");
        ASSERT_TRUE(outer.Lock());
        {
            ApplicationLockHolder inner("inner");
            EXPECT_FALSE(inner.Lock());
        }
        EXPECT_FALSE(office->LockApplication());
    }
    EXPECT_TRUE(office->LockApplication());
    office->UnlockApplication();
    std::string log = Log();
    EXPECT_THAT(log, HasSubstr("Lock fail: String"));
    EXPECT_THAT(log, HasSubstr("Lock fail: App already locked"));
}

struct BusyHandler {
    std::vector<std::string>* order;
    long Handle(void* event) {
        order->push_back(static_cast<VELTRAEvent*>(event)->GetCommand());
        // A command arriving while this handler runs waits for a later tick.
        VELTRAEvent nested("Peer", "IS_READY", MyMemoryBlock());
        PostOffice::Instance()->CommunicationReceiveFunction(nested);
        order->push_back(PostOffice::Instance()->GetQueueSize() == 1 ? "queued" : "not queued");
        return 0;
    }
    long Ready(void* event) {
        order->push_back(static_cast<VELTRAEvent*>(event)->GetCommand());
        return 0;
    }
};

TEST_F(PostOfficeTest, ACommandArrivingWhileAHandlerRunsWaitsForTheNextTick) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    RawPeer peer("Peer", Pipe::Instance()->GetSocketPath());
    std::vector<std::string> order;
    BusyHandler handler{&order};
    Link busy = LINK(BusyHandler, &handler, Handle);
    Link ready = LINK(BusyHandler, &handler, Ready);
    office->ChangeMessageHdl(IS_APP_READY, busy);
    Link previous = office->ChangeMessageHdl(IS_READY, ready);
    EXPECT_FALSE(previous.IsSet());
    EXPECT_EQ(office->GetMessageHdl(IS_READY), ready);
    VELTRAEvent first("Peer", "IS_APP_READY", MyMemoryBlock());
    office->CommunicationReceiveFunction(first);
    EXPECT_EQ(order, (std::vector<std::string>{"IS_APP_READY", "queued"}));
    EXPECT_EQ(office->GetQueueSize(), 1u);
    EXPECT_TRUE(RunUntil([&] { return office->GetQueueSize() == 0; }, 1s));  // the 100 ms tick
    EXPECT_EQ(order.back(), "IS_READY");
}

TEST_F(PostOfficeTest, SendAndReceiveStartsThePeerAndGetsItsAnswer) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    MyMemoryBlock request, answer;
    request << String("hello") << 42;
    ASSERT_TRUE(
        office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer, DisEnableWindow));
    String text;
    int number = 0;
    answer >> text >> number;
    EXPECT_EQ(text, "hello");
    EXPECT_EQ(number, 42);
    EXPECT_EQ(ui->Events(), (std::vector<std::string>{"enable 0", "enable 1"}));
    // Many in a row, each answer to its own request.
    for (int i = 0; i < 200; ++i) {
        MyMemoryBlock send, receive;
        send << i;
        ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_SERIE_NR, send, receive));
        int back = -1;
        receive >> back;
        ASSERT_EQ(back, i);
    }
}

TEST_F(PostOfficeTest, ALostOrSilentPeerEndsTheWaitAndTheLoopGoesOn) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
    // The peer dies without answering: the wait fails at once.
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", CANCEL_REQUEST, request, answer, [] { return true; }));
    EXPECT_LT(std::chrono::steady_clock::now() - start, 3s);
    // Gone from /proc is not yet gone: an exiting process drops its memory
    // before its descriptors, its socket and name lock among them.
    RunUntil(
        [&] {
            return !nxtest::ProcessRunning(echoPeer) && !nxbase::IsApplicationRunning("EchoPeer");
        },
        5s);
    // The next send starts it again.
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));

    // A peer that never answers: the keep-waiting function ends the wait ...
    start = std::chrono::steady_clock::now();
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", IS_APP_READY, request, answer, nxtest::For(200ms)));
    EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
    // ... and without one, the time-out of a handler that cannot ask a person.
    nxtest::ScopedEnv timeout("NXBASE_WAIT_TIMEOUT", "1");
    start = std::chrono::steady_clock::now();
    EXPECT_FALSE(office->SendAndReceive("EchoPeer", IS_APP_READY, request, answer));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, 1s);
    EXPECT_LT(took, 3s);
    EXPECT_THAT(Log(), HasSubstr("NXBASE_WAIT_TIMEOUT"));
    // The loop still serves: another exchange works.
    EXPECT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
}

TEST_F(PostOfficeTest, OneMisbehavingPeerNeitherEndsTheServerNorSpeaksForAnother) {
    PostOffice* server = PostOffice::CreatePostOffice("LumaServer");
    const std::string path = Pipe::Instance()->GetSocketPath();
    RawPeer good("Good", path);
    ASSERT_EQ(good.Ask("CONNECT", "\x02").second, "\x02");
    {
        RawPeer bad("Bad", path);
        bad.Send("DISCONNECT", "");  // never connected
        EXPECT_EQ(bad.Ask("CONNECT", "\x02").second, "\x02");
        bad.Send("DISCONNECT", "");
        bad.Send("DISCONNECT", "");  // a second one from the same peer
        // Frames claiming to come from another application, the server
        // itself included, are dropped unanswered and open no channel.
        bad.SendAs("Good", "GET_DEVICE_TYPE", "");
        bad.SendAs("LumaServer", "GET_DEVICE_TYPE", "");
        auto start = std::chrono::steady_clock::now();
        good.Send("GET_DEVICE_TYPE", "");
        EXPECT_EQ(good.Next(1s), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
        EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
        EXPECT_EQ(good.Next(300ms).first, "<none>");  // one answer, not one per claim
        EXPECT_EQ(bad.Next(300ms).first, "<none>");
    }
    // The bad peer's channel is gone too; only Good's CONNECT counts.
    RunUntil([] { return false; }, 1500ms);
    EXPECT_FALSE(Application::Get().IsQuitting());
    EXPECT_EQ(server->GetConnectionCount(), 1);
    EXPECT_THAT(Log(), HasSubstr("claims to come from LumaServer"));
    EXPECT_THAT(Log(), HasSubstr("Disconnect from Bad ignored"));
    // The server ends one second after its last peer disconnects.
    EXPECT_TRUE(server->IsLPMServer());
    EXPECT_EQ(server->GetAnzahlApp(), 0u);
    good.Send("DISCONNECT", "");
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(RunUntil([] { return Application::Get().IsQuitting(); }, 3s));
    EXPECT_GE(std::chrono::steady_clock::now() - start, 900ms);
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
    EXPECT_THAT(Log(), HasSubstr("No more connections - Closing application"));
}

struct StallingHandler {
    // Runs the loop until two more commands are queued, as a handler that
    // waits for a peer does.
    long Handle(void* event) {
        RunUntil([] { return PostOffice::Instance()->GetQueueSize() >= 2; }, 3s);
        MyMemoryBlock answer;
        answer << static_cast<signed char>(nxbase::kDone);
        PostOffice::Instance()->Answer(static_cast<VELTRAEvent*>(event), answer);
        return 0;
    }
};

TEST_F(PostOfficeTest, TheLockOwnersCommandsPassThoseQueuedBeforeThem) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    const std::string path = Pipe::Instance()->GetSocketPath();
    StallingHandler stalling;
    Link handler = LINK(StallingHandler, &stalling, Handle);
    office->ChangeMessageHdl(IS_APP_READY, handler);
    RawPeer busy("Busy", path), other("Other", path), locker("Locker", path);
    busy.Send("IS_APP_READY", "");
    other.Send("GET_DEVICE_TYPE", "");            // queued while the handler runs
    locker.Send("LOCK", std::string("\x00", 1));  // queued behind it
    EXPECT_EQ(busy.Next().first, "ANSWER!IS_APP_READY");
    EXPECT_EQ(locker.Next(1s), Answer("ANSWER!LOCK", std::string("\x00", 1)));
    EXPECT_EQ(other.Next(300ms).first, "<none>");  // waits for UNLOCK, in its place
    locker.Send("GET_DEVICE_TYPE", "");
    EXPECT_EQ(locker.Next(1s), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
    locker.Send("UNLOCK", "");
    EXPECT_EQ(locker.Next(1s).first, "ANSWER!UNLOCK");
    EXPECT_EQ(other.Next(1s), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
    EXPECT_EQ(office->GetQueueSize(), 0u);
}

long ResidentKiB() {
    return nxtest::ProcStatusField("/proc/self/status", "VmRSS");
}

TEST_F(PostOfficeTest, AnAnswerCountsOnlyFromThePeerAskedAndNoOtherIsKept) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    const std::string path = Pipe::Instance()->GetSocketPath();
    RawPeer asked("Asked", path), other("Other", path);
    int calls = 0;
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("Asked", GET_APP_VERSION, request, answer, [&] {
        if (++calls == 1) other.Send("ANSWER!GET_APP_VERSION", "wrong peer");
        if (calls == 3) {
            EXPECT_EQ(asked.Next().first, "GET_APP_VERSION");
            asked.Send("ANSWER!GET_APP_VERSION", "right peer");
            // Frames carry no request id: an answer too many with no request
            // outstanding is dropped too.
            asked.Send("ANSWER!GET_APP_VERSION", "right peer again");
        }
        return calls < 100;
    }));
    EXPECT_EQ(std::string(answer.GetDatenZeiger(), static_cast<std::size_t>(answer.Len())),
              "right peer");
    RunUntil([] { return false; }, 100ms);
    for (const char* from : {"Other", "Asked"}) {
        EXPECT_THAT(
            Log(),
            HasSubstr(std::string("Answer nobody waits for dropped: ANSWER!GET_APP_VERSION from ") +
                      from))
            << from;
    }

    // A flood of answers nobody asked for is dropped, not stored.
    long before = ResidentKiB();
    const pid_t flooder = nxtest::Fork([&] {
        // Blocking calls only: the child must not run the parent's event loop,
        // whose epoll instance it shares.
        const int fd = nxtest::ConnectUnix(path);
        if (fd < 0) return 1;
        std::string bytes = nxbase::EncodeFrame("Flooder_1");
        char reply[256];
        if (::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0 ||
            ::recv(fd, reply, sizeof reply, 0) <= 0)
            return 2;
        bytes = nxbase::EncodeFrame(
            nxbase::MessageBody("Flooder", "ANSWER!GET_APP_VERSION", std::string(4096, 'a')));
        for (int i = 0; i < 20000; ++i) {
            if (::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0) return 3;
        }
        return 0;
    });
    ASSERT_EQ(nxtest::ExitWhileLooping(flooder, 20s), 0);
    RunUntil([] { return !Pipe::Instance()->HasChannel("Flooder"); }, 5s);
    if (!nxtest::kSanitized) {
        EXPECT_LT(ResidentKiB() - before, 16 * 1024) << "80 MB of unsolicited answers";
    }
}

// A request's data: the peer answers it `lateMs` late, with the same bytes.
MyMemoryBlock Late(int lateMs, const std::string& text) {
    MyMemoryBlock block;
    unsigned char ms[4] = {static_cast<unsigned char>(lateMs),
                           static_cast<unsigned char>(lateMs >> 8),
                           static_cast<unsigned char>(lateMs >> 16), 0};
    block.Put("LATE", 4);
    block.Put(reinterpret_cast<const char*>(ms), 4);
    block.Put(text.data(), static_cast<long>(text.size()));
    return block;
}
// The text of an answer to Late(): what follows the 8 bytes of lateness.
std::string TextOf(const MyMemoryBlock& answer) {
    std::string bytes(answer.GetDatenZeiger(), static_cast<std::size_t>(answer.Len()));
    return bytes.size() >= 8 ? bytes.substr(8) : "<" + bytes + ">";
}

TEST_F(PostOfficeTest, EveryAnswerGoesToItsOwnRequestAndALateOneToNobody) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    std::vector<std::string> got;
    auto record = [&](const std::string& name) {
        return [&got, name](AnswerResult& result) {
            got.push_back(name + "=" + (result.answered ? TextOf(result.data) : "failed"));
            if (!result.answered) std::cerr << name << ": " << result.error << "\n";
        };
    };
    // Two asynchronous requests outstanding at once, for different messages.
    office->SendAndReceiveAsync("EchoPeer", GET_APP_VERSION, Late(50, "version"), record("a"));
    office->SendAndReceiveAsync("EchoPeer", GET_DEVICE_NAME, Late(0, "name"), record("b"));
    ASSERT_TRUE(RunUntil([&] { return got.size() == 2; }));
    RunUntil([] { return false; }, 100ms);  // nobody called twice
    std::sort(got.begin(), got.end());      // the order the peer answered in
    EXPECT_EQ(got, (std::vector<std::string>{"a=version", "b=name"}));

    // A blocking request, then an asynchronous one for the same message: the
    // peer answers in order, and so are the answers handed out.
    got.clear();
    MyMemoryBlock first = Late(150, "first"), answer;
    bool posted = false;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_SERIE_NR, first, answer, [&] {
        if (!posted)
            office->SendAndReceiveAsync("EchoPeer", GET_SERIE_NR, Late(0, "second"), record("c"));
        posted = true;
        return true;
    }));
    EXPECT_EQ(TextOf(answer), "first");
    ASSERT_TRUE(RunUntil([&] { return got.size() == 1; }));
    EXPECT_EQ(got[0], "c=second");

    // A request given up keeps its place: its late answer is dropped, the
    // next request gets its own. Asynchronous by time-out, then blocking by
    // its keep-waiting function.
    got.clear();
    office->SendAndReceiveAsync("EchoPeer", GET_SW_VERSION, Late(300, "late"), record("d"), 50ms);
    ASSERT_TRUE(RunUntil([&] { return got.size() == 1; }));
    EXPECT_EQ(got[0], "d=failed");
    MyMemoryBlock next = Late(0, "on time");
    ASSERT_TRUE(
        office->SendAndReceive("EchoPeer", GET_SW_VERSION, next, answer, [] { return true; }));
    EXPECT_EQ(TextOf(answer), "on time");
    MyMemoryBlock slow = Late(300, "slow");
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", GET_SW_VERSION, slow, answer, nxtest::For(50ms)));
    EXPECT_EQ(office->GetOutstandingCount("EchoPeer", GET_SW_VERSION), 1u);
    next = Late(0, "after");
    ASSERT_TRUE(
        office->SendAndReceive("EchoPeer", GET_SW_VERSION, next, answer, [] { return true; }));
    EXPECT_EQ(TextOf(answer), "after");
    EXPECT_EQ(office->GetOutstandingCount("EchoPeer", GET_SW_VERSION), 0u);
    const std::string log = Log();
    EXPECT_THAT(log, HasSubstr("Late answer dropped: ANSWER!GET_SW_VERSION from EchoPeer"));

    // A lost channel empties the queue: the restarted peer's answers start afresh.
    got.clear();
    office->SendAndReceiveAsync("EchoPeer", GET_DEVICE_TYPE, Late(2000, "never"), record("e"),
                                20ms);
    ASSERT_TRUE(RunUntil([&] { return got.size() == 1; }));
    int lost = 0;
    office->AddPeerLostFunction([&](const std::string& peer) { lost += peer == "EchoPeer"; });
    MyMemoryBlock none;
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", CANCEL_REQUEST, none, answer, [] { return true; }));
    EXPECT_EQ(office->GetOutstandingCount("EchoPeer", GET_DEVICE_TYPE), 0u);
    ASSERT_TRUE(RunUntil([&] { return lost == 1; }));
    RunUntil([&] { return !nxbase::IsApplicationRunning("EchoPeer"); }, 5s);
    next = Late(0, "fresh");
    ASSERT_TRUE(
        office->SendAndReceive("EchoPeer", GET_DEVICE_TYPE, next, answer, [] { return true; }));
    EXPECT_EQ(TextOf(answer), "fresh");
}

TEST_F(PostOfficeTest, AStartThatFailsEndsTheSendAtOnceAndAWaitHasNoTimeLimitButQuit) {
    // A registered program that cannot be run: the reason, at once, whatever
    // the retries (LumaServer's registered file does not exist).
    RegisterScript("Unrunnable", "unrunnable", "", std::filesystem::perms::owner_read);
    RegisterScript("SlowPeer", "slowstart", "sleep 2\n");
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    for (auto [peer, why] : {std::pair{"LumaServer", "No such file or directory"},
                             std::pair{"Unrunnable", "Permission denied"}}) {
        MyMemoryBlock request, answer;
        auto start = std::chrono::steady_clock::now();
        EXPECT_FALSE(office->SendAndReceive(peer, GET_APP_VERSION, request, answer));
        EXPECT_LT(std::chrono::steady_clock::now() - start, 500ms) << peer;
        EXPECT_THAT(office->GetLastError(), HasSubstr(why)) << office->GetLastError();
    }
    // Without $NXBASE_WAIT_TIMEOUT a wait for a silent peer has no limit, even
    // where nobody can abort it (a measurement may wait for an operator);
    // Application::Quit() ends it.
    ASSERT_FALSE(ui->IsInteractive());
    nxtest::ScopedEnv unset("NXBASE_WAIT_TIMEOUT", "");
    Timer quit;
    quit.SetTimeout(1500);
    struct Quitter {
        long Quit(void*) {
            Application::Get().Quit();
            return 0;
        }
    } quitter;
    quit.SetTimeoutHdl(LINK(Quitter, &quitter, Quit));
    quit.Start();
    MyMemoryBlock request, answer;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(office->SendAndReceive("EchoPeer", IS_APP_READY, request, answer));
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, 1400ms);
    EXPECT_LT(took, 3s);
    EXPECT_THAT(office->GetLastError(), HasSubstr("quits")) << office->GetLastError();
    // Quit also ends the wait for a peer being started.
    Application::Get().ResetQuit();
    quit.SetTimeout(300);
    quit.Start();
    start = std::chrono::steady_clock::now();
    EXPECT_FALSE(office->SendAndReceive("SlowPeer", IS_APP_READY, request, answer));
    EXPECT_LT(std::chrono::steady_clock::now() - start, 1500ms);
    EXPECT_THAT(office->GetLastError(), HasSubstr("quits")) << office->GetLastError();
}

TEST_F(PostOfficeTest, AnAsynchronousSendWaitsForAStartWithoutALongTurnOfTheLoop) {
    RegisterScript("SlowPeer", "slowstart", "sleep 2\n");
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    MyMemoryBlock request;
    // The time-out covers the start; the loop's turns stay short meanwhile
    // (a nested wait would make the turn that sends last the whole start).
    for (auto [peer, timeout, expected] :
         {std::tuple{"SlowPeer", 300ms, "within 300 ms"}, std::tuple{"EchoPeer", 10000ms, ""}}) {
        std::optional<AnswerResult> result;
        auto start = std::chrono::steady_clock::now();
        office->SendAndReceiveAsync(
            peer, GET_DEVICE_NAME, request, [&](AnswerResult& answer) { result = answer; },
            timeout);
        auto longestTurn = 0ms;
        while (!result && std::chrono::steady_clock::now() - start < 10s) {
            auto turn = std::chrono::steady_clock::now();
            Application::Get().RunOneFor(20ms);
            longestTurn =
                std::max(longestTurn, std::chrono::duration_cast<std::chrono::milliseconds>(
                                          std::chrono::steady_clock::now() - turn));
        }
        ASSERT_TRUE(result) << peer;
        EXPECT_EQ(result->answered, *expected == '\0') << peer << ": " << result->error;
        EXPECT_THAT(result->error, HasSubstr(expected)) << result->error;
        EXPECT_LT(longestTurn.count(), 100) << peer;
        if (!result->answered) {
            EXPECT_LT(std::chrono::steady_clock::now() - start, 700ms);
        }
    }
}

TEST_F(PostOfficeTest, AForkedChildLeavesItsParentsPostOfficeAlone) {
    PostOffice* office = PostOffice::CreatePostOffice("Host");
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
    const std::string socket = Pipe::Instance()->GetSocketPath();
    // A child that ends its copy, one that sends through it, one that makes
    // its own post office: the parent stays reachable and keeps its channels.
    for (int kind = 0; kind < 3; ++kind) {
        const pid_t child = nxtest::Fork([&] {
            int code = 0;
            if (kind == 0) NxSingleton::DeleteAllSingleton();
            if (kind == 1) {
                MyMemoryBlock none;
                code = PostOffice::Instance()->Send("EchoPeer", GET_DEVICE_NAME, none) ? 1 : 0;
                if (PostOffice::Instance()->GetLastError().find("forked") == std::string::npos)
                    code = 2;
                NxSingleton::DeleteAllSingleton();
            }
            if (kind == 2) {
                PostOffice* own = PostOffice::CreatePostOffice("Child");
                MyMemoryBlock none, reply;
                code =
                    own->SendAndReceive("EchoPeer", GET_DEVICE_NAME, none, reply, nxtest::For(3s))
                        ? 0
                        : 3;
                NxSingleton::DeleteAllSingleton();
            }
            return code;
        });
        EXPECT_EQ(nxtest::ExitWhileLooping(child), 0) << "child " << kind;
        EXPECT_TRUE(std::filesystem::exists(socket)) << "child " << kind;
        EXPECT_TRUE(nxbase::IsApplicationRunning("Host")) << "child " << kind;
        RawPeer visitor("Visitor", socket);
        EXPECT_EQ(visitor.Ask("GET_DEVICE_TYPE"), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"))
            << "child " << kind;
        EXPECT_TRUE(
            office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer, nxtest::For(3s)))
            << "child " << kind << ": " << office->GetLastError();
    }
}

// Destroys every singleton when it fires, as a window closed by its user.
struct Closer {
    long Close(void*) {
        NxSingleton::DeleteAllSingleton();
        return 0;
    }
};

TEST_F(PostOfficeTest, DestroyingThePostOfficeEndsTheWaitsOnIt) {
    RegisterScript("SlowPeer", "slowstart", "sleep 1\n");
    Closer closer;
    Timer close;
    close.SetTimeoutHdl(LINK(Closer, &closer, Close));
    close.SetTimeout(300);
    // A blocking wait for an answer that never comes.
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
    close.Start();
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(
        office->SendAndReceive("EchoPeer", IS_APP_READY, request, answer, [] { return true; }));
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
    EXPECT_FALSE(PostOffice::IsInitialized());
    // An asynchronous send waiting for its peer to start, and a blocking one.
    for (bool async : {true, false}) {
        office = PostOffice::CreatePostOffice("Tester");
        bool called = false;
        close.Start();
        start = std::chrono::steady_clock::now();
        if (async) {
            office->SendAndReceiveAsync("SlowPeer", GET_DEVICE_NAME, request,
                                        [&](AnswerResult&) { called = true; });
            RunUntil([] { return !PostOffice::IsInitialized(); }, 3s);
        } else {
            EXPECT_FALSE(office->SendAndReceive("SlowPeer", GET_DEVICE_NAME, request, answer,
                                                [] { return true; }));
        }
        EXPECT_LT(std::chrono::steady_clock::now() - start, 900ms) << async;
        EXPECT_FALSE(PostOffice::IsInitialized());
        EXPECT_EQ(Pipe::Instance(), nullptr);
        RunUntil([] { return false; }, 100ms);
        EXPECT_FALSE(called);  // dropped uncalled, as the header says
    }
    EXPECT_FALSE(std::filesystem::exists(sandbox.runtime() + "/PipeRequest-Tester"));
}

// Neither a program the post office starts nor one the application starts
// itself (std::system: fork and exec, nothing closed) holds the library's
// sockets, loop descriptors or locks; the first does not get the
// application's own descriptors either.
TEST_F(PostOfficeTest, AStartedProgramGetsNoDescriptorButTheStandardOnes) {
    RegisterScript("FdLister", "fdlister", "ls -l /proc/self/fd > " + root + "/fds.txt\n");
    // What this process was handed by whoever started it is not the library's.
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        const int fd = std::stoi(entry.path().filename().string());
        if (fd > 2) ::fcntl(fd, F_SETFD, FD_CLOEXEC);
    }
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    MyMemoryBlock request, answer;
    ASSERT_TRUE(office->SendAndReceive("EchoPeer", GET_DEVICE_NAME, request, answer));
    RawPeer accepted("Accepted", Pipe::Instance()->GetSocketPath());  // an accepted channel
    const int own = ::open((root + "/own.txt").c_str(), O_WRONLY | O_CREAT, 0600);  // inherited
    ASSERT_GE(own, 0);
    EXPECT_FALSE(office->SendAndReceive("FdLister", GET_DEVICE_NAME, request, answer));
    ASSERT_EQ(std::system(("ls -l /proc/self/fd > " + root + "/system.txt").c_str()), 0);
    ::close(own);
    // ls's own: 0 to 2 and the directory it reads.
    for (const char* listing : {"/fds.txt", "/system.txt"}) {
        std::string fds = nxtest::ReadFile(root + listing);
        ASSERT_THAT(fds, HasSubstr(" 0 -> ")) << fds;
        for (const char* kind : {"socket:", "anon_inode", ".lock"})
            EXPECT_THAT(fds, Not(HasSubstr(kind))) << listing << fds;
    }
    EXPECT_THAT(nxtest::ReadFile(root + "/system.txt"), HasSubstr("own.txt"));
    EXPECT_THAT(nxtest::ReadFile(root + "/fds.txt"), Not(HasSubstr("own.txt")));
}

int gForwarded = 0;
void Forward(VELTRAEvent& event) {
    ++gForwarded;
    PostOffice::Instance()->CommunicationReceiveFunction(event);
}
ReceiveFunction gPrevious = nullptr;
void Chain(VELTRAEvent& event) {
    gPrevious(event);
}
void DropDeviceTypeRequests(VELTRAEvent& event) {
    if (event.GetCommand() != "GET_DEVICE_TYPE")
        PostOffice::Instance()->CommunicationReceiveFunction(event);
}

TEST_F(PostOfficeTest, AReceiveFunctionForwardsOrFiltersAndOtherThreadsAreRefused) {
    PostOffice* office = PostOffice::CreatePostOffice("Tester");
    RawPeer peer("Peer", Pipe::Instance()->GetSocketPath());
    EXPECT_EQ(office->ChangeReceiveFunction(Forward), &PostOffice::DummyReceiveFunction);
    EXPECT_EQ(peer.Ask("GET_DEVICE_TYPE"), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
    EXPECT_EQ(gForwarded, 1);
    office->ChangeReceiveFunction(DropDeviceTypeRequests);
    peer.Send("GET_DEVICE_TYPE", "");
    EXPECT_EQ(peer.Next(300ms).first, "<none>");
    EXPECT_EQ(peer.Ask("IS_READY").first, "ANSWER!IS_READY");
    // A function that chains to the one it replaced reaches the post office.
    gPrevious = office->ChangeReceiveFunction(&PostOffice::DummyReceiveFunction);
    gPrevious = office->ChangeReceiveFunction(Chain);
    EXPECT_EQ(peer.Ask("GET_DEVICE_TYPE"), Answer("ANSWER!GET_DEVICE_TYPE", "\x02"));
    office->ChangeReceiveFunction(&PostOffice::DummyReceiveFunction);
    // A peer that says DISCONNECT and goes needs no answer, and the user no box.
    {
        RawPeer leaving("Leaving", Pipe::Instance()->GetSocketPath());
        EXPECT_EQ(leaving.Ask("CONNECT", "\x02").second, "\x02");
        leaving.Send("DISCONNECT", "");
    }
    RunUntil([] { return !Pipe::Instance()->HasChannel("Leaving"); }, 2s);
    RunUntil([] { return false; }, 200ms);
    EXPECT_TRUE(ui->Boxes().empty());

    unsigned char sent = 1;
    std::thread([&] {
        MyMemoryBlock none;
        sent = office->Send("Peer", IS_READY, none);
    }).join();
    EXPECT_EQ(sent, 0);
    EXPECT_THAT(office->GetLastError(), HasSubstr("another thread"));
    ASSERT_FALSE(ui->Boxes().empty());
    EXPECT_THAT(ui->Boxes().back().text, HasSubstr("PostOffice used from another thread"));
    EXPECT_EQ(peer.Next(300ms).first, "<none>");
}

TEST_F(PostOfficeTest, WithoutAPostOfficeInstanceFailsClearly) {
    EXPECT_THROW(PostOffice::Instance(), std::logic_error);
    // A missing server registration ends the set-up.
    sandbox.Register("Software\\K-Lume\\LumaServer", "Version", "2.9");
    EXPECT_THROW(PostOffice::CreatePostOffice("Tester"), std::runtime_error);
    EXPECT_FALSE(PostOffice::IsInitialized());
}

}  // namespace
