// PostOffice is the one object per process through which an application
// exchanges messages with its peers and with the measuring-device server
// LumaServer. It owns the transport, keeps one handler per message number,
// queues received commands and hands them to their handlers on the event
// loop (at once, and on a 100 ms tick while some stay queued), collects the answers that callers
// wait for, counts connected peers and keeps the application lock.
//
// Every answer block starts with a status byte: 0 done, 1 refused (an
// unknown message, or the application is locked by another peer), 2 not
// supported; except CONNECT's, whose one byte is the protocol level both
// sides speak (at most 3; nxbase::ProtocolLevel reads it). Everything here
// runs on the event-loop thread.
#ifndef NXBASE_POSTOFFICE_H_
#define NXBASE_POSTOFFICE_H_

#include <boost/function.hpp>
#include <chrono>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"
#include "nxbase/poapps.h"
#include "nxbase/singleton.h"
#include "nxbase/veltraevent.h"
#include "toolkit/application.h"
#include "toolkit/string.h"

// What SendAndReceive does with the active top window: 0 leaves it alone,
// 1 and 2 disable it while waiting.
enum DisEnable { DisEnableNone = 0, DisEnableWindow = 1, DisEnableWindow2 = 2 };

// Whether a send may start its peer when it does not run. Inside a
// conversation (after CONNECT and LOCK) a server that was started anew knows
// nothing of it, so such sends say kNever.
enum class PeerStart { kIfNeeded, kNever };

// How an asynchronous SendAndReceive ended: the answer block (its status
// byte first), or why there is none.
struct AnswerResult {
    bool answered = false;
    MyMemoryBlock data;
    std::string error;
};

class NXBASE_EXPORT PostOffice : public NxSingleton {
  public:
    // Creates (or replaces) the post office of application `asAppName`: reads
    // the application table (which throws when the server is missing or too
    // old, see PostOfficeApplications) and opens the transport.
    static PostOffice* CreatePostOffice(String asAppName);
    // std::logic_error "Please create the PostOffice-Singleton first !" when
    // none was created.
    static PostOffice* Instance();
    static bool IsInitialized() { return smInstance != nullptr; }
    ~PostOffice() override;

    // Sends one message (by number or by command text; a numeric text n is
    // the name of message n, or the answer to n - 1000 from 1000 on). The
    // data block is encoded on the way. Four retries, each after letting the
    // loop run and a 1 ms pause; `keepTrying` returning false stops early,
    // and is also asked while a peer that was started is awaited, whichever
    // transport started it (one start per Send, all retries included, and
    // at most nxbase::StartWaitLimit(): 10 s, less when $NXBASE_WAIT_TIMEOUT
    // is shorter). A peer that does not run is started only with
    // PeerStart::kIfNeeded. A message whose frame would pass
    // nxbase::kMaxFrameLength fails after its first attempt. True on
    // success; GetLastError() says why a send failed.
    unsigned char Send(const std::string& asApp, PO_Botschaften axMessage, MyMemoryBlock& axData,
                       boost::function<bool()> fKeepTrying = boost::function<bool()>(),
                       PeerStart axStart = PeerStart::kIfNeeded);
    unsigned char Send(const std::string& asApp, String& asCommand, MyMemoryBlock& axData,
                       boost::function<bool()> fKeepTrying = boost::function<bool()>(),
                       PeerStart axStart = PeerStart::kIfNeeded);
    // Sends message `alMessage` and waits, with the loop turning, for its
    // answer from `asApp`, which then replaces `axReceive`. The wait ends
    // without an answer when `keepWaiting` returns false (asked on every
    // event and at least every 50 ms), when the channel to `asApp` is lost,
    // when Application::Quit() is called meanwhile, or when the post office
    // is destroyed meanwhile (by a handler the wait ran).
    //
    // Frames carry no request id: a peer answers its requests in the order
    // they came. So every request, blocking or asynchronous, takes its place
    // in one queue per peer and message number, in the order sent, and each
    // answer goes to the oldest request in it that went out on the answer's
    // connection (DDE counting as one): answers on two connections may
    // overtake each other. A request given up (time-out,
    // keep-waiting, its caller's end) keeps its place until its answer comes,
    // and that answer is logged and dropped; the queue empties when the
    // channel is lost.
    unsigned char SendAndReceive(const std::string& asApp, int alMessage, MyMemoryBlock& axSend,
                                 MyMemoryBlock& axReceive, boost::function<bool()> fKeepWaiting,
                                 DisEnable axMode = DisEnableNone,
                                 PeerStart axStart = PeerStart::kIfNeeded);
    // The same with the post office's own keep-waiting function: after 6 s
    // it opens the abort dialog of the UserInterface handler. There is no
    // fixed time-out (a measurement may wait for an operator), unless
    // $NXBASE_WAIT_TIMEOUT gives one in seconds; a handler that cannot ask a
    // person then ends the wait after that time and logs it.
    unsigned char SendAndReceive(const std::string& asApp, int alMessage, MyMemoryBlock& axSend,
                                 MyMemoryBlock& axReceive, DisEnable axMode = DisEnableNone,
                                 PeerStart axStart = PeerStart::kIfNeeded);
    // Sends message `alMessage` to `asApp` and returns at once; `fDone` is
    // called later on the loop, exactly once, with the answer or with why
    // there is none: the send failed, the channel to `asApp` was lost,
    // `fKeepWaiting` (asked at least every 100 ms) returned false, or
    // `timeout` passed (starting the peer included). Answers are matched to
    // requests as for SendAndReceive. Requests still pending when the post
    // office is destroyed are dropped uncalled.
    using AnswerCallback = std::function<void(AnswerResult&)>;
    void SendAndReceiveAsync(const std::string& asApp, int alMessage, const MyMemoryBlock& axSend,
                             AnswerCallback fDone,
                             std::chrono::milliseconds timeout = std::chrono::seconds(30),
                             boost::function<bool()> fKeepWaiting = {},
                             PeerStart axStart = PeerStart::kIfNeeded);
    // Asynchronous requests whose call-back is still to come.
    std::size_t GetPendingAsyncCount() const { return amAsync.size(); }
    // Requests sent to `asApp` for message `alMessage` whose answers are still
    // to come, given up ones included.
    std::size_t GetOutstandingCount(const std::string& asApp, int alMessage) const;

    // Called on the loop with the peer's name whenever the channel to a peer
    // is lost (it ended, was killed, or broke the protocol). An application
    // in a conversation with a server (after CONNECT and LOCK) learns so that
    // the server it talks to is gone. Returns an id for
    // RemovePeerLostFunction.
    using PeerLostFunction = std::function<void(const std::string&)>;
    int AddPeerLostFunction(PeerLostFunction fFunction);
    void RemovePeerLostFunction(int alId);
    // Answers a received command: "ANSWER!" + its name, back to its sender
    // on the connection the command came in on (no retries: a peer that is
    // gone does not come back on that connection).
    unsigned char Answer(VELTRAEvent* pCommand, MyMemoryBlock& axData);

    // The handler of a message number (unset: the default handler answers);
    // handlers get the VELTRAEvent* as their argument.
    Link ChangeMessageHdl(unsigned int alMessage, Link& axHandler, unsigned char = 0);
    Link GetMessageHdl(unsigned int alMessage) const;
    // The function the transports deliver every received event to. While it
    // is DummyReceiveFunction (the start) the post office handles events
    // itself; another function receives them instead and passes on those the
    // post office is to handle, to the function it got back (a chain) or to
    // CommunicationReceiveFunction; one that does neither filters. Returns
    // the old one.
    ReceiveFunction ChangeReceiveFunction(ReceiveFunction fFunction);
    // The post office's own handling, for a receive function to chain to.
    static void DummyReceiveFunction(VELTRAEvent& axEvent);

    int NumberOfCommand(VELTRAEvent& axEvent);
    static void Encode(MyMemoryBlock& axBlock);
    static void Decode(MyMemoryBlock& axBlock);

    unsigned char LockApplication();
    void UnlockApplication();

    std::size_t GetAnzahlApp() const { return amApplications.GetApplicationCount(); }
    bool HasApplication(const std::string& asId) const {
        return amApplications.HasApplication(asId);
    }
    std::vector<std::string> GetApplications() const { return amApplications.GetApplications(); }
    const PostOfficeApplications::ApplicationMap& GetApplicationsMap() const {
        return amApplications.GetApplicationsMap();
    }
    boost::shared_ptr<PostOfficeApplication> GetApplication(const std::string& asId) const {
        return amApplications.GetApplication(asId);
    }
    PostOfficeApplication GetApplicationInfo(const std::string& asId) const {
        return amApplications.GetApplicationInfo(asId);
    }
    bool IsLPMServer() const;

    void BotschaftenHandler();
    long TimerCallback(void*);
    // Handles one received message: protocol messages at once, answers for
    // whoever waits for them, commands into the queue.
    void CommunicationReceiveFunction(VELTRAEvent& axEvent);
    long DefaultHdl(void* pEvent);

    // State, for tools and tests.
    const String& GetOwnName() const { return amOwnName; }
    const String& GetLockOwner() const { return amLockOwner; }
    int GetLockCount() const { return amLockCount; }
    int GetConnectionCount() const { return amConnectionCount; }
    // The CONNECTs of peer `asPeer` not yet matched by a DISCONNECT.
    int GetConnectionCount(const std::string& asPeer) const {
        auto at = amConnectedPeers.find(asPeer);
        return at == amConnectedPeers.end() ? 0 : at->second;
    }
    std::size_t GetQueueSize() const { return amCommandQueue.size(); }
    bool IsHandlerBusy() const { return amHandlerBusy; }
    // Why the last Send or SendAndReceive failed.
    const std::string& GetLastError() const { return amLastError; }

  private:
    explicit PostOffice(const String& asAppName);
    template <class T, class... Args>
    friend T* nxbase::CreateOrReplaceSingleton(T*&, Args&&...);

    static void TransportReceive(VELTRAEvent& axEvent);
    unsigned char CheckLock(const String& asSender);
    bool TryOnce(const std::string& asApp, const std::string& asCommand, std::string_view asEncoded,
                 const std::weak_ptr<bool>& alive);
    bool AnswerBytes(VELTRAEvent* pCommand, std::string_view asData);
    unsigned char SendCommand(const std::string& asApp, const std::string& asCommand,
                              const MyMemoryBlock& axData,
                              const boost::function<bool()>& fKeepTrying, PeerStart axStart);
    bool OnOwnThread(const char* asCall);
    void AnswerStatus(VELTRAEvent& axEvent, signed char axStatus);
    void HandleConnect(VELTRAEvent& axEvent);
    void HandleAnswer(VELTRAEvent& axEvent, int alNumber);
    bool CountDisconnect(const std::string& asSender);
    void HandleCommand(VELTRAEvent& axEvent);
    void HandleDisconnectInServer(VELTRAEvent& axEvent);
    void ScheduleHandler();
    void TickWhileQueued();
    void PeerLost(const std::string& asApp);
    struct Request;
    using RequestPtr = std::shared_ptr<Request>;
    bool SendRequest(const RequestPtr& pRequest, const MyMemoryBlock& axSend,
                     const boost::function<bool()>& fKeepTrying, PeerStart axStart);
    void StartAsync(const RequestPtr& pRequest, const MyMemoryBlock& axSend, PeerStart axStart);
    void AwaitStart(const RequestPtr& pRequest, std::shared_ptr<const MyMemoryBlock> pSend,
                    int alPid, std::chrono::milliseconds pause);
    void SendAsync(const RequestPtr& pRequest, const MyMemoryBlock& axSend, PeerStart axStart);
    void ArmAsync(const RequestPtr& pRequest);
    RequestPtr NewBlockingRequest();
    void Finish(const RequestPtr& pRequest, bool abAnswered, MyMemoryBlock axData,
                std::string asError);
    void CloseWhenUnused();

    Link amHandlers[ANZAHL_BOTSCHAFTEN];
    PostOfficeApplications amApplications;
    FlagSet amFlags;
    std::deque<VELTRAEvent> amCommandQueue;
    // Requests sent and not yet answered, by peer and answer number, in the
    // order sent; given up ones keep their places until their answers come.
    // An emptied queue stays until its peer's channel is lost.
    std::map<std::pair<std::string, int>, std::deque<RequestPtr>> amOutstanding;
    std::vector<RequestPtr> amAsync;  // asynchronous requests whose call-back is to come
    RequestPtr amSpareRequest;        // the last blocking request's record, reused when free
    std::map<int, PeerLostFunction> amPeerLostFunctions;
    int amNextPeerLostId = 1;
    AutoTimer amTimer;
    Timer amQuitTimer;
    String amOwnName;
    String amLockOwner;
    int amLockCount = 0;
    int amConnectionCount = 0;
    int amLocalLock = 0;
    bool amHandlerBusy = false;
    bool amHandlerScheduled = false;
    ReceiveFunction fmReceiveFunction = &PostOffice::DummyReceiveFunction;
    std::map<std::string, int> amConnectedPeers;  // CONNECTs not yet matched, per peer
    std::shared_ptr<bool> amAlive = std::make_shared<bool>(true);
    std::string amLastError;
    std::thread::id amThread = std::this_thread::get_id();

    static PostOffice* smInstance;
};

#endif  // NXBASE_POSTOFFICE_H_
