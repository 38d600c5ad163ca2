// Pipe carries post-office messages between the processes of one user over
// Unix stream sockets, on the application's event loop.
//
// Every process listens on the socket <runtime dir>/<pipe name of
// "PipeRequest-" + own name> and holds the lock <socket>.lock while it does.
// A sender opens a channel by connecting there, writing the framed request
// "<own name>_<pid>" and reading the framed reply "DirectPipe-<name>_<pid>";
// from then on the connection carries frames both ways (see nxbase/frame.h)
// and belongs to the peer named in the handshake: a frame on it that claims
// another sender is dropped. Connecting, the handshake, reading and writing
// are driven by the loop; nothing here blocks in a system call. Both ends
// refuse a peer of another user id before reading a byte. Everything here
// runs on the thread that runs the event loop.
#ifndef NXBASE_PIPE_H_
#define NXBASE_PIPE_H_

#include <boost/system/error_code.hpp>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/frame.h"
#include "nxbase/poapps.h"
#include "nxbase/veltraevent.h"
#include "toolkit/process.h"

class DDE;
class MyMemoryBlock;
class PostOfficeApplications;

namespace nxbase {

// Writes go out in pieces of at most this many bytes.
constexpr std::size_t kWriteBlockSize = 4096;
// A channel whose peer lets this much pile up unread is closed.
constexpr std::size_t kMaxQueuedBytes = 64u << 20;
// Outgoing bytes of all channels together; beyond it the channel with the
// most waiting is closed.
constexpr std::size_t kMaxAllQueuedBytes = 128u << 20;
// Partly read frames of all channels together; beyond it the channel with
// the largest one is closed.
constexpr std::size_t kMaxPartialBytes = 256u << 20;
// A connection must finish its handshake within this time.
constexpr std::chrono::seconds kHandshakeLimit(5);

// $NXBASE_RUNTIME_DIR, else $XDG_RUNTIME_DIR/k-lume, else /tmp/k-lume-<uid>.
NXBASE_EXPORT std::string MessagingRuntimeDirectory();
// `asBase`, or `asBase` + "_" + $USERNAME when that variable is set.
NXBASE_EXPORT std::string PipeName(const std::string& asBase);
// The request socket of application `asApp` in this user's runtime directory.
NXBASE_EXPORT std::string RequestSocketPath(const std::string& asApp);
// Whether application `asApp` runs for this user: a listener holds the lock
// of its request socket. Processes of other sessions or users never count.
NXBASE_EXPORT bool IsApplicationRunning(const std::string& asApp);

namespace detail {
struct Channel;
}

}  // namespace nxbase

class NXBASE_EXPORT Pipe {
  public:
    // Creates the process's transport and listens on its request socket.
    // Throws std::runtime_error when another live process listens there or
    // the name does not fit a socket path. A refused runtime directory does
    // not throw: GetRefusal() says why, and every Send fails with it.
    static Pipe* CreatePipe(const std::string& asOwnAppName);
    static Pipe* Instance();
    // Closes every channel and the listener. Called while a send of this
    // transport waits (from a handler its wait ran), the name and the
    // channels go at once and the object when that send returns.
    static void DeletePipe();

    // The receive function of both transports, the sockets' and DDE's.
    void SetReceiveFunction(ReceiveFunction fFunction);
    ReceiveFunction GetReceiveFunction() const { return fmReceiveFunction; }
    // Called on the loop with the peer's name when a channel to it is lost.
    void SetChannelLostFunction(std::function<void(const std::string&)> fFunction) {
        fmChannelLost = std::move(fFunction);
    }
    // The applications that may be started when they do not run (kept by the
    // caller, usually the post office); null: none.
    void SetApplications(const PostOfficeApplications* pApplications);
    // Whether pipes created from now on listen on their request socket
    // (default yes); a process that is to be reached by DDE only says no.
    static void SetSocketListening(bool abListen);

    // One send of the caller, retries included: at most one start of the
    // peer, at most StartWaitLimit() of waiting for it, and `fKeepWaiting`
    // (if set) asked at least every 50 ms while connecting, handshaking or
    // waiting; Application::Quit() ends every wait of the scope. Sends
    // outside a scope are each a scope of their own.
    class NXBASE_EXPORT SendScope {
      public:
        // With `abMayStart` false a peer that does not run is not started:
        // the send fails at once.
        SendScope(Pipe* pPipe, std::function<bool()> fKeepWaiting, bool abMayStart = true);
        ~SendScope();
        SendScope(const SendScope&) = delete;
        SendScope& operator=(const SendScope&) = delete;
        // Whether trying again is of no use: the start failed, the peer
        // does not run and must not be started, the message is above the
        // frame limit, or the application quits.
        bool Hopeless() const { return amHopeless || Quitting(); }
        // Whether Application::Quit() was called since the scope began.
        bool Quitting() const;

      private:
        friend class Pipe;
        std::chrono::steady_clock::time_point Deadline() const;
        Pipe* pmPipe;
        SendScope* pmOuter;
        std::function<bool()> fmKeepWaiting;
        std::chrono::steady_clock::time_point amStart;
        unsigned long amQuits;
        bool amMayStart = true;
        bool amStarted = false;
        bool amHopeless = false;
        int amStartedPid = -1;
        std::string amStartFailure;
    };

    // Frames and writes one message to `asApp`, opening the channel first and
    // starting the application when it is registered but not running (never
    // for DISCONNECT). False on failure; GetLastError() then says why (a
    // message whose frame would pass nxbase::kMaxFrameLength is refused).
    bool Send(const std::string& asApp, const std::string& asCommand,
              const MyMemoryBlock& axEncodedData);
    bool Send(const std::string& asApp, const std::string& asCommand,
              std::string_view asEncodedData);
    // The same on the connection a received event came in on
    // (VELTRAEvent::GetChannel()); false when it is closed.
    bool SendOnChannel(std::uint64_t alChannel, const std::string& asCommand,
                       const MyMemoryBlock& axEncodedData);
    bool SendOnChannel(std::uint64_t alChannel, const std::string& asCommand,
                       std::string_view asEncodedData);
    // The answer to a command that came by DDE (channel 0), back by DDE: the
    // requester waits for it on that transport. Never starts `asApp`.
    bool AnswerByDde(const std::string& asApp, const std::string& asCommand,
                     const MyMemoryBlock& axEncodedData);
    bool AnswerByDde(const std::string& asApp, const std::string& asCommand,
                     std::string_view asEncodedData);
    // For a send that waits on a timer instead of running a loop of its own
    // (an asynchronous send): IsReachable says, without waiting or starting
    // anything, whether a send to `asApp` would find it (an open channel, a
    // listener, its topic on the bus); a start of it still pending is then
    // over. StartForLater starts it as Send would
    // (once, and never while another send's start of it lives) without the
    // wait: true with the process id to watch (-1 when an instance that is
    // coming up is waited for), false with GetLastError(). StartEnded says
    // whether that process ended before `asApp` became reachable, and how.
    bool IsReachable(const std::string& asApp);
    bool StartForLater(const std::string& asApp, int& alPid);
    bool StartEnded(const std::string& asApp, int alPid, std::string& asHow);

    // Why the last failed send failed.
    const std::string& GetLastError() const { return amLastError; }
    // Why this process cannot use sockets (a refused runtime directory);
    // empty when it can.
    const std::string& GetRefusal() const { return amRefusal; }

    bool HasChannel(const std::string& asApp) const;
    // The connection the last successful Send went out on (its
    // VELTRAEvent::GetChannel() id); 0 when it went by DDE.
    std::uint64_t GetLastSendChannel() const { return amLastSendChannel; }
    // Takes what has already arrived on connection `alChannel`, without
    // waiting, and delivers its frames as the loop would (an ended connection
    // is closed); false when nothing was there. A caller about to wait for an
    // answer tries this first: a peer on the same CPU has often answered by
    // the time its send returns, and the loop would spend a readiness wait
    // and a re-arming to find it. The receive function may delete the
    // transport meanwhile.
    bool ReadArrived(std::uint64_t alChannel);
    // The id of the open channel to `asApp`, 0 when there is none.
    std::uint64_t ChannelId(const std::string& asApp) const;
    // Whether connection `alChannel` (VELTRAEvent::GetChannel()) is open.
    bool IsChannelOpen(std::uint64_t alChannel) const;
    std::size_t ChannelCount() const { return amAllChannels.size(); }
    // Bytes of partly read frames over all channels.
    std::size_t PartialBytes() const { return amPartialBytes; }
    // Bytes written but not yet taken by the sockets, over all channels.
    std::size_t QueuedBytes() const { return amQueuedBytes; }
    const std::string& GetOwnName() const { return amOwnName; }
    const std::string& GetSocketPath() const { return amSocketPath; }
    bool IsListening() const;
    // Whether the caller runs on the thread that created the transport.
    bool IsOwnThread() const { return std::this_thread::get_id() == amThread; }

    ~Pipe();
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;

  private:
    explicit Pipe(const std::string& asOwnAppName);
    using ChannelPtr = std::shared_ptr<nxbase::detail::Channel>;

    void Listen();
    void Accept();
    void AcceptFailed(const std::string& asReason);
    ChannelPtr ChannelTo(const std::string& asApp);
    ChannelPtr Connect(const std::string& asApp);
    bool AwaitHandshake(const ChannelPtr& axChannel);
    bool Reach(const std::string& asApp, const std::string& asCommand, ChannelPtr& axChannel,
               bool& abByDde);
    bool StartForScope(const std::string& asApp, const PostOfficeApplication& axApplication);
    bool StartAndAwait(const std::string& asApp, const std::function<bool()>& fReady);
    toolkit::StartWait WaitForStart(const std::string& asApp, const std::function<bool()>& fReady,
                                    std::string& asWhy);
    bool Fail(const std::string& asReason);
    bool KeepWaiting() const;
    void AddChannel(const ChannelPtr& axChannel);
    void ArmRead(const ChannelPtr& axChannel);
    void OnReadable(const ChannelPtr& axChannel);
    void ContinueReading(const ChannelPtr& axChannel);
    void AfterRead(const ChannelPtr& axChannel, bool abRead);
    bool ReadOnce(const ChannelPtr& axChannel);
    void LimitPartialFrames();
    void LimitQueuedBytes();
    void Deliver(const ChannelPtr& axChannel);
    void HandleBody(const ChannelPtr& axChannel, std::string&& asBody);
    void HandleHandshake(const ChannelPtr& axChannel, const std::string& asBody);
    bool Write(const ChannelPtr& axChannel, const std::string& asFrame);
    bool WriteMessage(const ChannelPtr& axChannel, const std::string& asCommand,
                      std::string_view asEncodedData);
    void FlushOutgoing(const ChannelPtr& axChannel);
    bool SendWhatFits(const ChannelPtr& axChannel, const std::string& asBytes, std::size_t& alDone);
    // By value: a caller may pass a map entry that the close erases.
    void Close(ChannelPtr axChannel, const std::string& asReason);
    void Trace(const char* asWhat);
    bool MaySend(const std::string& asTo, const std::string& asCommand);
    bool FitsOneFrame(const std::string& asCommand, std::string_view asEncodedData);
    bool SendByDde(const std::string& asApp, const std::string& asCommand, bool abMayStart,
                   std::string_view asEncodedData);
    bool OnDdeBus(const std::string& asApp);
    std::string OwnRequestText() const;
    void LetGoAfterFork();
    void CloseAll(bool abOwner);
    std::string ForkedCopyError() const;

    std::string amOwnName;
    std::string amProcessId;
    std::string amSocketPath;
    std::string amRefusal;
    std::string amLastError;
    std::string amForkedFrom;  // the parent's process id, in a forked child
    bool amDoomed = false;     // deleted while a send waited: goes when it returns
    std::string amFrame;       // the last frame written, its storage reused
    bool amFrameInUse = false;
    std::thread::id amThread;
    int amLockFd = -1;  // held while this process owns its name
    ReceiveFunction fmReceiveFunction = nullptr;
    std::function<void(const std::string&)> fmChannelLost;
    const PostOfficeApplications* pmApplications = nullptr;
    SendScope* pmScope = nullptr;
    struct Listener;
    std::unique_ptr<Listener> pmListener;
    std::map<std::string, ChannelPtr> amChannels;       // by peer name
    std::map<std::string, int> amStarting;              // peers being started, their pids
    std::map<std::uint64_t, ChannelPtr> amAllChannels;  // every open connection, by id
    std::uint64_t amLastSendChannel = 0;
    std::size_t amPartialBytes = 0;
    std::size_t amQueuedBytes = 0;  // the sum of every channel's outgoing bytes
    std::unique_ptr<DDE> pmDDE;     // the older transport, for peers on the bus
};

#endif  // NXBASE_PIPE_H_
