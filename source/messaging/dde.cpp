#include "nxbase/dde.h"

#include <poll.h>  // the flags of the connection's poll data
#include <sdbus-c++/sdbus-c++.h>

#include <algorithm>
#include <array>
#include <boost/asio/posix/stream_descriptor.hpp>
#include <boost/asio/steady_timer.hpp>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <utility>

#include "messaging_log.h"
#include "nxbase/check.h"
#include "nxbase/logfile.h"
#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/poapps.h"
#include "toolkit/application.h"
#include "toolkit/fileio.h"
#include "toolkit/system.h"
#include "toolkit/userinterface.h"

namespace nxbase {

std::string DdeBusName(const std::string& asTopic) {
    std::string element;
    // Per person, as the sockets are: two people on one login have names of their own.
    for (char c : PipeName(asTopic)) {
        bool allowed = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
                       c == '_' || c == '-';
        element += allowed ? c : '_';
    }
    if (element.empty() || (element[0] >= '0' && element[0] <= '9')) element.insert(0, "_");
    return kDdeBusPrefix + element;
}

PokeSplitter::PokeSplitter(std::size_t alExpectedSize)
    : amBlock(static_cast<long>(std::min<std::size_t>(alExpectedSize, kMaxFrameLength))) {}

void PokeSplitter::Take(char* pData, std::size_t alSize) {
    if (!amColonSeen) {
        const char* colon = static_cast<const char*>(std::memchr(pData, ':', alSize));
        const std::size_t head =
            colon == nullptr ? alSize : static_cast<std::size_t>(colon - pData);
        amSender.append(pData, head);
        if (colon == nullptr) return;
        amColonSeen = true;
        pData += head + 1;
        alSize -= head + 1;
    }
    Decode(pData, alSize);
}

void PokeSplitter::Decode(char* pData, std::size_t alSize) {
    amBlock.Put(pData, static_cast<long>(amDecoder.Decode(pData, alSize)));
}

void PokeSplitter::Finish(std::string& asSender, MyMemoryBlock& axBlock) {
    if (!amColonSeen) {
        Decode(amSender.data(), amSender.size());  // no sender: all of it is the block
        amSender.clear();
    }
    if (amDecoder.EndsWithLoneEscape()) amBlock << '\x01';
    asSender = std::move(amSender);
    axBlock = std::move(amBlock);
}

void SplitPoke(const std::string& asData, std::string& asSender, MyMemoryBlock& axBlock) {
    std::string copy = asData;
    PokeSplitter splitter(copy.size());
    splitter.Take(copy.data(), copy.size());
    splitter.Finish(asSender, axBlock);
}

}  // namespace nxbase

namespace {

constexpr const char* kLogKey = "Communication";
constexpr std::size_t kMaxExecuteBytes = 500;
constexpr auto kCallTimeout = std::chrono::seconds(5);

DDE* pThis = nullptr;

void Log(const std::string& asText) {
    LogFile::WriteToLog(String(asText), String(kLogKey));
}

bool SessionBusConfigured() {
    const char* address = std::getenv("DBUS_SESSION_BUS_ADDRESS");
    if (address && *address) return true;
    const char* runtime = std::getenv("XDG_RUNTIME_DIR");
    return runtime && *runtime &&
           toolkit::KindOf(std::string(runtime) + "/bus") != toolkit::FileKind::kNone;
}

// The bus's address leads nowhere: its daemon is gone or not yet started.
bool NobodyServes(const sdbus::Error& axError) {
    return axError.getName() == "org.freedesktop.DBus.Error.FileNotFound" ||
           axError.getName() == "System.Error.ECONNREFUSED" ||
           axError.getName() == "System.Error.ENOENT";
}

// False when another connection owns the name; other failures throw.
bool RequestName(sdbus::IConnection& axConnection, const std::string& asName) {
    try {
        axConnection.requestName(asName);
        return true;
    } catch (const sdbus::Error& error) {
        if (error.getName() == "org.freedesktop.DBus.Error.FileExists" ||
            error.getMessage().find("File exists") != std::string::npos)
            return false;
        throw;
    }
}

}  // namespace

// The wait before the next attempt to join a bus that was lost.
struct DDE::Retry {
    static constexpr std::chrono::milliseconds kFirst{1000};
    static constexpr std::chrono::milliseconds kLongest{30000};
    explicit Retry(boost::asio::io_context& axContext) : timer(axContext) {}
    boost::asio::steady_timer timer;
    std::chrono::milliseconds wait = kFirst;
};

struct DDE::Bus {
    std::unique_ptr<sdbus::IConnection> connection;
    std::unique_ptr<sdbus::IObject> object;
    std::string topics[2];
    std::unique_ptr<boost::asio::posix::stream_descriptor> descriptor;
    std::unique_ptr<boost::asio::steady_timer> timer;
    bool readWait = false;
    bool writeWait = false;
    ~Bus() {
        if (descriptor) descriptor->release();  // the connection owns the descriptor
    }
};

DDE::DDE(const std::string& asOwnAppName) : amOwnName(asOwnAppName) {
    NX_ASSERT(pThis == 0);  // one per process
    pThis = this;
    switch (Join()) {
        case Joined::kNoBus:
            Log("DDE is off: no session bus");
            break;
        case Joined::kBusAbsent:
            LogFile::WriteToLog(
                String("DDE is off: the session bus does not answer; joined when it does"),
                String());
            RejoinLater();
            break;
        case Joined::kFailed:
            UserInterface::Current()->ErrorBox("DDE-Server kann nicht initialisiert werden.");
            Application::Get().Quit();
            break;
        case Joined::kYes:
        case Joined::kNameTaken:
            break;
    }
}

// Connects to the session bus, takes the two names and serves the object.
DDE::Joined DDE::Join() {
    if (!SessionBusConfigured()) return Joined::kNoBus;
    try {
        auto bus = std::make_unique<Bus>();
        bus->connection = sdbus::createSessionBusConnection();
        bus->topics[0] = amOwnName + "_" + std::to_string(::getpid());
        bus->topics[1] = amOwnName;
        for (const std::string& topic : bus->topics) {
            if (RequestName(*bus->connection, nxbase::DdeBusName(topic))) continue;
            // Somebody else holds the name: the sockets serve on alone.
            LogFile::WriteToLog(
                String("DDE is off: the bus name " + nxbase::DdeBusName(topic) + " is taken"),
                String());
            return Joined::kNameTaken;
        }
        bus->object = sdbus::createObject(*bus->connection, nxbase::kDdeObjectPath);
        std::weak_ptr<bool> alive = amAlive;
        auto ownTopic = [this](const std::string& service, const std::string& topic) {
            return service == nxbase::kDdeService &&
                   (topic == pmBus->topics[0] || topic == pmBus->topics[1]);
        };
        bus->object->registerMethod("Connect")
            .onInterface(nxbase::kDdeInterface)
            .implementedAs([ownTopic](const std::string& service, const std::string& topic) {
                Log("DDE Callback function (CONNECT)");
                bool accepted = ownTopic(service, topic);
                if (accepted) Log("DDE Callback function (CONNECT_CONFIRM)");
                return accepted;
            });
        bus->object->registerMethod("Disconnect")
            .onInterface(nxbase::kDdeInterface)
            .implementedAs([](const std::string&, const std::string&) {
                Log("DDE Callback function (DISCONNECT)");
            });
        // Read by hand: the data goes from the bus message into the event's
        // block piece by piece, never into a third copy.
        bus->object->registerMethod(
            nxbase::kDdeInterface, "Poke", "ssay", "b", [this, ownTopic](sdbus::MethodCall call) {
                Log("DDE Callback function (POKE)");
                std::string topic, item;
                call >> topic >> item;
                const bool taken = ownTopic(nxbase::kDdeService, topic) && TakePoke(call, item);
                auto reply = call.createReply();
                reply << taken;
                reply.send();
            });
        bus->object->registerMethod("Execute")
            .onInterface(nxbase::kDdeInterface)
            .implementedAs(
                [this, ownTopic](const std::string& topic, const std::vector<std::uint8_t>& data) {
                    Log("DDE Callback function (EXECUTE)");
                    if (!ownTopic(nxbase::kDdeService, topic) || !fmExecute) return false;
                    std::size_t size = std::min(data.size(), kMaxExecuteBytes);
                    std::string text(data.begin(), data.begin() + static_cast<long>(size));
                    Application::Get().Post([this, text] { fmExecute(text); });
                    return true;
                });
        // Transactions this transport does not serve (a client asking for
        // data, say) are logged as the transport logs any unknown one.
        bus->object->registerMethod("Request")
            .onInterface(nxbase::kDdeInterface)
            .implementedAs([](const std::string&, const std::string&) {
                Log("DDE Callback function (Unknown)");
                return false;
            });
        bus->object->finishRegistration();
        pmBus = std::move(bus);
        Arm();
        return Joined::kYes;
    } catch (const sdbus::Error& error) {
        pmBus.reset();
        Log(std::string("DDE: ") + error.getName() + ": " + error.getMessage());
        return NobodyServes(error) ? Joined::kBusAbsent : Joined::kFailed;
    }
}

DDE::~DDE() {
    *amAlive = false;
    if (pmBus) {
        try {
            for (const std::string& topic : pmBus->topics) {
                pmBus->connection->releaseName(nxbase::DdeBusName(topic));
            }
        } catch (const sdbus::Error& error) {
            Log("DDEUninitialize - failed!!!");
            Log(std::string("DDE LastError:") + error.getMessage());
        }
    }
    pmBus.reset();
    if (pThis == this) pThis = nullptr;
}

DDE* DDE::Instance() {
    return pThis;
}

bool DDE::IsActive() const {
    return pmBus != nullptr;
}

// Waits on the loop for what the connection needs next: its descriptor to
// be readable, to be writable while a message is not yet all written (a
// large poke leaves the bus in parts), or its time-out.
void DDE::Arm() {
    if (!pmBus) return;
    auto& context = Application::Get().GetContext();
    sdbus::IConnection::PollData poll = pmBus->connection->getEventLoopPollData();
    if (!pmBus->descriptor) {
        pmBus->descriptor =
            std::make_unique<boost::asio::posix::stream_descriptor>(context, poll.fd);
        pmBus->timer = std::make_unique<boost::asio::steady_timer>(context);
    }
    std::weak_ptr<bool> alive = amAlive;
    // A handler already due when the bus is lost (or joined anew) runs after
    // its wait was cancelled: it must find the connection it was armed for.
    const Bus* armedFor = pmBus.get();
    auto stillArmed = [this, alive, armedFor] { return alive.lock() && pmBus.get() == armedFor; };
    using Wait = boost::asio::posix::stream_descriptor::wait_type;
    auto awaitDescriptor = [&](Wait wait, bool Bus::*waiting) {
        if (pmBus.get()->*waiting) return;
        pmBus.get()->*waiting = true;
        pmBus->descriptor->async_wait(
            wait, [this, stillArmed, waiting](const boost::system::error_code& error) {
                if (!stillArmed()) return;
                pmBus.get()->*waiting = false;
                if (!error) Process();
            });
    };
    awaitDescriptor(Wait::wait_read, &Bus::readWait);
    if (poll.events & POLLOUT) awaitDescriptor(Wait::wait_write, &Bus::writeWait);
    if (poll.timeout_usec == UINT64_MAX) {
        pmBus->timer->cancel();
        return;
    }
    timespec now{};
    ::clock_gettime(CLOCK_MONOTONIC, &now);
    std::uint64_t nowUsec = static_cast<std::uint64_t>(now.tv_sec) * 1000000u +
                            static_cast<std::uint64_t>(now.tv_nsec) / 1000u;
    pmBus->timer->expires_after(
        std::chrono::microseconds(poll.timeout_usec > nowUsec ? poll.timeout_usec - nowUsec : 0));
    pmBus->timer->async_wait([this, stillArmed](const boost::system::error_code& error) {
        if (!error && stillArmed()) Process();
    });
}

void DDE::Process() {
    if (!pmBus) return;
    try {
        while (pmBus->connection->processPendingRequest()) {
        }
    } catch (const sdbus::Error& error) {
        TurnOff("the session bus was lost (" + error.getName() + ": " + error.getMessage() +
                "); joined again when it comes back");
        RejoinLater();
        return;
    }
    Arm();
}

// A lost bus (a logout, a restarted bus daemon) may come back at the same
// address: try again, less often the longer it stays away.
void DDE::RejoinLater() {
    if (!pmRetry) pmRetry = std::make_unique<Retry>(Application::Get().GetContext());
    pmRetry->timer.expires_after(pmRetry->wait);
    std::weak_ptr<bool> alive = amAlive;
    pmRetry->timer.async_wait([this, alive](const boost::system::error_code& error) {
        if (!alive.lock() || error || pmBus || pThis != this) return;
        switch (Join()) {
            case Joined::kYes:
                LogFile::WriteToLog(String("DDE is on again: the session bus is back"), String());
                pmRetry->wait = Retry::kFirst;
                return;
            case Joined::kNameTaken:
                return;  // another connection serves the names now
            case Joined::kNoBus:
            case Joined::kBusAbsent:
            case Joined::kFailed:
                pmRetry->wait = std::min(2 * pmRetry->wait, Retry::kLongest);
                RejoinLater();
                return;
        }
    });
}

void DDE::Retire(const std::string& asWhy) {
    TurnOff(asWhy);
    if (pThis == this) pThis = nullptr;
}

void DDE::TurnOff(const std::string& asWhy) {
    if (pmRetry) pmRetry->timer.cancel();
    if (!pmBus) return;
    LogFile::WriteToLog(String("DDE is off: " + asWhy), String());
    if (pmBus->timer) pmBus->timer->cancel();
    pmBus.reset();
}

// Queues the poke's event; it is handled once the bus dispatch has returned:
// a handler may wait for an answer, which needs the bus again.
void DDE::Enqueue(VELTRAEvent&& axEvent) {
    amEvents.push_back(std::move(axEvent));
    Log(Application::Get().IsInExecute() ? "DDE - PostUserEvent" : "DDE - ExecuteUserEvent");
    std::weak_ptr<bool> alive = amAlive;
    Application::Get().Post([alive] {
        if (alive.lock()) UserEvent(1234, nullptr);
    });
}

void DDE::UserEvent(unsigned long, void*) {
    if (pThis == nullptr || pThis->amEvents.empty()) return;
    Log("DDE - UserEvent (in Queue:" + std::to_string(pThis->amEvents.size()) + ")");
    VELTRAEvent event = std::move(pThis->amEvents.front());
    pThis->amEvents.pop_front();
    NX_ASSERT_TEXT(pThis->fmReceiveFunction != 0, "pThis->pReceiveFunction != 0");
    if (pThis->fmReceiveFunction) pThis->fmReceiveFunction(event);
}

namespace {

bool RefusePoke(const std::string& asSender, const std::string& asClaimed) {
    LogFile::WriteToLog(String("DDE: a poke from " + asSender + " claims to come from " +
                               asClaimed + ", whose bus name it does not own; dropped"),
                        String());
    return false;
}

}  // namespace

// The poke's data, read from the message in pieces. It must name its sender
// in its first bytes: no application's name is longer.
bool DDE::TakePoke(sdbus::MethodCall& axCall, const std::string& asItem) {
    constexpr std::size_t kLongestSender = 4096;
    if (!axCall.enterContainer("y")) return false;
    nxbase::PokeSplitter splitter;
    std::array<char, 16 * 1024> piece;
    std::size_t filled = 0;
    for (std::uint8_t byte = 0; axCall >> byte;) {
        piece[filled++] = static_cast<char>(byte);
        if (filled < piece.size()) continue;
        splitter.Take(piece.data(), std::exchange(filled, 0));
        if (!splitter.SenderComplete() && splitter.Sender().size() > kLongestSender)
            return RefusePoke(axCall.getSender(), "(no sender in its first 4096 bytes)");
    }
    axCall.clearFlags();
    axCall.exitContainer();
    splitter.Take(piece.data(), filled);
    if (!SpeaksFor(splitter.Sender())) return false;
    std::string sender;
    MyMemoryBlock block;
    splitter.Finish(sender, block);
    Enqueue(VELTRAEvent(std::move(sender), asItem, std::move(block)));
    return true;
}

// A poke speaks for the application it names only when it comes from the
// connection that owns that application's bus name, of this user: a socket
// peer, or anybody else on the bus, cannot be claimed (as a socket frame is
// bound to its handshake).
bool DDE::SpeaksFor(const std::string& asClaimed) {
    const sdbus::Message* message = pmBus ? pmBus->object->getCurrentlyProcessedMessage() : nullptr;
    if (message == nullptr) return false;
    const std::string sender = message->getSender();
    std::string owner;
    try {
        if (message->getCredsUid() != toolkit::EffectiveUserId())
            return RefusePoke(sender, asClaimed);
        auto bus =
            sdbus::createProxy(*pmBus->connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
        bus->callMethod("GetNameOwner")
            .onInterface("org.freedesktop.DBus")
            .withTimeout(kCallTimeout)
            .withArguments(nxbase::DdeBusName(asClaimed))
            .storeResultsTo(owner);
    } catch (const sdbus::Error&) {
        owner.clear();
    }
    return (!owner.empty() && owner == sender) || RefusePoke(sender, asClaimed);
}

// Whether the topic's bus name has an owner, asked of the bus itself: a
// method call to the peer could cross one of the peer's own calls to us, and
// two processes each waiting for the other would stall until the time-out.
bool DDE::Connect(const std::string& asTopic) {
    if (!pmBus) return false;
    try {
        auto bus =
            sdbus::createProxy(*pmBus->connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
        bool owned = false;
        bus->callMethod("NameHasOwner")
            .onInterface("org.freedesktop.DBus")
            .withTimeout(kCallTimeout)
            .withArguments(nxbase::DdeBusName(asTopic))
            .storeResultsTo(owned);
        return owned;
    } catch (const sdbus::Error&) {
        return false;
    }
}

bool DDE::IsAppRunning(const char* aService, const char* aTopic) {
    NX_ASSERT(aService != 0);
    NX_ASSERT(aTopic != 0);
    if (!pmBus || aService == nullptr || aTopic == nullptr) return false;
    Log("DDE: IsAppRunning");
    if (std::string(aService) != nxbase::kDdeService || !Connect(aTopic)) return false;
    Log("DDE: IsAppRunning - Disconnect");
    return true;
}

bool DDE::Send(const std::string& asApp, const std::string& asCommand,
               const std::string& asEncodedData, bool abMayStart) {
    Log("DDE - Send");
    if (!pmBus) return false;
    if (!Connect(asApp)) {
        if (!abMayStart || pmApplications == nullptr || !pmApplications->HasApplication(asApp)) {
            Log("DDE send abort: HasApplication == 0");
            return false;
        }
        Log("DDE: WinExec");
        std::string why = "nothing starts applications";
        // The wait runs the loop: this object may be turned off or retired meanwhile.
        std::weak_ptr<bool> alive = amAlive;
        if (!fmStart || !fmStart(
                            asApp, [&] { return alive.lock() && pmBus && Connect(asApp); }, why)) {
            Log("DDE send abort: ConversationHandle:0, Topic:" + asApp +
                ", Service:" + nxbase::kDdeService + " (" + why + ")");
            return false;
        }
        if (!alive.lock() || !pmBus) return false;  // turned off while it waited
    }
    // "<sender>:<encoded data>", built once in the form the bus takes.
    std::vector<std::uint8_t> bytes;
    bytes.reserve(amOwnName.size() + 1 + asEncodedData.size());
    bytes.insert(bytes.end(), amOwnName.begin(), amOwnName.end());
    bytes.push_back(':');
    bytes.insert(bytes.end(), asEncodedData.begin(), asEncodedData.end());
    try {
        Log("Sending");
        auto proxy = sdbus::createProxy(*pmBus->connection, nxbase::DdeBusName(asApp),
                                        nxbase::kDdeObjectPath);
        // One way, as the sockets carry it: an answer comes as a poke of its own.
        proxy->callMethod("Poke")
            .onInterface(nxbase::kDdeInterface)
            .withArguments(asApp, asCommand, bytes)
            .dontExpectReply();
        Log("Sent (Result:1)");
        // Messages read while the bus was busy with this call are dispatched next.
        std::weak_ptr<bool> alive = amAlive;
        Application::Get().Post([this, alive] {
            if (alive.lock()) Process();
        });
        return true;
    } catch (const sdbus::Error& error) {
        Log("DDE send abort: ConversationHandle:1, Topic:" + asApp +
            ", Service:" + nxbase::kDdeService);
        Log(std::string("DDE: Last error (DdeGetLastError):") + error.getMessage());
        return false;
    }
}
