#include "nxbase/postoffice.h"

#include <boost/asio/post.hpp>
#include <cstdlib>
#include <optional>
#include <stdexcept>

#include "nxbase/applock.h"
#include "nxbase/language.h"
#include "nxbase/logfile.h"
#include "nxbase/pipe.h"
#include "nxbase/text.h"
#include "messaging_log.h"
#include "toolkit/userinterface.h"

PostOffice* PostOffice::smInstance = nullptr;

namespace {

constexpr const char* kLogKey = "Communication";
constexpr unsigned long kTickMs = 100;
constexpr int kMaxRetries = 4;
constexpr auto kLongestPause = std::chrono::milliseconds(50);
constexpr auto kAbortDialogAfter = std::chrono::milliseconds(6000);
constexpr int kDefaultWaitTimeoutSeconds = 30;

void Log(const String& asText) {
    LogFile::WriteToLog(asText, String(kLogKey));
}

// Log lines under "Communication" are built only when the key is on.
#define NX_COMM_LOG(text)                                          \
    do {                                                           \
        if (nxbase::detail::CommunicationLogged()) Log(text);      \
    } while (false)

String Number(long alValue) {
    return String::CreateFromInt(alValue);
}

// Seconds a wait that nobody can abort may last: $NXBASE_WAIT_TIMEOUT.
int WaitTimeoutSeconds() {
    const char* text = std::getenv("NXBASE_WAIT_TIMEOUT");
    if (text == nullptr || *text == '\0') return kDefaultWaitTimeoutSeconds;
    char* end = nullptr;
    long seconds = std::strtol(text, &end, 10);
    return *end == '\0' && seconds > 0 && seconds < 86400 ? static_cast<int>(seconds)
                                                          : kDefaultWaitTimeoutSeconds;
}

String TextOr(const char* asGroup, unsigned long alIndex, const char* asFallback) {
    String text = Text::GetText(String(asGroup), alIndex);
    return text.IsEmpty() ? String(asFallback) : text;
}

}  // namespace

PostOffice* PostOffice::CreatePostOffice(String asAppName) {
    if (smInstance != nullptr) {
        NxSingleton::Remove(smInstance);
        delete smInstance;
    }
    auto* office = new PostOffice(asAppName);
    NxSingleton::Insert(office);
    return office;
}

PostOffice* PostOffice::Instance() {
    if (smInstance == nullptr) {
        throw std::logic_error("Please create the PostOffice-Singleton first !");
    }
    return smInstance;
}

PostOffice::PostOffice(const String& asAppName)
    : NxSingleton("PostOffice"),
      amApplications(asAppName.str()),
      amFlags(-2, ANZAHL_BOTSCHAFTEN),
      amOwnName(asAppName),
      amLockOwner("0") {
    NX_COMM_LOG("SetupPostOffice");
    Pipe* pipe = Pipe::CreatePipe(asAppName.str());
    smInstance = this;
    pipe->SetReceiveFunction(&PostOffice::TransportReceive);
    pipe->SetApplications(&amApplications);
    if (Language::IsInitialized()) pipe->SetCountryCode(Language::Instance()->GetCountryCode());
    std::weak_ptr<bool> alive = amAlive;
    pipe->SetChannelLostFunction([this, alive](const std::string& asApp) {
        if (alive.lock()) PeerLost(asApp);
    });
    amTimer.SetTimeout(kTickMs);
    amTimer.SetTimeoutHdl(LINK(PostOffice, this, TimerCallback));
    amTimer.Start();
    amQuitTimer.SetTimeout(1000);
}

PostOffice::~PostOffice() {
    *amAlive = false;
    amTimer.Stop();
    amQuitTimer.Stop();
    Pipe::DeletePipe();
    if (smInstance == this) smInstance = nullptr;
}

void PostOffice::TransportReceive(VELTRAEvent& axEvent) {
    if (smInstance != nullptr) smInstance->CommunicationReceiveFunction(axEvent);
}

bool PostOffice::IsLPMServer() const {
    return PostOfficeApplications::IsServerName(amOwnName.str());
}

int PostOffice::NumberOfCommand(VELTRAEvent& axEvent) {
    return nxbase::NumberOfCommandText(axEvent.GetCommand());
}

void PostOffice::Encode(MyMemoryBlock& axBlock) {
    nxbase::EncodeBlock(axBlock);
}

void PostOffice::Decode(MyMemoryBlock& axBlock) {
    nxbase::DecodeBlock(axBlock);
}

Link PostOffice::ChangeMessageHdl(unsigned int alMessage, Link& axHandler, unsigned char) {
    NX_COMM_LOG(String("Set MessageHdl: ") + Number(static_cast<long>(alMessage)));
    if (alMessage >= ANZAHL_BOTSCHAFTEN) return Link();
    Link previous = amHandlers[alMessage];
    amHandlers[alMessage] = axHandler;
    return previous;
}

Link PostOffice::GetMessageHdl(unsigned int alMessage) const {
    return alMessage < ANZAHL_BOTSCHAFTEN ? amHandlers[alMessage] : Link();
}

ReceiveFunction PostOffice::ChangeReceiveFunction(ReceiveFunction fFunction) {
    ReceiveFunction previous = fmReceiveFunction;
    fmReceiveFunction = fFunction ? fFunction : &PostOffice::DummyReceiveFunction;
    return previous;
}

// ---- receiving ----

void PostOffice::CommunicationReceiveFunction(VELTRAEvent& axEvent) {
    int number = NumberOfCommand(axEvent);
    std::optional<AutoLog> scope;
    if (nxbase::detail::CommunicationLogged()) {
        scope.emplace(String("PostOffice CommunicationReceive (Message Nr: ") + Number(number),
                      String(kLogKey));
    }
    fmReceiveFunction(axEvent);
    const String sender(axEvent.GetSender());
    if (number == -1) {
        // An unknown answer is dropped: answering it would start an endless
        // exchange of answers to answers between two post offices.
        if (axEvent.GetCommand().rfind(kAnswerPrefix, 0) == 0) {
            NX_COMM_LOG(String("Unknown answer dropped: ") + String(axEvent.GetCommand()));
            return;
        }
        AnswerStatus(axEvent, 1);
        return;
    }
    if (number >= kAnswerOffset) {
        NX_COMM_LOG(String("Answer received: ") + Number(number));
        amAnswers[number].push_back(axEvent.GetData());
        NX_COMM_LOG(String("MessageQueue - Insert message") + ", Queue size: " +
            Number(static_cast<long>(amAnswers[number].size())));
        return;
    }
    if (number == CONNECT) {
        HandleConnect(axEvent);
        return;
    }
    if (number == DISCONNECT) {
        --amConnectionCount;
        if (--amConnectedPeers[sender.str()] <= 0) amConnectedPeers.erase(sender.str());
    }
    if (!CheckLock(sender)) {
        NX_COMM_LOG("Check lock failed");
        AnswerStatus(axEvent, 1);
        return;
    }
    if (number == LOCK) {
        amLockOwner = sender;
        MyMemoryBlock data = axEvent.GetData();
        unsigned char waiting = 0;
        data >> waiting;
        if (waiting != 0) {
            Application::Get().Wait(true);
            UserInterface::Current()->EnableTopWindow(false);
        }
        ++amLockCount;
    }
    if (number == DISCONNECT) {
        NX_COMM_LOG(String("Disconnect received from ") + sender + " (" + Number(amConnectionCount) +
            " connections)");
        if (IsLPMServer()) {
            HandleDisconnectInServer(axEvent);
            return;
        }
    }
    if (number == UNLOCK && --amLockCount == 0) {
        Application::Get().Wait(false);
        UserInterface::Current()->EnableTopWindow(true);
        amLockOwner = "0";
    }
    NX_COMM_LOG("Command received");
    amCommandQueue.push_back(axEvent);
    BotschaftenHandler();
}

void PostOffice::HandleConnect(VELTRAEvent& axEvent) {
    ++amConnectionCount;
    ++amConnectedPeers[axEvent.GetSender()];
    amQuitTimer.Stop();  // a server about to close keeps running for its new peer
    NX_COMM_LOG(String("Connect received from ") + String(axEvent.GetSender()) + " (" +
        Number(amConnectionCount) + " connections)");
    MyMemoryBlock data = axEvent.GetData();
    unsigned char level = 0;
    data >> level;
    if (level == 0) data >> level;
    if (level > 2) {
        unsigned short country = 0;
        data >> country;
        if (Language::IsInitialized()) {
            Language::Instance()->SetLanguageByCountryCode(static_cast<LanguageCode>(country));
        }
    }
    MyMemoryBlock answer;
    answer << static_cast<unsigned char>(level < 3 ? level : 3);
    Answer(&axEvent, answer);
}

void PostOffice::HandleDisconnectInServer(VELTRAEvent& axEvent) {
    amHandlers[DISCONNECT].Call(&axEvent);
    CloseWhenUnused();
}

// A peer that dies without DISCONNECT (killed, crashed) would hold its
// connection and its lock for ever: its lost channel counts as both.
void PostOffice::PeerLost(const std::string& asApp) {
    amLostPeers.insert(asApp);
    if (amLockOwner == String(asApp)) {
        NX_COMM_LOG(String("Lock owner lost: ") + String(asApp));
        amLockCount = 0;
        amLockOwner = "0";
        Application::Get().Wait(false);
        UserInterface::Current()->EnableTopWindow(true);
    }
    auto connected = amConnectedPeers.find(asApp);
    if (connected == amConnectedPeers.end()) return;
    amConnectionCount -= connected->second;
    amConnectedPeers.erase(connected);
    NX_COMM_LOG(String("Connection lost to ") + String(asApp) + " (" + Number(amConnectionCount) +
        " connections)");
    if (IsLPMServer()) {
        VELTRAEvent event(asApp, nxbase::MessageName(DISCONNECT), MyMemoryBlock());
        amHandlers[DISCONNECT].Call(&event);
        CloseWhenUnused();
    }
}

void PostOffice::CloseWhenUnused() {
    if (amConnectionCount >= 1 || amQuitTimer.IsActive()) return;
    NX_COMM_LOG("No more connections - Closing application");
    // The answer to the last peer goes out while the second passes.
    struct Quitter {
        long Quit(void*) {
            Application::Get().Quit();
            return 0;
        }
    };
    static Quitter quitter;
    amQuitTimer.SetTimeoutHdl(LINK(Quitter, &quitter, Quit));
    amQuitTimer.Start();
}

// ---- handling queued commands ----

long PostOffice::TimerCallback(void*) {
    ScheduleHandler();
    return 0;
}

void PostOffice::ScheduleHandler() {
    if (amHandlerScheduled) return;
    amHandlerScheduled = true;
    std::weak_ptr<bool> alive = amAlive;
    boost::asio::post(Application::Get().GetContext(), [this, alive] {
        if (!alive.lock()) return;
        amHandlerScheduled = false;
        BotschaftenHandler();
    });
}

void PostOffice::BotschaftenHandler() {
    if (amCommandQueue.empty()) return;
    std::optional<AutoLog> scope;
    if (nxbase::detail::CommunicationLogged()) {
        scope.emplace(String("Botschafent Handler (Message nr: ") +
                          String(amCommandQueue.front().GetCommand()),
                      String(kLogKey));
    }
    ApplicationLockHolder lock("Botschaften handler");
    bool locked = lock.Lock();
    if (amHandlerBusy) return;
    if (!locked && String(amCommandQueue.front().GetSender()) != amLockOwner) return;
    // Only what was queued before this pass: a command that arrives while a
    // handler runs waits for the next tick.
    for (std::size_t count = amCommandQueue.size(); count > 0 && !amCommandQueue.empty();
         --count) {
        VELTRAEvent event = std::move(amCommandQueue.front());
        amCommandQueue.pop_front();
        NX_COMM_LOG(String("Botschaften Handler - Handling Message: ") + String(event.GetCommand()));
        amHandlerBusy = true;
        int number = NumberOfCommand(event);
        Link handler = amHandlers[number];
        if (!handler.IsSet()) handler = LINK(PostOffice, this, DefaultHdl);
        handler.Call(&event);
        amHandlerBusy = false;
    }
}

long PostOffice::DefaultHdl(void* pEvent) {
    auto* event = static_cast<VELTRAEvent*>(pEvent);
    int number = NumberOfCommand(*event);
    signed char status = 0;
    if (number >= 0 && number <= UNLOCK) {
        NX_COMM_LOG(String("Default Hdl - Message Nr: ") + Number(number));
    } else {
        NX_COMM_LOG(String("Default Hdl - Message Nr: ") + Number(number) + " not supported");
        status = 2;
    }
    MyMemoryBlock answer;
    answer << status;
    if (!Answer(event, answer)) {
        UserInterface::Current()->InfoBox("Answer failed in PostOffice::DefaultHdl()!");
    }
    return 0;
}

void PostOffice::AnswerStatus(VELTRAEvent& axEvent, signed char axStatus) {
    MyMemoryBlock answer;
    answer << axStatus;
    Answer(&axEvent, answer);
}

// ---- sending ----

unsigned char PostOffice::Answer(VELTRAEvent* pCommand, MyMemoryBlock& axData) {
    NX_COMM_LOG(String("PostOffice - Answering message") + " " + String(pCommand->GetCommand()));
    String command = String(kAnswerPrefix) + String(pCommand->GetCommand());
    MyMemoryBlock copy = axData;
    return Send(pCommand->GetSender(), command, copy);
}

unsigned char PostOffice::Send(const std::string& asApp, PO_Botschaften axMessage,
                               MyMemoryBlock& axData, boost::function<bool()> fKeepTrying) {
    String command(nxbase::MessageName(axMessage));
    return Send(asApp, command, axData, fKeepTrying);
}

bool PostOffice::TryOnce(const std::string& asApp, const std::string& asCommand,
                         const MyMemoryBlock& axEncoded) {
    Pipe* pipe = Pipe::Instance();
    return pipe != nullptr && pipe->Send(asApp, asCommand, axEncoded);
}

namespace {
// The caller's keep-trying function asked while the pipe waits for a peer
// it started, for the duration of one Send.
class StartWaitCheck {
public:
    explicit StartWaitCheck(const boost::function<bool()>& check) : pPipe(Pipe::Instance()) {
        if (pPipe && check) pPipe->SetStartWaitCheck([check] { return check(); });
    }
    ~StartWaitCheck() {
        if (pPipe) pPipe->SetStartWaitCheck({});
    }
    StartWaitCheck(const StartWaitCheck&) = delete;
    StartWaitCheck& operator=(const StartWaitCheck&) = delete;

private:
    Pipe* pPipe;
};
}  // namespace

unsigned char PostOffice::Send(const std::string& asApp, String& asCommand, MyMemoryBlock& axData,
                               boost::function<bool()> fKeepTrying) {
    std::string command = asCommand.str();
    if (asCommand.IsNumeric()) command = nxbase::CommandTextOfNumber(std::atoi(command.c_str()));
    MyMemoryBlock encoded = axData;
    Encode(encoded);
    const StartWaitCheck startWait(fKeepTrying);
    for (int retries = 0;;) {
        if (TryOnce(asApp, command, encoded)) {
            NX_COMM_LOG(String("Sent: ") + String(command));
            return true;
        }
        ++retries;
        for (int i = 0; i < 10; ++i) Application::Get().Reschedule();
        Application::Get().RunOneFor(std::chrono::milliseconds(1));
        NX_COMM_LOG("*** Send failed ***");
        NX_COMM_LOG(String("Retry ") + Number(retries));
        if (LogFile::Instance()->IsLogOptionEnabled(String("Acoustic"))) {
            UserInterface::Current()->Beep(5000, 200);
            UserInterface::Current()->Beep(1000, 200);
        }
        if (retries > kMaxRetries) return false;
        if (fKeepTrying && !fKeepTrying()) return false;
    }
}

bool PostOffice::TakeAnswer(int alNumber, MyMemoryBlock& axReceive) {
    auto at = amAnswers.find(alNumber);
    if (at == amAnswers.end() || at->second.empty()) return false;
    axReceive = at->second.front();
    NX_COMM_LOG("MessageQueue - Get data from message");
    at->second.pop_front();
    if (at->second.empty()) amAnswers.erase(at);
    NX_COMM_LOG("MessageQueue - Erased message");
    return true;
}

unsigned char PostOffice::SendAndReceive(const std::string& asApp, int alMessage,
                                         MyMemoryBlock& axSend, MyMemoryBlock& axReceive,
                                         boost::function<bool()> fKeepWaiting, DisEnable axMode) {
    std::optional<AutoLog> scope;
    if (nxbase::detail::CommunicationLogged()) {
        scope.emplace(String("SendAndReceive (") + Number(alMessage), String(kLogKey));
    }
    auto ui = UserInterface::Current();
    bool touchWindow = axMode != DisEnableNone && ui->HasTopWindow();
    bool wasEnabled = touchWindow && ui->IsTopWindowEnabled();
    if (touchWindow) ui->EnableTopWindow(false);
    int answerNumber = kAnswerOffset + alMessage;
    amAnswers.erase(answerNumber);  // a late answer to an abandoned wait is stale
    amLostPeers.erase(asApp);
    String command = Number(alMessage);
    bool answered = false;
    // The caller's wish to stop waiting also ends the sending, which may
    // wait for a peer that was just started.
    if (!Send(asApp, command, axSend, fKeepWaiting)) {
        NX_COMM_LOG("SendAndReceive, Send failed");
    } else {
        std::optional<AutoLog> waiting;
        if (nxbase::detail::CommunicationLogged()) {
            waiting.emplace(String("WaitForAnswer"), String(kLogKey));
        }
        while (true) {
            if (TakeAnswer(answerNumber, axReceive)) {
                answered = true;
                break;
            }
            if (amLostPeers.count(asApp) > 0) break;  // the peer is gone
            if (fKeepWaiting && !fKeepWaiting()) break;
            Application::Get().RunOneFor(kLongestPause);
        }
        NX_COMM_LOG(answered ? String("Answer received: ") + Number(alMessage)
                     : String("SendAndReceive, Abort"));
    }
    if (touchWindow && wasEnabled) ui->EnableTopWindow(true);
    return answered;
}

unsigned char PostOffice::SendAndReceive(const std::string& asApp, int alMessage,
                                         MyMemoryBlock& axSend, MyMemoryBlock& axReceive,
                                         DisEnable axMode) {
    auto start = std::chrono::steady_clock::now();
    auto limit = std::chrono::seconds(WaitTimeoutSeconds());
    bool toServer = PostOfficeApplications::IsServerName(asApp);
    if (!toServer) NX_COMM_LOG("Set callback function");
    bool dialogOpen = false;
    boost::function<bool()> keepWaiting = [&]() {
        auto ui = UserInterface::Current();
        auto elapsed = std::chrono::steady_clock::now() - start;
        if (!ui->IsInteractive() && elapsed > limit) {
            // Always written: a wait given up for want of a person must show.
            LogFile::WriteToLog(String("SendAndReceive: no answer from ") + String(asApp) +
                                    " within " + Number(static_cast<long>(limit.count())) +
                                    " s (NXBASE_WAIT_TIMEOUT), aborted",
                                String());
            return false;
        }
        if (toServer || elapsed < kAbortDialogAfter) return true;
        if (!dialogOpen) {
            dialogOpen = true;
            ui->OpenAbortDialog(TextOr("ObjectIdApplikation", 0, "Waiting").str(),
                                TextOr("ObjectIdApplikation", 1, "Waiting for an answer").str());
        }
        return !ui->IsAbortDialogAborted();
    };
    unsigned char result = SendAndReceive(asApp, alMessage, axSend, axReceive, keepWaiting, axMode);
    if (dialogOpen) UserInterface::Current()->CloseAbortDialog();
    return result;
}
