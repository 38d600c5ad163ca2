#include "nxbase/postoffice.h"

#include <algorithm>
#include <array>
#include <boost/asio/steady_timer.hpp>
#include <cstdlib>
#include <optional>
#include <stdexcept>

#include "messaging_log.h"
#include "nxbase/applock.h"
#include "nxbase/check.h"
#include "nxbase/language.h"
#include "nxbase/logfile.h"
#include "nxbase/pipe.h"
#include "nxbase/text.h"
#include "toolkit/process.h"
#include "toolkit/userinterface.h"

PostOffice* PostOffice::smInstance = nullptr;

namespace {

constexpr const char* kLogKey = "Communication";
constexpr unsigned long kTickMs = 100;
constexpr int kMaxRetries = 4;
constexpr auto kLongestPause = std::chrono::milliseconds(50);
constexpr auto kAbortDialogAfter = std::chrono::milliseconds(6000);

void Log(const String& asText) {
    LogFile::WriteToLog(asText, String(kLogKey));
}

// Log lines under "Communication" are built only when the key is on.
#define NX_COMM_LOG(text)                                     \
    do {                                                      \
        if (nxbase::detail::CommunicationLogged()) Log(text); \
    } while (false)

String Number(long alValue) {
    return String::CreateFromInt(alValue);
}

// A block's stuffed bytes, built in storage kept between messages. A send
// nested in another (a handler run while a send waits) finds the storage
// taken and uses its own.
class StuffedData {
  public:
    StuffedData(std::string& asKept, bool& abKeptInUse, const MyMemoryBlock& axData)
        : amInUse(abKeptInUse), amOuter(!abKeptInUse), amBytes(amOuter ? asKept : amNested) {
        amInUse = true;
        amBytes.clear();
        nxbase::AppendEncoded(amBytes, axData.GetDatenZeiger(),
                              static_cast<std::size_t>(axData.Len()));
    }
    ~StuffedData() {
        if (!amOuter) return;
        amInUse = false;
        if (amBytes.capacity() > kKeptCapacity) std::string().swap(amBytes);
    }
    StuffedData(const StuffedData&) = delete;
    StuffedData& operator=(const StuffedData&) = delete;
    std::string_view Bytes() const { return amBytes; }

  private:
    static constexpr std::size_t kKeptCapacity = 4096;
    bool& amInUse;
    const bool amOuter;
    std::string amNested;
    std::string& amBytes;
};

// "ANSWER!" and the name of message `alNumber` (0..134), built once: every
// answer needs one.
const std::string& AnswerText(int alNumber) {
    static const auto texts = [] {
        std::array<std::string, ANZAHL_BOTSCHAFTEN> all;
        for (int n = 0; n < ANZAHL_BOTSCHAFTEN; ++n)
            all[n] = kAnswerPrefix + std::string(nxbase::MessageName(n));
        return all;
    }();
    return texts[static_cast<std::size_t>(alNumber)];
}

String TextOr(const char* asGroup, unsigned long alIndex, const char* asFallback) {
    String text = Text::GetText(String(asGroup), alIndex);
    return text.IsEmpty() ? String(asFallback) : text;
}

}  // namespace

PostOffice* PostOffice::CreatePostOffice(String asAppName) {
    return nxbase::CreateOrReplaceSingleton(smInstance, asAppName);
}

PostOffice* PostOffice::Instance() {
    return nxbase::StrictSingletonInstance(smInstance,
                                           "Please create the PostOffice-Singleton first !");
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
    std::weak_ptr<bool> alive = amAlive;
    pipe->SetChannelLostFunction([this, alive](const std::string& asApp) {
        if (alive.lock()) PeerLost(asApp);
    });
    amTimer.SetTimeout(kTickMs);
    amTimer.SetTimeoutHdl(LINK(PostOffice, this, TimerCallback));
    amQuitTimer.SetTimeout(1000);
}

// One asynchronous SendAndReceive, from the send until its call-back.
struct PostOffice::AsyncRequest {
    std::pair<std::string, int> key;  // the peer and the answer's number
    AnswerCallback done;
    boost::function<bool()> keepWaiting;
    std::chrono::steady_clock::time_point deadline;
    std::chrono::milliseconds timeout{};
    boost::asio::steady_timer timer{Application::Get().GetContext()};
    bool finished = false;
};

PostOffice::~PostOffice() {
    *amAlive = false;
    for (auto& request : amAsync) {
        request->finished = true;
        request->timer.cancel();
    }
    amTimer.Stop();
    amQuitTimer.Stop();
    Pipe::DeletePipe();
    if (smInstance == this) smInstance = nullptr;
}

void PostOffice::DummyReceiveFunction(VELTRAEvent&) {}

// The transports deliver here: to the installed receive function, or to the
// post office itself while none is installed.
void PostOffice::TransportReceive(VELTRAEvent& axEvent) {
    if (smInstance == nullptr) return;
    if (smInstance->fmReceiveFunction == &PostOffice::DummyReceiveFunction) {
        smInstance->CommunicationReceiveFunction(axEvent);
    } else {
        smInstance->fmReceiveFunction(axEvent);
    }
}

bool PostOffice::IsLPMServer() const {
    return PostOfficeApplications::IsServerName(amOwnName.str());
}

int PostOffice::NumberOfCommand(VELTRAEvent& axEvent) {
    return axEvent.GetNumber();
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
    if (number == -1) {
        // An unknown answer is dropped: answering it would start an endless
        // exchange of answers to answers between two post offices.
        if (axEvent.GetCommand().rfind(kAnswerPrefix, 0) == 0) {
            NX_COMM_LOG(String("Unknown answer dropped: ") + String(axEvent.GetCommand()));
            return;
        }
        AnswerStatus(axEvent, nxbase::kRefused);
        return;
    }
    if (number >= kAnswerOffset) {
        HandleAnswer(axEvent, number);
        return;
    }
    if (number == CONNECT) {
        HandleConnect(axEvent);
        return;
    }
    if (number == DISCONNECT && !CountDisconnect(axEvent.GetSender()) && IsLPMServer()) return;
    HandleCommand(axEvent);
}

// An answer counts only for a SendAndReceive waiting for it from its sender;
// anything else would pile up for ever.
void PostOffice::HandleAnswer(VELTRAEvent& axEvent, int alNumber) {
    NX_COMM_LOG(String("Answer received: ") + Number(alNumber));
    std::pair<std::string, int> key(axEvent.GetSender(), alNumber);
    if (DeliverAsync(key, axEvent.GetData())) return;
    auto at = amAnswers.find(key);
    if (at == amAnswers.end() || at->second.waiters == 0 || at->second.arrived) {
        LogFile::WriteToLog(String("Answer nobody waits for dropped: ") +
                                String(axEvent.GetCommand()) + " from " +
                                String(axEvent.GetSender()),
                            String(kLogKey));
        return;
    }
    at->second.data = std::move(axEvent.GetData());
    at->second.arrived = true;
    NX_COMM_LOG(String("MessageQueue - Insert message") + ", Queue size: 1");
}

// Counts a DISCONNECT against its sender's CONNECTs; false (logged) for one
// that has none outstanding, which then changes nothing.
bool PostOffice::CountDisconnect(const std::string& asSender) {
    auto at = amConnectedPeers.find(asSender);
    if (at == amConnectedPeers.end()) {
        LogFile::WriteToLog(
            String("Disconnect from ") + String(asSender) + " ignored: it has no connection",
            String(kLogKey));
        return false;
    }
    --amConnectionCount;
    if (--at->second <= 0) amConnectedPeers.erase(at);
    return true;
}

void PostOffice::HandleCommand(VELTRAEvent& axEvent) {
    int number = NumberOfCommand(axEvent);
    const String sender(axEvent.GetSender());
    if (!CheckLock(sender)) {
        NX_COMM_LOG("Check lock failed");
        AnswerStatus(axEvent, nxbase::kRefused);
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
        NX_COMM_LOG(String("Disconnect received from ") + sender + " (" +
                    Number(amConnectionCount) + " connections)");
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
    amCommandQueue.push_back(std::move(axEvent));
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
    std::vector<std::shared_ptr<AsyncRequest>> lost;
    for (const auto& request : amAsync)
        if (request->key.first == asApp) lost.push_back(request);
    for (const auto& request : lost)
        FinishAsync(request, false, MyMemoryBlock(), "the channel to " + asApp + " was lost");
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
    toolkit::ReapStartedProcesses();
    ScheduleHandler();
    return 0;
}

void PostOffice::ScheduleHandler() {
    if (amHandlerScheduled) return;
    amHandlerScheduled = true;
    std::weak_ptr<bool> alive = amAlive;
    Application::Get().Post([this, alive] {
        if (!alive.lock()) return;
        amHandlerScheduled = false;
        BotschaftenHandler();
    });
}

// The tick runs only while commands wait: an idle application sleeps.
void PostOffice::TickWhileQueued() {
    if (amCommandQueue.empty()) {
        if (amTimer.IsActive()) amTimer.Stop();
    } else if (!amTimer.IsActive()) {
        amTimer.Start();
    }
}

void PostOffice::BotschaftenHandler() {
    if (amCommandQueue.empty()) return TickWhileQueued();
    struct TickAfter {
        PostOffice* office;
        ~TickAfter() { office->TickWhileQueued(); }
    } tickAfter{this};
    std::optional<AutoLog> scope;
    if (nxbase::detail::CommunicationLogged()) {
        scope.emplace(String("Botschafent Handler (Message nr: ") +
                          String(amCommandQueue.front().GetCommand()),
                      String(kLogKey));
    }
    ApplicationLockHolder lock("Botschaften handler");
    bool locked = lock.Lock();
    if (amHandlerBusy) return;
    // Only what was queued before this pass: a command that arrives while a
    // handler runs waits for the next tick. While a peer holds the lock its
    // commands are handled wherever they stand, so that it can finish its
    // conversation; the others keep their places until UNLOCK.
    std::vector<VELTRAEvent> waiting;  // no allocation while nobody waits
    for (std::size_t count = amCommandQueue.size(); count > 0 && !amCommandQueue.empty(); --count) {
        VELTRAEvent event = std::move(amCommandQueue.front());
        amCommandQueue.pop_front();
        if (!locked && String(event.GetSender()) != amLockOwner) {
            waiting.push_back(std::move(event));
            continue;
        }
        NX_COMM_LOG(String("Botschaften Handler - Handling Message: ") +
                    String(event.GetCommand()));
        amHandlerBusy = true;
        int number = NumberOfCommand(event);
        Link handler = amHandlers[number];
        if (!handler.IsSet()) handler = LINK(PostOffice, this, DefaultHdl);
        handler.Call(&event);
        amHandlerBusy = false;
    }
    while (!waiting.empty()) {
        amCommandQueue.push_front(std::move(waiting.back()));
        waiting.pop_back();
    }
}

long PostOffice::DefaultHdl(void* pEvent) {
    auto* event = static_cast<VELTRAEvent*>(pEvent);
    int number = NumberOfCommand(*event);
    signed char status = nxbase::kDone;
    if (number >= 0 && number <= UNLOCK) {
        NX_COMM_LOG(String("Default Hdl - Message Nr: ") + Number(number));
    } else {
        NX_COMM_LOG(String("Default Hdl - Message Nr: ") + Number(number) + " not supported");
        status = nxbase::kNotSupported;
    }
    MyMemoryBlock answer(1);
    answer << status;
    if (!Answer(event, answer)) {
        UserInterface::Current()->InfoBox("Answer failed in PostOffice::DefaultHdl()!");
    }
    return 0;
}

void PostOffice::AnswerStatus(VELTRAEvent& axEvent, signed char axStatus) {
    MyMemoryBlock answer(1);
    answer << axStatus;
    Answer(&axEvent, answer);
}

// ---- sending ----

unsigned char PostOffice::Answer(VELTRAEvent* pCommand, MyMemoryBlock& axData) {
    NX_COMM_LOG(String("PostOffice - Answering message") + " " + String(pCommand->GetCommand()));
    std::string unlisted;
    const int number = pCommand->GetNumber();
    const std::string& command = number >= 0 && number < ANZAHL_BOTSCHAFTEN
                                     ? AnswerText(number)
                                     : (unlisted = kAnswerPrefix + pCommand->GetCommand());
    if (pCommand->GetChannel() == 0) return SendCommand(pCommand->GetSender(), command, axData, {});
    if (!OnOwnThread("Answer")) return false;
    Pipe* pipe = Pipe::Instance();
    bool sent = false;
    if (pipe != nullptr) {
        StuffedData encoded(amEncoded, amEncodedInUse, axData);
        sent = pipe->SendOnChannel(pCommand->GetChannel(), command, encoded.Bytes());
    }
    if (sent) {
        NX_COMM_LOG(String("Sent: ") + String(command));
        return true;
    }
    amLastError = pipe ? pipe->GetLastError() : std::string("no transport");
    LogFile::WriteToLog(
        String("Answer to ") + String(pCommand->GetSender()) + " failed: " + String(amLastError),
        String(kLogKey));
    return false;
}

// Messaging belongs to the thread that runs the event loop.
bool PostOffice::OnOwnThread(const char* asCall) {
    if (std::this_thread::get_id() == amThread) return true;
    NX_ASSERT_TEXT(false, "PostOffice used from another thread than its event loop's");
    amLastError = std::string(asCall) + " called from another thread than the event loop's";
    return false;
}

unsigned char PostOffice::Send(const std::string& asApp, PO_Botschaften axMessage,
                               MyMemoryBlock& axData, boost::function<bool()> fKeepTrying) {
    String command(nxbase::MessageName(axMessage));
    return Send(asApp, command, axData, fKeepTrying);
}

bool PostOffice::TryOnce(const std::string& asApp, const std::string& asCommand,
                         std::string_view asEncoded) {
    Pipe* pipe = Pipe::Instance();
    if (pipe != nullptr && pipe->Send(asApp, asCommand, asEncoded)) return true;
    amLastError = pipe ? pipe->GetLastError() : std::string("no transport");
    return false;
}

unsigned char PostOffice::Send(const std::string& asApp, String& asCommand, MyMemoryBlock& axData,
                               boost::function<bool()> fKeepTrying) {
    std::string command = asCommand.str();
    if (asCommand.IsNumeric()) command = nxbase::CommandTextOfNumber(std::atoi(command.c_str()));
    return SendCommand(asApp, command, axData, fKeepTrying);
}

unsigned char PostOffice::SendCommand(const std::string& asApp, const std::string& command,
                                      const MyMemoryBlock& axData,
                                      const boost::function<bool()>& fKeepTrying) {
    if (!OnOwnThread("Send")) return false;
    StuffedData encoded(amEncoded, amEncodedInUse, axData);
    // One start of the peer and one bounded wait for it, retries included.
    // The function refers to the caller's, which outlives the scope.
    std::function<bool()> keepTrying;
    if (fKeepTrying) keepTrying = [&fKeepTrying] { return fKeepTrying(); };
    Pipe::SendScope scope(Pipe::Instance(), std::move(keepTrying));
    for (int retries = 0;;) {
        if (TryOnce(asApp, command, encoded.Bytes())) {
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
        if (retries > kMaxRetries || (fKeepTrying && !fKeepTrying())) {
            LogFile::WriteToLog(String("Send ") + String(command) + " to " + String(asApp) +
                                    " failed: " + String(amLastError),
                                String(kLogKey));
            return false;
        }
    }
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
    if (!OnOwnThread("SendAndReceive")) {
        if (touchWindow && wasEnabled) ui->EnableTopWindow(true);
        return false;
    }
    // Registered before sending: the answer may come while the send waits.
    const std::pair<std::string, int> key(asApp, kAnswerOffset + alMessage);
    AwaitedAnswer& awaited = amAnswers[key];
    ++awaited.waiters;
    amLostPeers.erase(asApp);
    bool answered = false;
    // The caller's wish to stop waiting also ends the sending, which may
    // wait for a peer that was just started.
    if (!SendCommand(asApp, nxbase::CommandTextOfNumber(alMessage), axSend, fKeepWaiting)) {
        NX_COMM_LOG("SendAndReceive, Send failed");
    } else {
        std::optional<AutoLog> waiting;
        if (nxbase::detail::CommunicationLogged()) {
            waiting.emplace(String("WaitForAnswer"), String(kLogKey));
        }
        while (true) {
            if (awaited.arrived) {
                axReceive = std::move(awaited.data);
                awaited.arrived = false;
                NX_COMM_LOG("MessageQueue - Get data from message");
                NX_COMM_LOG("MessageQueue - Erased message");
                answered = true;
                break;
            }
            if (amLostPeers.count(asApp) > 0) {
                amLastError = "the channel to " + asApp + " was lost";
                break;
            }
            if (fKeepWaiting && !fKeepWaiting()) {
                amLastError = "no answer from " + asApp + "; the wait was given up";
                break;
            }
            Application::Get().RunOneFor(kLongestPause);
        }
        NX_COMM_LOG(answered ? String("Answer received: ") + Number(alMessage)
                             : String("SendAndReceive, Abort"));
    }
    --awaited.waiters;
    if (touchWindow && wasEnabled) ui->EnableTopWindow(true);
    return answered;
}

unsigned char PostOffice::SendAndReceive(const std::string& asApp, int alMessage,
                                         MyMemoryBlock& axSend, MyMemoryBlock& axReceive,
                                         DisEnable axMode) {
    auto start = std::chrono::steady_clock::now();
    auto limit = std::chrono::seconds(nxbase::WaitTimeoutSeconds());
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

// ---- asynchronous send and receive ----

void PostOffice::SendAndReceiveAsync(const std::string& asApp, int alMessage,
                                     const MyMemoryBlock& axSend, AnswerCallback fDone,
                                     std::chrono::milliseconds timeout,
                                     boost::function<bool()> fKeepWaiting) {
    auto request = std::make_shared<AsyncRequest>();
    request->key = {asApp, kAnswerOffset + alMessage};
    request->done = std::move(fDone);
    request->keepWaiting = std::move(fKeepWaiting);
    request->timeout = timeout;
    request->deadline = std::chrono::steady_clock::now() + timeout;
    if (!OnOwnThread("SendAndReceiveAsync")) {
        FinishAsync(request, false, MyMemoryBlock(), amLastError);
        return;
    }
    amAsync.push_back(request);
    // Sent from the loop, so that the caller returns at once even when the
    // peer has to be started first.
    std::weak_ptr<bool> alive = amAlive;
    Application::Get().Post([this, alive, request, axSend] {
        if (alive.lock() && !request->finished) StartAsync(request, axSend);
    });
}

void PostOffice::StartAsync(const std::shared_ptr<AsyncRequest>& pRequest,
                            const MyMemoryBlock& axSend) {
    const std::string& app = pRequest->key.first;
    int message = pRequest->key.second - kAnswerOffset;
    if (!SendCommand(app, nxbase::CommandTextOfNumber(message), axSend, pRequest->keepWaiting)) {
        FinishAsync(pRequest, false, MyMemoryBlock(), amLastError);
        return;
    }
    if (!pRequest->finished) ArmAsync(pRequest);
}

// Wakes at the deadline, or every 100 ms while a keep-waiting function is to be asked.
void PostOffice::ArmAsync(const std::shared_ptr<AsyncRequest>& pRequest) {
    constexpr auto kAskEvery = std::chrono::milliseconds(100);
    auto next = pRequest->deadline;
    if (pRequest->keepWaiting) next = std::min(next, std::chrono::steady_clock::now() + kAskEvery);
    pRequest->timer.expires_at(next);
    std::weak_ptr<bool> alive = amAlive;
    pRequest->timer.async_wait([this, alive, pRequest](const boost::system::error_code& error) {
        if (error || !alive.lock() || pRequest->finished) return;
        const std::string& app = pRequest->key.first;
        if (std::chrono::steady_clock::now() >= pRequest->deadline) {
            FinishAsync(pRequest, false, MyMemoryBlock(),
                        "no answer from " + app + " within " +
                            std::to_string(pRequest->timeout.count()) + " ms");
        } else if (pRequest->keepWaiting && !pRequest->keepWaiting()) {
            FinishAsync(pRequest, false, MyMemoryBlock(),
                        "no answer from " + app + "; the wait was given up");
        } else {
            ArmAsync(pRequest);
        }
    });
}

bool PostOffice::DeliverAsync(const std::pair<std::string, int>& axKey, MyMemoryBlock& axData) {
    for (const auto& request : amAsync) {
        if (request->key != axKey) continue;
        FinishAsync(request, true, std::move(axData), std::string());
        return true;
    }
    return false;
}

// Calls the call-back on the loop, never from inside the transport's delivery.
void PostOffice::FinishAsync(const std::shared_ptr<AsyncRequest>& pRequest, bool abAnswered,
                             MyMemoryBlock axData, std::string asError) {
    if (pRequest->finished) return;
    pRequest->finished = true;
    pRequest->timer.cancel();
    amAsync.erase(std::remove(amAsync.begin(), amAsync.end(), pRequest), amAsync.end());
    if (!abAnswered) {
        LogFile::WriteToLog(String("SendAndReceiveAsync: ") + String(asError), String(kLogKey));
    }
    auto result = std::make_shared<AnswerResult>();
    result->answered = abAnswered;
    result->data = std::move(axData);
    result->error = std::move(asError);
    Application::Get().Post([pRequest, result] {
        if (pRequest->done) pRequest->done(*result);
    });
}
