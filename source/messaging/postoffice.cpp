#include "nxbase/postoffice.h"

#include <algorithm>
#include <array>
#include <boost/asio/steady_timer.hpp>
#include <climits>
#include <cstdlib>
#include <optional>
#include <stdexcept>

#include "messaging_log.h"
#include "nxbase/applock.h"
#include "nxbase/check.h"
#include "nxbase/language.h"
#include "nxbase/logfile.h"
#include "nxbase/pipe.h"
#include "nxbase/strhelp.h"
#include "nxbase/text.h"
#include "toolkit/process.h"
#include "toolkit/userinterface.h"

PostOffice* PostOffice::smInstance = nullptr;

namespace {

constexpr const char* kLogKey = "Communication";
constexpr unsigned long kTickMs = 100;
constexpr int kMaxRetries = 4;
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
// taken and uses its own. The storage is the thread's, not the post
// office's: a send survives the office's destruction by a handler it ran.
class StuffedData {
  public:
    explicit StuffedData(std::string_view asData)
        : amOuter(!tlInUse), amBytes(amOuter ? tlKept : amNested) {
        tlInUse = true;
        amBytes.clear();
        nxbase::AppendEncoded(amBytes, asData.data(), asData.size());
    }
    explicit StuffedData(const MyMemoryBlock& axData) : StuffedData(axData.Bytes()) {}
    ~StuffedData() {
        if (!amOuter) return;
        tlInUse = false;
        if (amBytes.capacity() > kKeptCapacity) std::string().swap(amBytes);
    }
    StuffedData(const StuffedData&) = delete;
    StuffedData& operator=(const StuffedData&) = delete;
    std::string_view Bytes() const { return amBytes; }

  private:
    static constexpr std::size_t kKeptCapacity = 4096;
    static thread_local std::string tlKept;
    static thread_local bool tlInUse;
    const bool amOuter;
    std::string amNested;
    std::string& amBytes;
};

thread_local std::string StuffedData::tlKept;
thread_local bool StuffedData::tlInUse = false;

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
        if (!alive.expired()) PeerLost(asApp);
    });
    amTimer.SetTimeout(kTickMs);
    amTimer.SetTimeoutHdl(LINK(PostOffice, this, TimerCallback));
    amQuitTimer.SetTimeout(1000);
}

// One SendAndReceive, blocking or asynchronous, from its send until its
// answer, failure or abandonment.
struct PostOffice::Request {
    std::pair<std::string, int> key;  // the peer and the answer's number
    std::uint64_t channel = 0;        // the connection it went out on (0: DDE)
    bool finished = false;            // its caller no longer waits
    bool answered = false;
    std::optional<MyMemoryBlock> data;  // the answer: nothing allocated before it comes
    std::string error;
    // Asynchronous requests only.
    AnswerCallback done;
    boost::function<bool()> keepWaiting;
    std::chrono::steady_clock::time_point deadline;
    std::chrono::milliseconds timeout{};
    bool async = false;
    std::optional<boost::asio::steady_timer> timer;
};

PostOffice::~PostOffice() {
    Application::Get();  // a forked child lets go of the parent's loop first
    *amAlive = false;
    // Waits still on the stack end when they see their request finished;
    // asynchronous call-backs are dropped.
    for (auto& [key, queue] : amOutstanding) {
        for (auto& request : queue) {
            if (!request->finished) request->error = "the post office was closed";
            request->finished = true;
        }
    }
    for (auto& request : amAsync) {
        request->finished = true;
        request->timer->cancel();
    }
    amTimer.Stop();
    amQuitTimer.Stop();
    // A send of the transport may still be on the stack (it outlives this
    // object then): it must not look at this office's table again.
    if (Pipe* pipe = Pipe::Instance()) pipe->SetApplications(nullptr);
    Pipe::DeletePipe();
    if (smInstance == this) smInstance = nullptr;
}

// A receive function that chains to the one it replaced reaches the post
// office's own handling through this.
void PostOffice::DummyReceiveFunction(VELTRAEvent& axEvent) {
    if (smInstance != nullptr) smInstance->CommunicationReceiveFunction(axEvent);
}

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

// An answer belongs to the oldest request sent to its sender for its number:
// peers answer in order. One nobody asked for is dropped, as is the answer to
// a request given up, which held its place for it.
void PostOffice::HandleAnswer(VELTRAEvent& axEvent, int alNumber) {
    NX_COMM_LOG(String("Answer received: ") + Number(alNumber));
    auto at = amOutstanding.find({axEvent.GetSender(), alNumber});
    if (at == amOutstanding.end() || at->second.empty()) {
        LogFile::WriteToLog(String("Answer nobody waits for dropped: ") +
                                String(axEvent.GetCommand()) + " from " +
                                String(axEvent.GetSender()),
                            String(kLogKey));
        return;
    }
    // A peer answers each connection's requests in order, on the connection
    // (or by the transport) the request came by; answers on two of them may
    // overtake each other. So the answer belongs to the oldest request sent
    // on its connection. One on a connection none of ours went out on (a peer
    // that reconnected to deliver what an earlier post office of this name
    // asked) belongs to no request of ours.
    auto& queue = at->second;
    auto own = std::find_if(queue.begin(), queue.end(), [&](const RequestPtr& request) {
        return request->channel == axEvent.GetChannel();
    });
    if (own == queue.end()) {
        LogFile::WriteToLog(String("Answer on another connection than its request's dropped: ") +
                                String(axEvent.GetCommand()) + " from " +
                                String(axEvent.GetSender()),
                            String(kLogKey));
        return;
    }
    NX_COMM_LOG(String("MessageQueue - Insert message") +
                ", Queue size: " + Number(static_cast<long>(queue.size())));
    // The emptied queue stays for the next request: no allocation per request.
    RequestPtr request = std::move(*own);
    queue.erase(own);
    if (request->finished) {
        LogFile::WriteToLog(String("Late answer dropped: ") + String(axEvent.GetCommand()) +
                                " from " + String(axEvent.GetSender()) +
                                " answers a request that was given up (" + String(request->error) +
                                ")",
                            String(kLogKey));
        return;
    }
    Finish(request, true, std::move(axEvent.GetData()), std::string());
}

std::size_t PostOffice::GetOutstandingCount(const std::string& asApp, int alMessage) const {
    auto at = amOutstanding.find({asApp, kAnswerOffset + alMessage});
    return at == amOutstanding.end() ? 0 : at->second.size();
}

int PostOffice::AddPeerLostFunction(PeerLostFunction fFunction) {
    int id = amNextPeerLostId++;
    amPeerLostFunctions[id] = std::move(fFunction);
    return id;
}

void PostOffice::RemovePeerLostFunction(int alId) {
    amPeerLostFunctions.erase(alId);
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
    // Told from the loop, not from inside the transport's closing, and before
    // the call-backs of the requests the loss fails.
    std::weak_ptr<bool> alive = amAlive;
    Application::Get().Post([this, alive, asApp] {
        if (alive.expired()) return;
        for (auto at = amPeerLostFunctions.begin(); at != amPeerLostFunctions.end();) {
            int id = at->first;
            PeerLostFunction function = at->second;
            function(asApp);
            if (alive.expired()) return;
            at = amPeerLostFunctions.upper_bound(id);
        }
    });
    // Nothing sent on the lost channel will be answered: its requests fail,
    // and the order of answers starts afresh on the next channel.
    std::vector<RequestPtr> lost;
    for (auto at = amOutstanding.lower_bound({asApp, 0});
         at != amOutstanding.end() && at->first.first == asApp;) {
        for (auto& request : at->second) lost.push_back(std::move(request));
        at = amOutstanding.erase(at);
    }
    for (const auto& request : lost)
        Finish(request, false, MyMemoryBlock(), "the channel to " + asApp + " was lost");
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
        if (alive.expired()) return;
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
    if (AnswerBytes(event, std::string_view(reinterpret_cast<const char*>(&status), 1))) return 0;
    // A peer that has gone (its DISCONNECT, then its channel's end) needs no
    // answer, and the user no box.
    Pipe* pipe = Pipe::Instance();
    if (number == DISCONNECT || (event->GetChannel() != 0 && pipe != nullptr &&
                                 !pipe->IsChannelOpen(event->GetChannel()))) {
        NX_COMM_LOG(String("Default Hdl - no answer to ") + String(event->GetSender()) +
                    ": it has gone");
        return 0;
    }
    UserInterface::Current()->InfoBox("Answer failed in PostOffice::DefaultHdl()!");
    return 0;
}

void PostOffice::AnswerStatus(VELTRAEvent& axEvent, signed char axStatus) {
    AnswerBytes(&axEvent, std::string_view(reinterpret_cast<const char*>(&axStatus), 1));
}

// ---- sending ----

unsigned char PostOffice::Answer(VELTRAEvent* pCommand, MyMemoryBlock& axData) {
    return AnswerBytes(pCommand, axData.Bytes());
}

bool PostOffice::AnswerBytes(VELTRAEvent* pCommand, std::string_view asData) {
    NX_COMM_LOG(String("PostOffice - Answering message") + " " + String(pCommand->GetCommand()));
    std::string unlisted;
    const int number = pCommand->GetNumber();
    const std::string& command = number >= 0 && number < ANZAHL_BOTSCHAFTEN
                                     ? AnswerText(number)
                                     : (unlisted = kAnswerPrefix + pCommand->GetCommand());
    if (!OnOwnThread("Answer")) return false;
    Pipe* pipe = Pipe::Instance();
    bool sent = false;
    // Back on the transport and connection the command came by: the
    // requester takes its answer only there.
    if (pipe != nullptr) {
        StuffedData encoded(asData);
        sent = pCommand->GetChannel() == 0
                   ? pipe->AnswerByDde(pCommand->GetSender(), command, encoded.Bytes())
                   : pipe->SendOnChannel(pCommand->GetChannel(), command, encoded.Bytes());
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
                               MyMemoryBlock& axData, boost::function<bool()> fKeepTrying,
                               PeerStart axStart) {
    String command(nxbase::MessageName(axMessage));
    return Send(asApp, command, axData, fKeepTrying, axStart);
}

// One attempt. False also when the post office was destroyed meanwhile (by a
// handler the transport's wait ran): then nothing of it may be touched.
bool PostOffice::TryOnce(const std::string& asApp, const std::string& asCommand,
                         std::string_view asEncoded, const std::weak_ptr<bool>& alive) {
    Pipe* pipe = Pipe::Instance();
    bool sent = pipe != nullptr && pipe->Send(asApp, asCommand, asEncoded);
    if (alive.expired()) return false;
    if (sent) return true;
    pipe = Pipe::Instance();
    amLastError = pipe ? pipe->GetLastError() : std::string("no transport");
    return false;
}

unsigned char PostOffice::Send(const std::string& asApp, String& asCommand, MyMemoryBlock& axData,
                               boost::function<bool()> fKeepTrying, PeerStart axStart) {
    std::string command = asCommand.str();
    long long number = 0;
    if (asCommand.IsNumeric() && StringHelpers::ParseInteger(command, number) &&
        number >= INT_MIN && number <= INT_MAX)
        command = nxbase::CommandTextOfNumber(static_cast<int>(number));
    return SendCommand(asApp, command, axData, fKeepTrying, axStart);
}

unsigned char PostOffice::SendCommand(const std::string& asApp, const std::string& command,
                                      const MyMemoryBlock& axData,
                                      const boost::function<bool()>& fKeepTrying,
                                      PeerStart axStart) {
    if (!OnOwnThread("Send")) return false;
    std::weak_ptr<bool> alive = amAlive;
    StuffedData encoded(axData);
    // One start of the peer and one bounded wait for it, retries included.
    // The function refers to the caller's, which outlives the scope.
    std::function<bool()> keepTrying;
    if (fKeepTrying) keepTrying = [&fKeepTrying] { return fKeepTrying(); };
    Pipe::SendScope scope(Pipe::Instance(), std::move(keepTrying), axStart == PeerStart::kIfNeeded);
    for (int retries = 0;;) {
        if (TryOnce(asApp, command, encoded.Bytes(), alive)) {
            NX_COMM_LOG(String("Sent: ") + String(command));
            return true;
        }
        ++retries;
        // The loop runs between tries; a handler it runs may close this office.
        for (int i = 0; i < 10 && !alive.expired(); ++i) Application::Get().Reschedule();
        if (!alive.expired()) Application::Get().RunOneFor(std::chrono::milliseconds(1));
        if (alive.expired()) return false;
        NX_COMM_LOG("*** Send failed ***");
        NX_COMM_LOG(String("Retry ") + Number(retries));
        if (LogFile::Instance()->IsLogOptionEnabled(String("Acoustic"))) {
            UserInterface::Current()->Beep(5000, 200);
            UserInterface::Current()->Beep(1000, 200);
        }
        // A start that failed, or a peer that must not be started, does not
        // come back by trying again.
        if (retries > kMaxRetries || scope.Hopeless() || (fKeepTrying && !fKeepTrying())) {
            LogFile::WriteToLog(String("Send ") + String(command) + " to " + String(asApp) +
                                    " failed: " + String(amLastError),
                                String(kLogKey));
            return false;
        }
    }
}

// Sends the request and, once its frame is with the transport (before any
// answer can be read), gives it its place among the outstanding requests.
bool PostOffice::SendRequest(const RequestPtr& pRequest, const MyMemoryBlock& axSend,
                             const boost::function<bool()>& fKeepTrying, PeerStart axStart) {
    const std::string& app = pRequest->key.first;
    int message = pRequest->key.second - kAnswerOffset;
    if (!SendCommand(app, nxbase::CommandTextOfNumber(message), axSend, fKeepTrying, axStart))
        return false;
    if (Pipe* pipe = Pipe::Instance()) pRequest->channel = pipe->GetLastSendChannel();
    amOutstanding[pRequest->key].push_back(pRequest);
    return true;
}

// The record of the last blocking request is taken again once nobody holds
// it (its answer came): a request in turn allocates no record of its own.
PostOffice::RequestPtr PostOffice::NewBlockingRequest() {
    if (amSpareRequest && amSpareRequest.use_count() == 1) {
        *amSpareRequest = Request();
        return amSpareRequest;
    }
    amSpareRequest = std::make_shared<Request>();
    return amSpareRequest;
}

unsigned char PostOffice::SendAndReceive(const std::string& asApp, int alMessage,
                                         MyMemoryBlock& axSend, MyMemoryBlock& axReceive,
                                         boost::function<bool()> fKeepWaiting, DisEnable axMode,
                                         PeerStart axStart) {
    std::optional<AutoLog> scope;
    if (nxbase::detail::CommunicationLogged()) {
        scope.emplace(String("SendAndReceive (") + Number(alMessage), String(kLogKey));
    }
    // The user interface is looked up (under its lock) only when asked for.
    auto ui = axMode != DisEnableNone ? UserInterface::Current() : nullptr;
    bool touchWindow = ui && ui->HasTopWindow();
    bool wasEnabled = touchWindow && ui->IsTopWindowEnabled();
    if (touchWindow) ui->EnableTopWindow(false);
    struct RestoreWindow {
        UserInterface* ui;
        bool restore;
        ~RestoreWindow() {
            if (restore) ui->EnableTopWindow(true);
        }
    } restoreWindow{ui.get(), touchWindow && wasEnabled};
    if (!OnOwnThread("SendAndReceive")) return false;
    // Everything the wait needs lives in the request: a handler run by the
    // wait may destroy the post office.
    std::weak_ptr<bool> alive = amAlive;
    RequestPtr request = NewBlockingRequest();
    request->key = {asApp, kAnswerOffset + alMessage};
    // The caller's wish to stop waiting also ends the sending, which may
    // wait for a peer that was just started.
    if (!SendRequest(request, axSend, fKeepWaiting, axStart)) {
        if (!alive.expired()) NX_COMM_LOG("SendAndReceive, Send failed");
        return false;
    }
    {
        std::optional<AutoLog> waiting;
        if (nxbase::detail::CommunicationLogged()) {
            waiting.emplace(String("WaitForAnswer"), String(kLogKey));
        }
        std::function<bool()> keepWaiting;
        if (fKeepWaiting) keepWaiting = [&fKeepWaiting] { return fKeepWaiting(); };
        // A peer on this CPU has often answered before the send returned.
        if (Pipe* pipe = Pipe::Instance(); pipe != nullptr && request->channel != 0)
            pipe->ReadArrived(request->channel);
        auto end =
            Application::Get().RunUntil([&request] { return request->finished; }, keepWaiting);
        if (end != Application::WaitEnd::kReady) {
            request->finished = true;
            request->error = "no answer from " + asApp +
                             (end == Application::WaitEnd::kQuit ? "; the application quits"
                                                                 : "; the wait was given up");
        }
    }
    if (alive.expired()) return false;
    if (!request->answered) {
        amLastError = request->error;
        NX_COMM_LOG("SendAndReceive, Abort");
        return false;
    }
    axReceive = std::move(*request->data);
    NX_COMM_LOG("MessageQueue - Get data from message");
    NX_COMM_LOG("MessageQueue - Erased message");
    NX_COMM_LOG(String("Answer received: ") + Number(alMessage));
    return true;
}

unsigned char PostOffice::SendAndReceive(const std::string& asApp, int alMessage,
                                         MyMemoryBlock& axSend, MyMemoryBlock& axReceive,
                                         DisEnable axMode, PeerStart axStart) {
    // Asked every turn of the wait, that is for every message that arrives:
    // the time-out's setting and the user interface are looked up only once
    // a second has passed (no time-out is shorter), the state is one pointer
    // so that the function is not allocated.
    struct Waiting {
        std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();
        const std::string& app;
        bool toServer;
        std::optional<int> limitSeconds{};
        bool dialogOpen = false;
        bool KeepWaiting() {
            auto elapsed = std::chrono::steady_clock::now() - start;
            if (elapsed < std::chrono::seconds(1)) return true;
            if (!limitSeconds) limitSeconds = nxbase::WaitTimeoutSeconds();
            auto ui = UserInterface::Current();
            if (*limitSeconds > 0 && !ui->IsInteractive() &&
                elapsed > std::chrono::seconds(*limitSeconds)) {
                // Always written: a wait given up for want of a person must show.
                LogFile::WriteToLog(String("SendAndReceive: no answer from ") + String(app) +
                                        " within " + Number(static_cast<long>(*limitSeconds)) +
                                        " s (NXBASE_WAIT_TIMEOUT), aborted",
                                    String());
                return false;
            }
            if (toServer || elapsed < kAbortDialogAfter) return true;
            if (!dialogOpen) {
                dialogOpen = true;
                ui->OpenAbortDialog(
                    TextOr("ObjectIdApplikation", 0, "Waiting").str(),
                    TextOr("ObjectIdApplikation", 1, "Waiting for an answer").str());
            }
            return !ui->IsAbortDialogAborted();
        }
    } waiting{.app = asApp, .toServer = PostOfficeApplications::IsServerName(asApp)};
    if (!waiting.toServer) NX_COMM_LOG("Set callback function");
    boost::function<bool()> keepWaiting = [state = &waiting] { return state->KeepWaiting(); };
    unsigned char result =
        SendAndReceive(asApp, alMessage, axSend, axReceive, keepWaiting, axMode, axStart);
    if (waiting.dialogOpen) UserInterface::Current()->CloseAbortDialog();
    return result;
}

// ---- asynchronous send and receive ----

void PostOffice::SendAndReceiveAsync(const std::string& asApp, int alMessage,
                                     const MyMemoryBlock& axSend, AnswerCallback fDone,
                                     std::chrono::milliseconds timeout,
                                     boost::function<bool()> fKeepWaiting, PeerStart axStart) {
    RequestPtr request = NewBlockingRequest();
    request->key = {asApp, kAnswerOffset + alMessage};
    request->async = true;
    request->done = std::move(fDone);
    request->keepWaiting = std::move(fKeepWaiting);
    request->timeout = timeout;
    request->deadline = std::chrono::steady_clock::now() + timeout;
    if (!OnOwnThread("SendAndReceiveAsync")) {
        Finish(request, false, MyMemoryBlock(), amLastError);
        return;
    }
    request->timer.emplace(Application::Get().GetContext());
    amAsync.push_back(request);
    // Sent from the loop, so that the caller returns at once even when the
    // peer has to be started first.
    std::weak_ptr<bool> alive = amAlive;
    Application::Get().Post([this, alive, request, axSend, axStart] {
        if (!alive.expired() && !request->finished) StartAsync(request, axSend, axStart);
    });
}

// The time-out covers the start of the peer as well: the send gives up at
// the deadline. A peer that has to be started is waited for on the request's
// timer, so that no turn of the loop lasts as long as the start.
void PostOffice::StartAsync(const RequestPtr& pRequest, const MyMemoryBlock& axSend,
                            PeerStart axStart) {
    const std::string& app = pRequest->key.first;
    Pipe* pipe = Pipe::Instance();
    if (axStart == PeerStart::kIfNeeded && pipe != nullptr &&
        pRequest->key.second != kAnswerOffset + DISCONNECT && amApplications.HasApplication(app) &&
        !pipe->IsReachable(app)) {
        int pid = -1;
        if (!pipe->StartForLater(app, pid)) {
            Finish(pRequest, false, MyMemoryBlock(), pipe->GetLastError());
            return;
        }
        AwaitStart(pRequest, std::make_shared<const MyMemoryBlock>(axSend), pid,
                   std::chrono::milliseconds(2));
        return;
    }
    SendAsync(pRequest, axSend, axStart);
}

// Looks for the started peer from 2 ms on, doubling up to the 100 ms tick.
void PostOffice::AwaitStart(const RequestPtr& pRequest, std::shared_ptr<const MyMemoryBlock> pSend,
                            int alPid, std::chrono::milliseconds pause) {
    pRequest->timer->expires_at(
        std::min(std::chrono::steady_clock::now() + pause, pRequest->deadline));
    std::weak_ptr<bool> alive = amAlive;
    pRequest->timer->async_wait(
        [this, pRequest, pSend, alPid, pause, alive](const boost::system::error_code& error) {
            if (error || alive.expired() || pRequest->finished) return;
            const std::string& app = pRequest->key.first;
            Pipe* pipe = Pipe::Instance();
            std::string how;
            int pid = alPid;
            if (pipe == nullptr) {
                Finish(pRequest, false, MyMemoryBlock(), "the transport was closed");
            } else if (pipe->IsReachable(app)) {
                SendAsync(pRequest, *pSend, PeerStart::kIfNeeded);
            } else if (pipe->StartEnded(app, pid, how) && !pipe->IsReachable(app)) {
                Finish(pRequest, false, MyMemoryBlock(), "no answer from " + app + ": it " + how);
            } else if (std::chrono::steady_clock::now() >= pRequest->deadline) {
                Finish(pRequest, false, MyMemoryBlock(),
                       "no answer from " + app + " within " +
                           std::to_string(pRequest->timeout.count()) +
                           " ms (it did not become reachable in time)");
            } else if (pRequest->keepWaiting && !pRequest->keepWaiting()) {
                Finish(pRequest, false, MyMemoryBlock(),
                       "no answer from " + app + "; the wait was given up");
            } else if (pid <= 0 && !nxbase::IsApplicationRunning(app) &&
                       !pipe->StartForLater(app, pid)) {
                // The instance it waited for ended before it could be reached.
                Finish(pRequest, false, MyMemoryBlock(), pipe->GetLastError());
            } else {
                AwaitStart(pRequest, pSend, pid,
                           std::min(pause * 2, std::chrono::milliseconds(kTickMs)));
            }
        });
}

void PostOffice::SendAsync(const RequestPtr& pRequest, const MyMemoryBlock& axSend,
                           PeerStart axStart) {
    std::weak_ptr<bool> alive = amAlive;
    boost::function<bool()> keepTrying = [pRequest] {
        return !pRequest->finished && std::chrono::steady_clock::now() < pRequest->deadline &&
               (!pRequest->keepWaiting || pRequest->keepWaiting());
    };
    if (!SendRequest(pRequest, axSend, keepTrying, axStart)) {
        if (alive.expired()) return;
        std::string why = std::chrono::steady_clock::now() >= pRequest->deadline
                              ? "no answer from " + pRequest->key.first + " within " +
                                    std::to_string(pRequest->timeout.count()) + " ms (" +
                                    amLastError + ")"
                              : amLastError;
        Finish(pRequest, false, MyMemoryBlock(), why);
        return;
    }
    if (!pRequest->finished) ArmAsync(pRequest);
}

// Wakes at the deadline, or every 100 ms while a keep-waiting function is to be asked.
void PostOffice::ArmAsync(const RequestPtr& pRequest) {
    constexpr auto kAskEvery = std::chrono::milliseconds(100);
    auto next = pRequest->deadline;
    if (pRequest->keepWaiting) next = std::min(next, std::chrono::steady_clock::now() + kAskEvery);
    pRequest->timer->expires_at(next);
    std::weak_ptr<bool> alive = amAlive;
    pRequest->timer->async_wait([this, alive, pRequest](const boost::system::error_code& error) {
        if (error || alive.expired() || pRequest->finished) return;
        const std::string& app = pRequest->key.first;
        if (std::chrono::steady_clock::now() >= pRequest->deadline) {
            Finish(pRequest, false, MyMemoryBlock(),
                   "no answer from " + app + " within " +
                       std::to_string(pRequest->timeout.count()) + " ms");
        } else if (pRequest->keepWaiting && !pRequest->keepWaiting()) {
            Finish(pRequest, false, MyMemoryBlock(),
                   "no answer from " + app + "; the wait was given up");
        } else {
            ArmAsync(pRequest);
        }
    });
}

// Ends a request for its caller; it keeps its place among the outstanding
// ones until its answer comes. An asynchronous caller is called back on the
// loop, never from inside the transport's delivery.
void PostOffice::Finish(const RequestPtr& pRequest, bool abAnswered, MyMemoryBlock axData,
                        std::string asError) {
    if (pRequest->finished) return;
    pRequest->finished = true;
    pRequest->answered = abAnswered;
    if (abAnswered) pRequest->data.emplace(std::move(axData));
    pRequest->error = std::move(asError);
    if (!pRequest->async) return;  // a blocking wait sees it finished
    if (pRequest->timer) pRequest->timer->cancel();
    amAsync.erase(std::remove(amAsync.begin(), amAsync.end(), pRequest), amAsync.end());
    if (!abAnswered) {
        LogFile::WriteToLog(String("SendAndReceiveAsync: ") + String(pRequest->error),
                            String(kLogKey));
    }
    Application::Get().Post([pRequest] {
        if (!pRequest->done) return;
        AnswerResult result;
        result.answered = pRequest->answered;
        if (pRequest->data) result.data = std::move(*pRequest->data);
        result.error = pRequest->error;
        pRequest->done(result);
    });
}
