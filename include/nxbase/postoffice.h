// PostOffice is the one object per process through which an application
// exchanges messages with its peers and with the measuring-device server
// LumaServer. It owns the transport, keeps one handler per message number,
// queues received commands and hands them to their handlers on the event
// loop (at once and on a 100 ms tick), collects the answers that callers
// wait for, counts connected peers and keeps the application lock.
//
// Every answer block starts with a status byte: 0 done, 1 refused (an
// unknown message, or the application is locked by another peer), 2 not
// supported. Everything here runs on the event-loop thread.
#ifndef NXBASE_POSTOFFICE_H_
#define NXBASE_POSTOFFICE_H_

#include <boost/function.hpp>
#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <set>
#include <string>
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

class NXBASE_EXPORT PostOffice : public NxSingleton {
  public:
    // Creates (or replaces) the post office of application `asAppName`: reads
    // the application table (which throws when the server is missing or too
    // old, see PostOfficeApplications), opens the transport and starts the
    // 100 ms timer.
    static PostOffice* CreatePostOffice(String asAppName);
    // std::logic_error "Please create the PostOffice-Singleton first !" when
    // none was created.
    static PostOffice* Instance();
    static bool IsInitialized() { return smInstance != nullptr; }
    ~PostOffice() override;

    // Sends one message (by number or by command text; a numeric text n is
    // the name of message n, or the answer to n - 1000 from 1000 on). The
    // data block is encoded on the way. Four retries, each after letting the
    // loop run; `keepTrying` returning false stops early. True on success.
    unsigned char Send(const std::string& asApp, PO_Botschaften axMessage, MyMemoryBlock& axData,
                       boost::function<bool()> fKeepTrying = boost::function<bool()>());
    unsigned char Send(const std::string& asApp, String& asCommand, MyMemoryBlock& axData,
                       boost::function<bool()> fKeepTrying = boost::function<bool()>());
    // Sends message `alMessage` and waits, with the loop turning, for its
    // answer, which then replaces `axReceive`. The wait ends without an
    // answer when `keepWaiting` returns false (asked on every event and at
    // least every 50 ms) or when the channel to `asApp` is lost.
    unsigned char SendAndReceive(const std::string& asApp, int alMessage, MyMemoryBlock& axSend,
                                 MyMemoryBlock& axReceive, boost::function<bool()> fKeepWaiting,
                                 DisEnable axMode = DisEnableNone);
    // The same with the post office's own keep-waiting function: after 6 s
    // it opens the abort dialog of the UserInterface handler; a handler that
    // cannot ask a person ends the wait after $NXBASE_WAIT_TIMEOUT seconds
    // (default 30) and logs it.
    unsigned char SendAndReceive(const std::string& asApp, int alMessage, MyMemoryBlock& axSend,
                                 MyMemoryBlock& axReceive, DisEnable axMode = DisEnableNone);
    // Answers a received command: "ANSWER!" + its name, back to its sender.
    unsigned char Answer(VELTRAEvent* pCommand, MyMemoryBlock& axData);

    // The handler of a message number (unset: the default handler answers);
    // handlers get the VELTRAEvent* as their argument.
    Link ChangeMessageHdl(unsigned int alMessage, Link& axHandler, unsigned char = 0);
    Link GetMessageHdl(unsigned int alMessage) const;
    // A function called with every received event before the post office
    // handles it (initially DummyReceiveFunction); returns the old one.
    ReceiveFunction ChangeReceiveFunction(ReceiveFunction fFunction);
    static void DummyReceiveFunction(VELTRAEvent&) {}

    int NumberOfCommand(VELTRAEvent& axEvent);
    static void Encode(MyMemoryBlock& axBlock);
    static void Decode(MyMemoryBlock& axBlock);

    unsigned char LockApplication();
    void UnlockApplication();

    std::size_t GetAnzahlApp() const { return amApplications.GetApplicationCount(); }
    bool HasApplication(const std::string& asId) const { return amApplications.HasApplication(asId); }
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
    // The entry through which the transport delivers every received message.
    void CommunicationReceiveFunction(VELTRAEvent& axEvent);
    long DefaultHdl(void* pEvent);

    // State, for tools and tests.
    const String& GetOwnName() const { return amOwnName; }
    const String& GetLockOwner() const { return amLockOwner; }
    int GetLockCount() const { return amLockCount; }
    int GetConnectionCount() const { return amConnectionCount; }
    std::size_t GetQueueSize() const { return amCommandQueue.size(); }
    bool IsHandlerBusy() const { return amHandlerBusy; }

  private:
    explicit PostOffice(const String& asAppName);

    static void TransportReceive(VELTRAEvent& axEvent);
    unsigned char CheckLock(const String& asSender);
    bool TryOnce(const std::string& asApp, const std::string& asCommand,
                 const MyMemoryBlock& axEncoded);
    bool TakeAnswer(int alNumber, MyMemoryBlock& axReceive);
    void AnswerStatus(VELTRAEvent& axEvent, signed char axStatus);
    void HandleConnect(VELTRAEvent& axEvent);
    void HandleDisconnectInServer(VELTRAEvent& axEvent);
    void ScheduleHandler();
    void PeerLost(const std::string& asApp);
    void CloseWhenUnused();

    Link amHandlers[ANZAHL_BOTSCHAFTEN];
    PostOfficeApplications amApplications;
    FlagSet amFlags;
    std::deque<VELTRAEvent> amCommandQueue;
    std::map<int, std::deque<MyMemoryBlock>> amAnswers;
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
    std::set<std::string> amLostPeers;  // channels lost since a wait began
    std::map<std::string, int> amConnectedPeers;  // CONNECTs not yet matched, per peer
    std::shared_ptr<bool> amAlive = std::make_shared<bool>(true);

    static PostOffice* smInstance;
};

#endif  // NXBASE_POSTOFFICE_H_
