// DDE is the older transport for post-office messages, on the D-Bus session
// bus. Every process may own two well-known names for its topics, the plain
// application name and the name + "_" + process id:
//
//   com.klume.VELTRAApplication.<topic>      (characters other than letters,
//                                             digits, "_" and "-" become "_";
//                                             + "_" + $USERNAME when set, as the
//                                             sockets' names)
//
// and serves one object, /com/klume/VELTRAApplication, with the interface
// com.klume.VELTRAApplication:
//   Connect(s service, s topic) -> b     accepted only for "VELTRAApplication"
//                                        and one of the receiver's own topics
//   Disconnect(s service, s topic)
//   Poke(s topic, s item, ay data) -> b  item: the command; data: the
//                                        sender, ":", the encoded data block;
//                                        sent without waiting for the reply
//                                        (answers come back as pokes); served
//                                        only from the connection that owns
//                                        the sender's bus name, of this user
//   Execute(s topic, ay data) -> b       at most 500 bytes go to the execute function
//   Request(s topic, s item) -> b        not served: logged as an unknown
//                                        transaction, answered false
// The bus connection is driven by the application's event loop (its file
// descriptor and time-out), never by a thread of its own, and received pokes
// and execute commands reach their functions on that loop, after the bus
// dispatch returned; they are posted through Application::Post, so a GUI's
// loop that drives the application's (nxbase/glibloop.h, nxbase/qtloop.h)
// runs them as well.
#ifndef NXBASE_DDE_H_
#define NXBASE_DDE_H_

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"
#include "nxbase/veltraevent.h"

class PostOfficeApplications;
namespace sdbus {
class MethodCall;
}

namespace nxbase {
inline constexpr const char* kDdeService = "VELTRAApplication";
inline constexpr const char* kDdeBusPrefix = "com.klume.VELTRAApplication.";
inline constexpr const char* kDdeObjectPath = "/com/klume/VELTRAApplication";
inline constexpr const char* kDdeInterface = "com.klume.VELTRAApplication";
// The bus name of a topic, with the person's part of its pipe name.
NXBASE_EXPORT std::string DdeBusName(const std::string& asTopic);
// Takes a poke's data apart: the sender before the first ":", then the
// encoded block, decoded into `axBlock`. Without a ":" the sender is empty
// and all of it is the block.
NXBASE_EXPORT void SplitPoke(const std::string& asData, std::string& asSender,
                             MyMemoryBlock& axBlock);
// The same on data that arrives in pieces, each decoded in place into the
// block as it comes: the block is the only copy of the data made.
class NXBASE_EXPORT PokeSplitter {
  public:
    explicit PokeSplitter(std::size_t alExpectedSize = 0);
    void Take(char* pData, std::size_t alSize);
    // The bytes before the first ":" so far, and whether the ":" has come.
    const std::string& Sender() const { return amSender; }
    bool SenderComplete() const { return amColonSeen; }
    // After the last piece; the splitter is spent.
    void Finish(std::string& asSender, MyMemoryBlock& axBlock);

  private:
    void Decode(char* pData, std::size_t alSize);
    std::string amSender;
    bool amColonSeen = false;
    StuffedDecoder amDecoder;
    MyMemoryBlock amBlock;
};
}  // namespace nxbase

class NXBASE_EXPORT DDE {
  public:
    // The process's one DDE object (a second is an assertion, "pThis == 0").
    // Without a session bus the object exists but is off (logged); so it is
    // while the configured bus does not answer (its daemon restarting), and
    // it joins the bus when it does. A bus that is there but refuses the
    // connection shows the error box "DDE-Server kann nicht initialisiert
    // werden." and quits the application. A bus
    // name that another connection owns turns it off, logged, the sockets
    // serving on. A bus that goes away later (a logout, a restart of the bus)
    // turns it off, logged; the sockets go on serving, and the object joins
    // the bus again when it comes back (tried after 1 s, then at doubling
    // intervals up to 30 s; logged when it succeeds).
    explicit DDE(const std::string& asOwnAppName);
    ~DDE();
    DDE(const DDE&) = delete;
    DDE& operator=(const DDE&) = delete;

    static DDE* Instance();
    bool IsActive() const;
    // Turns the transport off for good, logged with `asWhy`; the names stay
    // with the bus (a forked child must not release its parent's).
    void TurnOff(const std::string& asWhy);
    // TurnOff, and no longer the process's DDE object: a new one may be made
    // while this one waits to be deleted.
    void Retire(const std::string& asWhy);

    void SetReceiveFunction(ReceiveFunction fFunction) { fmReceiveFunction = fFunction; }
    void SetExecuteFunction(std::function<void(const std::string&)> fFunction) {
        fmExecute = std::move(fFunction);
    }
    // Applications that may be started when their topic is not on the bus.
    void SetApplications(const PostOfficeApplications* pApplications) {
        pmApplications = pApplications;
    }
    // Starts application `asApp` and runs the loop until `fReady()` is true;
    // false with the reason in `asWhy`. The transport that owns this object
    // installs it, so that both transports start peers one way.
    using Starter = std::function<bool(const std::string& asApp,
                                       const std::function<bool()>& fReady, std::string& asWhy)>;
    void SetStarter(Starter fStarter) { fmStart = std::move(fStarter); }

    // Pokes `asCommand` with the encoded block to the application `asApp`,
    // starting it first (through the starter) when it is known but not on the
    // bus and `abMayStart`.
    bool Send(const std::string& asApp, const std::string& asCommand,
              const std::string& asEncodedData, bool abMayStart = true);
    // Whether a server for the service and topic is on the bus (its topic's
    // bus name has an owner; only that server can own it).
    bool IsAppRunning(const char* aService, const char* aTopic);
    // Hands the oldest received poke to the receive function.
    static void UserEvent(unsigned long alId, void* pData);

  private:
    struct Bus;
    struct Retry;
    enum class Joined { kYes, kNoBus, kBusAbsent, kNameTaken, kFailed };
    Joined Join();
    void RejoinLater();
    void Arm();
    void Process();
    bool Connect(const std::string& asTopic);
    bool SpeaksFor(const std::string& asClaimed);
    bool TakePoke(sdbus::MethodCall& axCall, const std::string& asItem);
    void Enqueue(VELTRAEvent&& axEvent);

    std::string amOwnName;
    std::unique_ptr<Bus> pmBus;
    std::unique_ptr<Retry> pmRetry;  // while the bus is lost
    std::deque<VELTRAEvent> amEvents;
    ReceiveFunction fmReceiveFunction = nullptr;
    std::function<void(const std::string&)> fmExecute;
    const PostOfficeApplications* pmApplications = nullptr;
    Starter fmStart;
    std::shared_ptr<bool> amAlive = std::make_shared<bool>(true);
};

#endif  // NXBASE_DDE_H_
