#include "nxbase/pipe.h"

#include <array>
#include <atomic>
#include <boost/asio/local/stream_protocol.hpp>
#include <boost/asio/steady_timer.hpp>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <optional>
#include <stdexcept>

#include "messaging_log.h"
#include "nxbase/check.h"
#include "nxbase/dde.h"
#include "nxbase/logfile.h"
#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"
#include "nxbase/poapps.h"
#include "toolkit/application.h"
#include "toolkit/arrival.h"
#include "toolkit/fileio.h"
#include "toolkit/process.h"
#include "toolkit/system.h"
#include "toolkit/unixsocket.h"

namespace nxbase {

namespace detail {

// The loop's own executor type rather than the polymorphic default: every
// read and write would otherwise go through a type-erased executor.
using Executor = boost::asio::io_context::executor_type;
using Socket = toolkit::LocalSocket;
using Acceptor = boost::asio::basic_socket_acceptor<boost::asio::local::stream_protocol, Executor>;
using Timer = boost::asio::basic_waitable_timer<
    std::chrono::steady_clock, boost::asio::wait_traits<std::chrono::steady_clock>, Executor>;

// One connection to a peer, in both directions.
struct Channel {
    enum class Stage { kAwaitingRequest, kAwaitingReply, kOpen };
    Channel(boost::asio::io_context& context, std::uint64_t alId)
        : socket(context.get_executor()), timer(context.get_executor()), id(alId) {}
    Socket socket;
    Timer timer;  // the handshake's time limit
    std::uint64_t id;
    Stage stage = Stage::kAwaitingRequest;
    std::string peer;  // the peer's application name, once known
    bool closed = false;
    std::string closedWhy;
    FrameReader reader;
    std::array<char, 16 * 1024> input;  // what one read takes
    std::deque<std::string> pending;    // bodies read, not yet delivered
    std::string outgoing;               // bytes not yet taken by the socket
    bool writeArmed = false;
    bool readWaiting = false;     // a wait for bytes is queued in the loop
    bool readContinuing = false;  // a turn that reads on is posted
    bool waitedOnce = false;
    toolkit::ArrivalWatch arrival;  // true: its waits may be waits for an arrival
    // A short read may leave the end of the stream behind it: the last wait
    // told nothing of it (or said the peer stopped writing).
    bool readBlind = false;
    bool drained = true;  // the last read left the socket empty
    std::string endWhy;   // why the stream ended, once it did
};

}  // namespace detail

namespace {

using detail::Socket;
using Stage = detail::Channel::Stage;
constexpr const char* kLogKey = "Communication";
constexpr int kReadsPerTurn = 16;
constexpr int kListenBacklog = 64;
// Up to this capacity a frame's body is kept as its command text.
constexpr std::size_t kBodyKeptAsCommand = 1024;
constexpr auto kFirstAcceptPause = std::chrono::milliseconds(100);
constexpr auto kLongestAcceptPause = std::chrono::milliseconds(1000);
const std::string kDisconnect = "DISCONNECT";

Pipe* gPipe = nullptr;
bool gListen = true;

// Unique in the process, not per transport: a request or a wait that names
// a connection of a transport since deleted must never match a new one.
std::uint64_t NextChannelId() {
    static std::atomic<std::uint64_t> next{1};
    return next.fetch_add(1, std::memory_order_relaxed);
}

void Log(const std::string& asText) {
    LogFile::WriteToLog(String(asText), String(kLogKey));
}

// Written whatever the log options: a failure the user must be able to find.
void LogAlways(const std::string& asText) {
    LogFile::WriteToLog(String(asText), String());
}

std::string CommLogPath() {
    std::string log = LogFile::Instance()->GetFileName();
    std::size_t slash = log.rfind('/');
    return (slash == std::string::npos ? std::string(".") : log.substr(0, slash)) + "/CommLog.log";
}

bool StartsWith(const std::string& asText, const char* asPrefix) {
    return asText.compare(0, std::strlen(asPrefix), asPrefix) == 0;
}

}  // namespace

std::string MessagingRuntimeDirectory() {
    if (const char* own = std::getenv("NXBASE_RUNTIME_DIR"); own && *own) return own;
    if (const char* xdg = std::getenv("XDG_RUNTIME_DIR"); xdg && *xdg == '/') {
        return std::string(xdg) + "/k-lume";
    }
    return "/tmp/k-lume-" + std::to_string(::geteuid());
}

std::string PipeName(const std::string& asBase) {
    const char* user = std::getenv("USERNAME");
    return user && *user ? asBase + "_" + user : asBase;
}

std::string RequestSocketPath(const std::string& asApp) {
    return MessagingRuntimeDirectory() + "/" + PipeName(kPipeRequestPrefix + asApp);
}

bool IsApplicationRunning(const std::string& asApp) {
    return toolkit::Sockets().IsNameLocked(RequestSocketPath(asApp) + ".lock");
}

}  // namespace nxbase

using nxbase::FrameReader;
using nxbase::Stage;
using nxbase::StartsWith;
using nxbase::detail::Channel;

struct Pipe::Listener {
    explicit Listener(boost::asio::io_context& context)
        : acceptor(context.get_executor()), pause(context.get_executor()) {}
    nxbase::detail::Acceptor acceptor;
    nxbase::detail::Timer pause;  // after a failed accept
    std::chrono::milliseconds nextPause = nxbase::kFirstAcceptPause;
};

// ---- creation ----

Pipe* Pipe::CreatePipe(const std::string& asOwnAppName) {
    static bool forkHandled = [] {
        Application::Get().AddForkChildFunction([] {
            if (nxbase::gPipe) nxbase::gPipe->LetGoAfterFork();
        });
        return true;
    }();
    (void)forkHandled;
    DeletePipe();
    auto* pipe = new Pipe(asOwnAppName);
    try {
        if (nxbase::gListen) pipe->Listen();
    } catch (...) {
        delete pipe;
        throw;
    }
    pipe->pmDDE = std::make_unique<DDE>(asOwnAppName);
    // DDE starts the peers it sends to as the sockets do, in the caller's scope.
    pipe->pmDDE->SetStarter(
        [pipe](const std::string& asApp, const std::function<bool()>& fReady, std::string& asWhy) {
            if (pipe->pmScope == nullptr || pipe->pmApplications == nullptr) {
                asWhy = "no send to start it for";
                return false;
            }
            if (pipe->StartAndAwait(asApp, fReady)) return true;
            asWhy = pipe->amLastError;
            return false;
        });
    nxbase::gPipe = pipe;
    return pipe;
}

void Pipe::SetSocketListening(bool abListen) {
    nxbase::gListen = abListen;
}

void Pipe::SetReceiveFunction(ReceiveFunction fFunction) {
    fmReceiveFunction = fFunction;
    if (pmDDE) pmDDE->SetReceiveFunction(fFunction);
}

void Pipe::SetApplications(const PostOfficeApplications* pApplications) {
    pmApplications = pApplications;
    if (pmDDE) pmDDE->SetApplications(pApplications);
}

Pipe* Pipe::Instance() {
    return nxbase::gPipe;
}

void Pipe::DeletePipe() {
    Pipe* pipe = nxbase::gPipe;
    nxbase::gPipe = nullptr;
    if (pipe == nullptr || pipe->pmScope == nullptr) {
        delete pipe;
        return;
    }
    // Deleted by a handler that a send's wait ran (a window closed while a
    // server starts): the name and the channels go now, the object when that
    // send has returned, and its waits end.
    if (pipe->pmDDE) pipe->pmDDE->Retire("the transport was closed");
    pipe->CloseAll(pipe->amForkedFrom.empty());
    pipe->amDoomed = true;
}

Pipe::Pipe(const std::string& asOwnAppName)
    : amOwnName(asOwnAppName),
      amProcessId(std::to_string(::getpid())),
      amThread(std::this_thread::get_id()) {}

// In a forked child: the listener, the name's lock, the channels and the bus
// connection are the parent's. The child's copies of the descriptors are
// closed (the parent keeps its own), nothing is unlinked, nothing is sent,
// and every later send fails with the reason.
void Pipe::LetGoAfterFork() {
    amForkedFrom = amProcessId;
    if (pmDDE) pmDDE->TurnOff("a forked child does not use its parent's bus connection");
    CloseAll(false);
}

// Closes every channel and the listener; `abOwner` also frees the name (the
// socket and its lock file), which only the process that took it may do.
void Pipe::CloseAll(bool abOwner) {
    for (const auto& [id, channel] : std::map<std::uint64_t, ChannelPtr>(amAllChannels)) {
        channel->closed = true;
        boost::system::error_code ignored;
        channel->timer.cancel();
        channel->socket.close(ignored);
    }
    amAllChannels.clear();
    amChannels.clear();
    amStarting.clear();
    amQueuedBytes = 0;
    if (pmListener) {
        boost::system::error_code ignored;
        pmListener->pause.cancel();
        pmListener->acceptor.close(ignored);
        pmListener.reset();
        if (abOwner) toolkit::Sockets().RemoveSocketFile(amSocketPath);
    }
    if (abOwner) {
        toolkit::Sockets().UnlockName(amLockFd, amSocketPath + ".lock");
    } else if (amLockFd >= 0) {
        toolkit::Sockets().Close(amLockFd);  // the parent's descriptor keeps the lock
    }
    amLockFd = -1;
}

Pipe::~Pipe() {
    Application::Get();  // a forked child lets go of the parent's sockets first
    pmDDE.reset();
    CloseAll(amForkedFrom.empty());
}

std::string Pipe::ForkedCopyError() const {
    return "this process was forked from process " + amForkedFrom +
           ", whose post office this is: delete it and create one of the child's own";
}

std::string Pipe::OwnRequestText() const {
    return amOwnName + "_" + amProcessId;
}

bool Pipe::IsListening() const {
    return pmListener && pmListener->acceptor.is_open();
}

void Pipe::Listen() {
    std::string directory = nxbase::MessagingRuntimeDirectory();
    std::string refusal = toolkit::EnsurePrivateDirectory(directory);
    if (!refusal.empty()) {
        amRefusal = "runtime directory refused: " + refusal;
        nxbase::LogAlways("Pipe: " + amRefusal);
        return;
    }
    amSocketPath = directory + "/" + nxbase::PipeName(nxbase::kPipeRequestPrefix + amOwnName);
    if (amSocketPath.size() > toolkit::MaxSocketPathLength()) {
        throw std::runtime_error("Pipe: socket path too long: " + amSocketPath);
    }
    // The lock on <socket>.lock is held for the listener's lifetime: of two
    // processes starting at once only one gets the name, and a socket left by
    // a process that died (nobody holds the lock) is replaced.
    std::string why;
    amLockFd = toolkit::Sockets().LockName(amSocketPath + ".lock", why);
    if (amLockFd < 0) {
        throw std::runtime_error(
            "Pipe: " + amOwnName + " " +
            (why == "running already" ? why + " (" + amSocketPath + ")" : why));
    }
    // Bound, listening and made private under a name of its own first, then
    // renamed into place: a peer that finds the socket can connect at once.
    const std::string bound = directory + "/.bind-" + amProcessId;
    toolkit::Sockets().RemoveSocketFile(bound);
    auto& context = Application::Get().GetContext();
    pmListener = std::make_unique<Listener>(context);
    boost::system::error_code error;
    boost::asio::local::stream_protocol::endpoint endpoint(bound);
    pmListener->acceptor.open(endpoint.protocol(), error);
    if (!error) pmListener->acceptor.bind(endpoint, error);
    if (!error) pmListener->acceptor.listen(nxbase::kListenBacklog, error);
    if (!error) toolkit::Sockets().MakeOwnerOnly(bound);
    if (!error && !toolkit::Sockets().RenameSocketFile(bound, amSocketPath))
        error.assign(errno, boost::system::system_category());
    if (error) {
        toolkit::Sockets().RemoveSocketFile(bound);
        throw std::runtime_error("Pipe: cannot listen on " + amSocketPath + ": " + error.message());
    }
    // Started peers must not inherit the listener (they would keep the name alive).
    toolkit::Sockets().KeepFromChildren(pmListener->acceptor.native_handle());
    Accept();
}

// ---- accepting ----

void Pipe::Accept() {
    auto channel =
        std::make_shared<Channel>(Application::Get().GetContext(), nxbase::NextChannelId());
    pmListener->acceptor.async_accept(
        channel->socket, [this, channel](const boost::system::error_code& error) {
            if (error == boost::asio::error::operation_aborted) return;
            if (error) {
                AcceptFailed(error.message());
                return;
            }
            pmListener->nextPause = nxbase::kFirstAcceptPause;
            // asio accepts without SOCK_CLOEXEC: a program started later
            // must not hold the channel open.
            toolkit::Sockets().KeepFromChildren(channel->socket.native_handle());
            std::string why;
            if (toolkit::Sockets().PeerIsSameUser(channel->socket.native_handle(), why)) {
                AddChannel(channel);
            } else {
                nxbase::Log("Pipe: connection refused: " + why);
                boost::system::error_code ignored;
                channel->socket.close(ignored);
            }
            if (IsListening()) Accept();
        });
}

// Out of descriptors (or another failure that would repeat at once): the
// connection stays queued; try again after a pause that grows to a second.
void Pipe::AcceptFailed(const std::string& asReason) {
    Listener& listener = *pmListener;
    std::string line = "Pipe: accepting a connection failed (" + asReason + "); next try in " +
                       std::to_string(listener.nextPause.count()) + " ms";
    nxbase::LogAlways(line);
    // Out of descriptors the log cannot open its file either: say it on stderr.
    if (listener.nextPause == nxbase::kFirstAcceptPause) std::fprintf(stderr, "%s\n", line.c_str());
    listener.pause.expires_after(listener.nextPause);
    listener.nextPause = std::min(listener.nextPause * 2, nxbase::kLongestAcceptPause);
    listener.pause.async_wait([this](const boost::system::error_code& error) {
        if (!error && IsListening()) Accept();
    });
}

void Pipe::AddChannel(const ChannelPtr& axChannel) {
    boost::system::error_code ignored;
    axChannel->socket.non_blocking(true, ignored);
    axChannel->arrival = toolkit::WatchPeerShutdown(axChannel->socket);
    amAllChannels[axChannel->id] = axChannel;
    if (axChannel->stage == Stage::kAwaitingRequest) {
        // A connection that never says who it is must not hold a descriptor for ever.
        std::weak_ptr<Channel> weak = axChannel;
        axChannel->timer.expires_after(nxbase::kHandshakeLimit);
        axChannel->timer.async_wait([this, weak](const boost::system::error_code& error) {
            ChannelPtr channel = weak.lock();
            if (error || !channel || channel->stage == Stage::kOpen) return;
            Close(channel, "no handshake within 5 s");
        });
    }
    ArmRead(axChannel);
}

// ---- reading ----

// A readiness wait, not a read: every read is made here, when it is handled,
// so that a read outside the loop (ReadArrived) can never overtake bytes the
// reactor took but whose handler has not run yet. After a read that emptied
// the socket the wait is for an arrival, which costs no system call to start.
void Pipe::ArmRead(const ChannelPtr& axChannel) {
    if (axChannel->readWaiting) return;
    axChannel->readWaiting = true;
    auto woken = [this, axChannel](const boost::system::error_code& error, bool abStopped) {
        axChannel->readWaiting = false;
        if (axChannel->closed) return;
        if (error) {
            Close(axChannel, error.message());
            return;
        }
        axChannel->readBlind = axChannel->readBlind || abStopped;
        OnReadable(axChannel);
    };
    if (axChannel->waitedOnce && axChannel->arrival) {
        toolkit::AwaitArrival(axChannel->arrival, axChannel->socket, std::move(woken));
    } else {
        // The first wait also sees bytes that came before it; a short read
        // after it is followed by one more, which finds an end of stream.
        axChannel->waitedOnce = true;
        axChannel->socket.async_wait(nxbase::Socket::wait_read,
                                     [woken, axChannel](const boost::system::error_code& error) {
                                         axChannel->readBlind = true;
                                         woken(error, false);
                                     });
    }
}

// Reads on in a later turn, after the other channels had theirs: the socket
// still holds bytes, so no arrival would end a wait.
void Pipe::ContinueReading(const ChannelPtr& axChannel) {
    if (axChannel->readContinuing) return;
    axChannel->readContinuing = true;
    Application::Get().Post([this, axChannel] {
        axChannel->readContinuing = false;
        // The loop may have taken a readiness event meanwhile, with none of
        // this channel's waits queued.
        axChannel->readBlind = true;
        if (!axChannel->closed) OnReadable(axChannel);
    });
}

void Pipe::OnReadable(const ChannelPtr& axChannel) {
    // Nothing to read when ReadArrived took it first.
    AfterRead(axChannel, ReadOnce(axChannel));
}

// A stream that ended has its last frames delivered and is closed. Else the
// next read is prepared before delivering, so that a handler that waits for
// an answer on this channel can receive it: a wait when the socket is empty
// (none when one is queued), a later turn when it is not.
void Pipe::AfterRead(const ChannelPtr& axChannel, bool abRead) {
    if (axChannel->closed) return;
    if (!axChannel->endWhy.empty()) {
        Deliver(axChannel);
        if (!axChannel->closed) Close(axChannel, axChannel->endWhy);
        return;
    }
    if (axChannel->drained) {
        ArmRead(axChannel);
    } else {
        ContinueReading(axChannel);
    }
    if (abRead) Deliver(axChannel);
}

bool Pipe::ReadArrived(std::uint64_t alChannel) {
    auto at = amAllChannels.find(alChannel);
    if (at == amAllChannels.end() || at->second->closed) return false;
    ChannelPtr channel = at->second;  // a handler may close it or delete this transport
    // The loop's wait stays queued: it finds nothing, or what comes later.
    const bool read = ReadOnce(channel);
    AfterRead(channel, read);
    return read;
}

// Reads what is there (after a full buffer on, a bounded amount per turn)
// and splits it into frames; false when nothing was there or the channel was
// closed. A stream that ended is closed by AfterRead once the frames before
// its end were delivered: they are the peer's last word.
bool Pipe::ReadOnce(const ChannelPtr& axChannel) {
    const int fd = axChannel->socket.native_handle();
    const std::size_t before = axChannel->reader.Buffered();
    bool read = false;
    int failure = 0;  // errno of a failed read, -1 at the end of the stream
    axChannel->drained = false;
    for (int round = 0; round <= nxbase::kReadsPerTurn && !axChannel->drained; ++round) {
        ssize_t n =
            toolkit::Sockets().Receive(fd, axChannel->input.data(), axChannel->input.size());
        if (n > 0) {
            axChannel->reader.Append(axChannel->input.data(), static_cast<std::size_t>(n));
            read = true;
            // A short read of a stream socket leaves it empty, but for an
            // end of the stream that may have come with the bytes.
            axChannel->drained =
                !axChannel->readBlind && static_cast<std::size_t>(n) < axChannel->input.size();
        } else if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            axChannel->drained = true;
            axChannel->readBlind = false;
        } else {
            failure = n < 0 ? errno : -1;
            break;
        }
    }
    std::string body;
    while (read) {
        FrameReader::Result result = axChannel->reader.Next(body);
        if (result == FrameReader::Result::kNeedMore) break;
        if (result == FrameReader::Result::kMalformed) {
            Close(axChannel, "malformed frame (length above the limit)");
            return false;
        }
        axChannel->pending.push_back(std::move(body));
    }
    amPartialBytes = amPartialBytes + axChannel->reader.Buffered() - before;
    if (failure != 0) {
        axChannel->endWhy = failure > 0 ? std::strerror(failure)
                            : axChannel->reader.Buffered() > 0
                                ? "malformed frame (end of file inside a frame)"
                                : "end of file";
    }
    LimitPartialFrames();
    return read && !axChannel->closed;
}

// Many peers each holding most of a large frame would add up without bound.
void Pipe::LimitPartialFrames() {
    while (amPartialBytes > nxbase::kMaxPartialBytes) {
        ChannelPtr largest;
        for (const auto& [id, channel] : amAllChannels) {
            if (!largest || channel->reader.Buffered() > largest->reader.Buffered())
                largest = channel;
        }
        if (!largest) return;
        Close(largest, "partly read frames of all channels above " +
                           std::to_string(nxbase::kMaxPartialBytes >> 20) +
                           " MiB; this one holds " + std::to_string(largest->reader.Buffered()) +
                           " bytes");
    }
}

// Peers that never read would each hold up to their own limit: their sum is
// capped too. The sum is kept as the queues change; the channels are only
// looked at when it is over the cap.
void Pipe::LimitQueuedBytes() {
    while (amQueuedBytes > nxbase::kMaxAllQueuedBytes) {
        ChannelPtr largest;
        for (const auto& [id, channel] : amAllChannels) {
            if (!largest || channel->outgoing.size() > largest->outgoing.size()) largest = channel;
        }
        if (!largest) return;
        Close(largest, "outgoing frames of all channels above " +
                           std::to_string(nxbase::kMaxAllQueuedBytes >> 20) +
                           " MiB; this one's peer does not read " +
                           std::to_string(largest->outgoing.size()) + " bytes");
    }
}

void Pipe::Deliver(const ChannelPtr& axChannel) {
    // Nested deliveries (a handler that runs the loop) take from the same
    // queue, so bodies are handled in the order they came.
    while (!axChannel->closed && !axChannel->pending.empty()) {
        std::string body = std::move(axChannel->pending.front());
        axChannel->pending.pop_front();
        Trace("ZQ Pipe::FileIOCompletionRoutine Start:");
        HandleBody(axChannel, std::move(body));
        Trace("ZQ Pipe::FileIOCompletionRoutine End:   ");
    }
}

void Pipe::HandleHandshake(const ChannelPtr& axChannel, const std::string& asBody) {
    std::string peer;
    if (axChannel->stage == Stage::kAwaitingReply) {
        // Our request was answered: the peer must be the one we called.
        if (!StartsWith(asBody, nxbase::kDirectPipePrefix) ||
            !nxbase::SplitRequest(asBody.substr(std::strlen(nxbase::kDirectPipePrefix)), peer) ||
            peer != axChannel->peer) {
            Close(axChannel, "refused connection reply");
            return;
        }
        axChannel->stage = Stage::kOpen;
        return;
    }
    // A connection request: on a new connection the body is the request
    // text; on an existing one it carries the prefix and re-labels it.
    std::string request = StartsWith(asBody, nxbase::kPipeRequestPrefix)
                              ? asBody.substr(std::strlen(nxbase::kPipeRequestPrefix))
                              : asBody;
    if (!nxbase::SplitRequest(request, peer)) {
        Close(axChannel, "malformed connection request");
        return;
    }
    if (axChannel->stage == Stage::kOpen && axChannel->peer != peer) {
        auto at = amChannels.find(axChannel->peer);
        if (at != amChannels.end() && at->second == axChannel) amChannels.erase(at);
    }
    axChannel->peer = peer;
    axChannel->stage = Stage::kOpen;
    axChannel->timer.cancel();
    auto at = amChannels.find(peer);
    if (at != amChannels.end() && at->second != axChannel) Close(at->second, "replaced");
    amChannels[peer] = axChannel;
    Write(axChannel, nxbase::EncodeFrame(nxbase::kDirectPipePrefix + OwnRequestText()));
}

void Pipe::HandleBody(const ChannelPtr& axChannel, std::string&& asBody) {
    if (axChannel->stage != Stage::kOpen || StartsWith(asBody, nxbase::kPipeRequestPrefix)) {
        HandleHandshake(axChannel, asBody);
        return;
    }
    std::size_t first = 0, second = 0;
    if (!nxbase::FindMessageFields(asBody, first, second)) {
        Close(axChannel, "malformed frame (no sender and command)");
        return;
    }
    std::string sender = asBody.substr(0, first);
    if (sender != axChannel->peer) {
        // Answers go back on the channel, so a false name could only be used
        // to make us call (or answer) somebody else.
        nxbase::LogAlways("Pipe: frame from " + axChannel->peer + " claims to come from " + sender +
                          "; dropped");
        return;
    }
    // The data is decoded in place and copied once into its block. The body
    // of a small frame then becomes the command text; a larger one is freed
    // before the event is handled, so a frame is never held twice.
    char* data = asBody.data() + second + 1;
    std::size_t size = nxbase::DecodeInPlace(data, asBody.size() - second - 1);
    MyMemoryBlock block(static_cast<long>(size));
    block.Put(data, static_cast<long>(size));
    std::string command;
    if (asBody.capacity() <= nxbase::kBodyKeptAsCommand) {
        asBody.resize(second);
        asBody.erase(0, first + 1);
        command.swap(asBody);
    } else {
        command.assign(asBody, first + 1, second - first - 1);
        std::string().swap(asBody);
    }
    if (nxbase::detail::CommunicationLogged()) {
        nxbase::Log("Pipe::PollForData <- " + sender + " " + command);
    }
    VELTRAEvent event(std::move(sender), std::move(command), std::move(block), axChannel->id);
    if (fmReceiveFunction != nullptr) fmReceiveFunction(event);
}

// ---- writing ----

bool Pipe::Write(const ChannelPtr& axChannel, const std::string& asFrame) {
    if (axChannel->closed) return false;
    if (axChannel->outgoing.size() + asFrame.size() > nxbase::kMaxQueuedBytes) {
        Close(axChannel, "peer does not read (outgoing queue full)");
        return false;
    }
    if (!axChannel->outgoing.empty()) {
        axChannel->outgoing += asFrame;
        amQueuedBytes += asFrame.size();
        LimitQueuedBytes();
        return !axChannel->closed;  // goes out behind what waits, when the socket is writable
    }
    // The usual case: the socket takes the whole frame at once, no copy.
    std::size_t done = 0;
    if (!SendWhatFits(axChannel, asFrame, done)) return false;
    if (done == asFrame.size()) return true;
    axChannel->outgoing.assign(asFrame, done, std::string::npos);
    amQueuedBytes += asFrame.size() - done;
    FlushOutgoing(axChannel);
    LimitQueuedBytes();
    return !axChannel->closed;
}

// Writes `asBytes` from `alDone` on in pieces until the socket is full;
// false (the channel closed) when the write failed.
bool Pipe::SendWhatFits(const ChannelPtr& axChannel, const std::string& asBytes,
                        std::size_t& alDone) {
    int fd = axChannel->socket.native_handle();
    while (alDone < asBytes.size()) {
        std::size_t piece = std::min(nxbase::kWriteBlockSize, asBytes.size() - alDone);
        ssize_t n = toolkit::Sockets().Send(fd, asBytes.data() + alDone, piece);
        if (n > 0) {
            alDone += static_cast<std::size_t>(n);
            continue;
        }
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return true;
        Close(axChannel,
              std::string("write failed: ") + (n == 0 ? "nothing written" : std::strerror(errno)));
        return false;
    }
    return true;
}

bool Pipe::WriteMessage(const ChannelPtr& axChannel, const std::string& asCommand,
                        std::string_view asEncodedData) {
    // Frames are built in storage kept from the last one. A send nested in
    // this one (from a handler the write's failure runs) finds it taken and
    // builds in its own; a large frame's storage is not kept.
    std::string nested;
    const bool outer = !amFrameInUse;
    std::string& frame = outer ? amFrame : nested;
    amFrameInUse = true;
    nxbase::BuildMessageFrame(frame, amOwnName, asCommand, asEncodedData);
    bool written = Write(axChannel, frame);
    if (outer) {
        amFrameInUse = false;
        if (frame.capacity() > nxbase::kWriteBlockSize) std::string().swap(frame);
    }
    return written;
}

void Pipe::FlushOutgoing(const ChannelPtr& axChannel) {
    std::string& out = axChannel->outgoing;
    std::size_t done = 0;
    if (!SendWhatFits(axChannel, out, done)) return;
    out.erase(0, done);
    amQueuedBytes -= done;
    if (out.empty() || axChannel->writeArmed) return;
    // The socket is full: go on when the peer has read.
    axChannel->writeArmed = true;
    axChannel->socket.async_wait(nxbase::Socket::wait_write,
                                 [this, axChannel](const boost::system::error_code& error) {
                                     axChannel->writeArmed = false;
                                     if (axChannel->closed) return;
                                     if (error) {
                                         Close(axChannel, error.message());
                                         return;
                                     }
                                     FlushOutgoing(axChannel);
                                 });
}

void Pipe::Close(ChannelPtr axChannel, const std::string& asReason) {
    if (axChannel->closed) return;
    axChannel->closed = true;
    axChannel->closedWhy = asReason;
    nxbase::Log("Pipe: channel " +
                (axChannel->peer.empty() ? std::string("(unknown)") : axChannel->peer) +
                " closed: " + asReason);
    amPartialBytes -= std::min(amPartialBytes, axChannel->reader.Buffered());
    amQueuedBytes -= axChannel->outgoing.size();
    std::string().swap(axChannel->outgoing);  // a handler may still hold the channel
    boost::system::error_code ignored;
    axChannel->timer.cancel();
    axChannel->socket.close(ignored);
    amAllChannels.erase(axChannel->id);
    bool current = false;
    auto at = amChannels.find(axChannel->peer);
    if (at != amChannels.end() && at->second == axChannel) {
        amChannels.erase(at);
        current = axChannel->stage == Stage::kOpen;
    }
    toolkit::ReapStartedProcesses();
    if (current && fmChannelLost) fmChannelLost(axChannel->peer);
}

// ---- opening channels and starting peers ----

Pipe::SendScope::SendScope(Pipe* pPipe, std::function<bool()> fKeepWaiting, bool abMayStart)
    : pmPipe(pPipe),
      pmOuter(pPipe ? pPipe->pmScope : nullptr),
      fmKeepWaiting(std::move(fKeepWaiting)),
      amStart(std::chrono::steady_clock::now()),
      amQuits(Application::Get().GetQuitCount()),
      amMayStart(abMayStart) {
    if (pmPipe != nullptr) pmPipe->pmScope = this;
}

// Read when first needed: most sends never wait for anybody.
std::chrono::steady_clock::time_point Pipe::SendScope::Deadline() const {
    return amStart + nxbase::StartWaitLimit();
}

Pipe::SendScope::~SendScope() {
    if (pmPipe == nullptr) return;
    pmPipe->pmScope = pmOuter;
    if (pmOuter == nullptr && pmPipe->amDoomed) delete pmPipe;
}

bool Pipe::SendScope::Quitting() const {
    return Application::Get().GetQuitCount() != amQuits;
}

bool Pipe::KeepWaiting() const {
    if (amDoomed) return false;
    if (pmScope == nullptr) return true;
    return !pmScope->Quitting() && (!pmScope->fmKeepWaiting || pmScope->fmKeepWaiting());
}

bool Pipe::Fail(const std::string& asReason) {
    amLastError = asReason;
    nxbase::Log("Pipe: " + asReason);
    return false;
}

Pipe::ChannelPtr Pipe::ChannelTo(const std::string& asApp) {
    auto at = amChannels.find(asApp);
    if (at == amChannels.end() || at->second->closed) return nullptr;
    ChannelPtr channel = at->second;
    // Another send may be opening it further up the stack.
    return channel->stage == Stage::kOpen || AwaitHandshake(channel) ? channel : nullptr;
}

// Connects without blocking and writes the request; the reply comes through
// the loop. Null when nobody accepts.
Pipe::ChannelPtr Pipe::Connect(const std::string& asApp) {
    int fd = toolkit::Sockets().Connect(nxbase::RequestSocketPath(asApp));
    if (fd < 0) return nullptr;
    std::string why;
    if (!toolkit::Sockets().PeerIsSameUser(fd, why)) {
        toolkit::Sockets().Close(fd);
        Fail("refused to talk to " + asApp + ": " + why);
        return nullptr;
    }
    auto channel =
        std::make_shared<Channel>(Application::Get().GetContext(), nxbase::NextChannelId());
    boost::system::error_code error;
    channel->socket.assign(boost::asio::local::stream_protocol(), fd, error);
    if (error) {
        toolkit::Sockets().Close(fd);
        return nullptr;
    }
    channel->peer = asApp;
    channel->stage = Stage::kAwaitingReply;
    auto at = amChannels.find(asApp);
    if (at != amChannels.end()) Close(at->second, "replaced");
    amChannels[asApp] = channel;
    AddChannel(channel);
    if (!Write(channel, nxbase::EncodeFrame(OwnRequestText()))) return nullptr;
    return AwaitHandshake(channel) ? channel : nullptr;
}

// Runs the loop until the reply came, asking the caller at least every 50 ms.
bool Pipe::AwaitHandshake(const ChannelPtr& axChannel) {
    auto deadline = std::chrono::steady_clock::now() + nxbase::kHandshakeLimit;
    if (pmScope != nullptr) deadline = std::min(deadline, pmScope->Deadline());
    auto settled = [&] { return axChannel->closed || axChannel->stage == Stage::kOpen; };
    switch (Application::Get().RunUntil(
        settled, [this] { return KeepWaiting(); }, deadline)) {
        case Application::WaitEnd::kReady:
            break;
        case Application::WaitEnd::kTimedOut:
            Close(axChannel, "no reply to the connection request in time");
            break;
        case Application::WaitEnd::kQuit:
        case Application::WaitEnd::kGivenUp:
            Close(axChannel, "the wait for the connection reply was given up");
            break;
    }
    if (axChannel->stage == Stage::kOpen && !axChannel->closed) return true;
    return Fail("no channel to " + axChannel->peer + ": it did not answer the connection request");
}

bool Pipe::OnDdeBus(const std::string& asApp) {
    return pmDDE && pmDDE->IsActive() && pmDDE->IsAppRunning(nxbase::kDdeService, asApp.c_str());
}

// Finds a way to `asApp`: a channel, or its topic on the bus, starting the
// application (once per scope) when it is registered and not running.
bool Pipe::Reach(const std::string& asApp, const std::string& asCommand, ChannelPtr& axChannel,
                 bool& abByDde) {
    if (amRefusal.empty() && (axChannel = Connect(asApp))) return true;
    if (amDoomed) return Fail("the transport was closed");  // by a handler the wait ran
    if ((abByDde = OnDdeBus(asApp))) return true;
    if (!amRefusal.empty() && !(pmDDE && pmDDE->IsActive())) return Fail(amRefusal);
    SendScope& scope = *pmScope;
    if (pmApplications == nullptr || !pmApplications->HasApplication(asApp)) {
        if (nxbase::IsApplicationRunning(asApp))
            return Fail(asApp + " is running but did not answer the connection request");
        return Fail(asApp + " is not running and not registered");
    }
    if (asCommand == nxbase::kDisconnect)
        return Fail(asApp + " is not running (nothing to disconnect)");
    if (!scope.amMayStart && !nxbase::IsApplicationRunning(asApp)) {
        scope.amHopeless = true;
        return Fail(asApp + " is not running, and this send does not start it");
    }
    auto reachable = [&] {
        // A send nested in this wait may have opened the channel already.
        if ((axChannel = ChannelTo(asApp))) return true;
        if (amRefusal.empty() && (axChannel = Connect(asApp))) return true;
        return (abByDde = OnDdeBus(asApp));
    };
    return StartAndAwait(asApp, reachable);
}

// The one start of a peer, for both transports: starts `asApp` (at most once
// per scope) and runs the loop until `fReady()`, within the scope's limit.
// False, with the reason, when it could not be started or never got ready.
bool Pipe::StartAndAwait(const std::string& asApp, const std::function<bool()>& fReady) {
    SendScope& scope = *pmScope;
    if (!scope.amStartFailure.empty()) return Fail(scope.amStartFailure);
    PostOfficeApplication application = pmApplications->GetApplicationInfo(asApp);
    if (!StartForScope(asApp, application)) return false;
    std::string why;
    // Not started because an instance held the name: when that one has ended
    // before becoming ready, start one, once.
    bool startNow = false;
    toolkit::StartWait result = WaitForStart(
        asApp,
        [&] {
            return fReady() ||
                   (startNow = !scope.amStarted && !nxbase::IsApplicationRunning(asApp));
        },
        why);
    if (startNow) {
        if (!StartForScope(asApp, application)) return false;
        result = WaitForStart(asApp, fReady, why);
    }
    if (result == toolkit::StartWait::kReady) return true;
    if (scope.Quitting()) why = "the application quits";
    return Fail("no answer from " + asApp + " (" + application.GetExecutableWithPath() +
                "): " + why);
}

bool Pipe::IsReachable(const std::string& asApp) {
    // The cheap looks first; the bus is asked last. The lock is taken before
    // the socket is bound: a peer holding it whose socket is there listens,
    // or is about to.
    const bool reachable =
        HasChannel(asApp) ||
        (amRefusal.empty() && nxbase::IsApplicationRunning(asApp) &&
         toolkit::KindOf(nxbase::RequestSocketPath(asApp)) == toolkit::FileKind::kSocket) ||
        OnDdeBus(asApp);
    // Reachable, it is no longer being started (as after a wait for its start).
    if (reachable) amStarting.erase(asApp);
    return reachable;
}

bool Pipe::StartForLater(const std::string& asApp, int& alPid) {
    alPid = -1;
    if (!MaySend(asApp, "(start)")) return false;
    if (pmApplications == nullptr || !pmApplications->HasApplication(asApp))
        return Fail(asApp + " is not running and not registered");
    SendScope scope(this, nullptr);
    if (!StartForScope(asApp, pmApplications->GetApplicationInfo(asApp))) return false;
    alPid = scope.amStartedPid;
    if (alPid > 0) amStarting.emplace(asApp, alPid);
    return true;
}

bool Pipe::StartEnded(const std::string& asApp, int alPid, std::string& asHow) {
    if (alPid <= 0 || !toolkit::StartedProcessEnded(alPid, asHow)) return false;
    if (auto at = amStarting.find(asApp); at != amStarting.end() && at->second == alPid)
        amStarting.erase(at);
    return true;
}

// Starts `asApp` once per scope, unless it runs or another send started it
// (further up the stack, or one that gave up waiting): while that process
// lives it is waited for, as a second one would find the name taken. False,
// with the reason, when the start failed.
bool Pipe::StartForScope(const std::string& asApp, const PostOfficeApplication& axApplication) {
    SendScope& scope = *pmScope;
    if (scope.amStarted) return true;
    if (auto starting = amStarting.find(asApp); starting != amStarting.end()) {
        std::string how;
        if (!toolkit::StartedProcessEnded(starting->second, how)) {
            scope.amStarted = true;
            scope.amStartedPid = starting->second;
            return true;
        }
        amStarting.erase(starting);
    }
    if (nxbase::IsApplicationRunning(asApp)) return true;
    scope.amStarted = true;
    nxbase::Log("Pipe: starting " + axApplication.GetExecutableWithPath());
    std::string error;
    scope.amStartedPid = axApplication.Start(error);
    if (scope.amStartedPid > 0) return true;
    // Trying again would not make it executable.
    scope.amHopeless = true;
    scope.amStartFailure = error;
    return Fail(error);
}

// Waits for the process this scope started (if any) to become reachable.
toolkit::StartWait Pipe::WaitForStart(const std::string& asApp, const std::function<bool()>& fReady,
                                      std::string& asWhy) {
    auto keepWaiting = [this] { return KeepWaiting(); };
    const int pid = pmScope->amStartedPid;
    if (pid > 0) amStarting.emplace(asApp, pid);
    toolkit::StartWait result =
        toolkit::WaitForStartedProcess(pid, fReady, keepWaiting, pmScope->Deadline(), asWhy);
    // Reachable or ended, it is no longer being started; given up, it still is.
    if (auto at = amStarting.find(asApp); at != amStarting.end() && at->second == pid &&
                                          result != toolkit::StartWait::kGivenUp &&
                                          result != toolkit::StartWait::kTimedOut)
        amStarting.erase(at);
    return result;
}

bool Pipe::Send(const std::string& asApp, const std::string& asCommand,
                const MyMemoryBlock& axEncodedData) {
    return Send(asApp, asCommand, axEncodedData.Bytes());
}

bool Pipe::SendOnChannel(std::uint64_t alChannel, const std::string& asCommand,
                         const MyMemoryBlock& axEncodedData) {
    return SendOnChannel(alChannel, asCommand, axEncodedData.Bytes());
}

// What every send checks first: not a forked copy, on the loop's thread.
bool Pipe::MaySend(const std::string& asTo, const std::string& asCommand) {
    Application::Get();
    if (!amForkedFrom.empty()) return Fail(ForkedCopyError());
    NX_ASSERT(IsOwnThread());
    if (!IsOwnThread()) return Fail("Send called from another thread than the event loop's");
    if (nxbase::detail::CommunicationLogged())
        nxbase::Log("Pipe::Send -> " + asTo + " " + asCommand);
    return true;
}

// A frame longer than a reader takes would close the channel at the peer
// (and its length might not even fit the header): refused before any start.
bool Pipe::FitsOneFrame(const std::string& asCommand, std::string_view asEncodedData) {
    const std::size_t length = amOwnName.size() + asCommand.size() + 2 + asEncodedData.size();
    return length <= nxbase::kMaxFrameLength ||
           Fail("a message of " + std::to_string(length) + " bytes is above the frame limit of " +
                std::to_string(nxbase::kMaxFrameLength >> 20) + " MiB");
}

bool Pipe::Send(const std::string& asApp, const std::string& asCommand,
                std::string_view asEncodedData) {
    if (!MaySend(asApp, asCommand)) return false;
    std::optional<SendScope> own;
    if (pmScope == nullptr) own.emplace(this, nullptr);
    if (!FitsOneFrame(asCommand, asEncodedData)) {
        pmScope->amHopeless = true;  // no retry makes the message shorter
        return false;
    }
    // A process reached by DDE only also sends by DDE.
    if (!nxbase::gListen && pmDDE && pmDDE->IsActive()) {
        amLastSendChannel = 0;
        return SendByDde(asApp, asCommand, true, asEncodedData) ||
               Fail("DDE send to " + asApp + " failed");
    }
    ChannelPtr channel = ChannelTo(asApp);
    bool byDde = false;
    if (!channel && !Reach(asApp, asCommand, channel, byDde)) return false;
    amLastSendChannel = 0;
    if (byDde)
        return SendByDde(asApp, asCommand, true, asEncodedData) ||
               Fail("DDE send to " + asApp + " failed");
    amLastSendChannel = channel->id;
    return WriteMessage(channel, asCommand, asEncodedData) ||
           Fail("writing to " + asApp + " failed: " + channel->closedWhy);
}

bool Pipe::SendOnChannel(std::uint64_t alChannel, const std::string& asCommand,
                         std::string_view asEncodedData) {
    auto at = amAllChannels.find(alChannel);
    const bool open =
        at != amAllChannels.end() && !at->second->closed && at->second->stage == Stage::kOpen;
    if (!MaySend(open ? at->second->peer : "(closed channel)", asCommand)) return false;
    if (!open) return Fail("the channel the command came in on is closed");
    if (!FitsOneFrame(asCommand, asEncodedData)) return false;
    ChannelPtr channel = at->second;
    return WriteMessage(channel, asCommand, asEncodedData) ||
           Fail("writing to " + channel->peer + " failed: " + channel->closedWhy);
}

bool Pipe::SendByDde(const std::string& asApp, const std::string& asCommand, bool abMayStart,
                     std::string_view asEncodedData) {
    if (!pmDDE || !pmDDE->IsActive()) return false;
    return pmDDE->Send(asApp, asCommand, std::string(asEncodedData), abMayStart);
}

bool Pipe::AnswerByDde(const std::string& asApp, const std::string& asCommand,
                       const MyMemoryBlock& axEncodedData) {
    return AnswerByDde(asApp, asCommand, axEncodedData.Bytes());
}

bool Pipe::AnswerByDde(const std::string& asApp, const std::string& asCommand,
                       std::string_view asEncodedData) {
    if (!MaySend(asApp, asCommand)) return false;
    amLastSendChannel = 0;
    if (!pmDDE || !pmDDE->IsActive())
        return Fail("DDE is off; the answer to " + asApp + " is lost");
    return SendByDde(asApp, asCommand, false, asEncodedData) ||
           Fail("DDE send to " + asApp + " failed");
}

std::uint64_t Pipe::ChannelId(const std::string& asApp) const {
    auto at = amChannels.find(asApp);
    return at == amChannels.end() || at->second->closed ? 0 : at->second->id;
}

bool Pipe::IsChannelOpen(std::uint64_t alChannel) const {
    auto at = amAllChannels.find(alChannel);
    return at != amAllChannels.end() && !at->second->closed;
}

bool Pipe::HasChannel(const std::string& asApp) const {
    auto at = amChannels.find(asApp);
    return at != amChannels.end() && !at->second->closed && at->second->stage == Stage::kOpen;
}

void Pipe::Trace(const char* asWhat) {
    if (!nxbase::detail::CommLogTraced()) return;
    auto ticks = std::chrono::steady_clock::now().time_since_epoch().count();
    std::ofstream trace(nxbase::CommLogPath(), std::ios::app);
    trace << asWhat << ticks << "\n";
}
