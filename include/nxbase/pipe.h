// Pipe carries post-office messages between the processes of one user over
// Unix stream sockets, on the application's event loop.
//
// Every process listens on the socket <runtime dir>/<pipe name of
// "PipeRequest-" + own name>. A sender opens a channel by connecting there,
// writing the framed request "<own name>_<pid>" and reading the framed reply
// "DirectPipe-<name>_<pid>"; from then on the connection carries frames both
// ways. A frame is a 4-byte little-endian length and a body: sender, 0x00,
// command, 0x00, and the data block byte-stuffed (so without zero bytes).
// Reception is driven by the sockets' readiness: no reader thread, no
// polling. Both ends refuse a peer of another user id before reading a byte.
// Everything here runs on the thread that runs the event loop.
#ifndef NXBASE_PIPE_H_
#define NXBASE_PIPE_H_

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "nxbase/export.h"
#include "nxbase/veltraevent.h"

class DDE;
class MyMemoryBlock;
class PostOfficeApplication;
class PostOfficeApplications;

namespace nxbase {

// Frames longer than this are malformed.
constexpr std::uint32_t kMaxFrameLength = 64u << 20;
// Writes go out in pieces of at most this many bytes.
constexpr std::size_t kWriteBlockSize = 4096;
// A channel whose peer lets this much pile up unread is closed.
constexpr std::size_t kMaxQueuedBytes = 64u << 20;

inline constexpr const char* kPipeRequestPrefix = "PipeRequest-";
inline constexpr const char* kDirectPipePrefix = "DirectPipe-";

// $NXBASE_RUNTIME_DIR, else $XDG_RUNTIME_DIR/k-lume, else /tmp/k-lume-<uid>.
NXBASE_EXPORT std::string MessagingRuntimeDirectory();
// `asBase`, or `asBase` + "_" + $USERNAME when that variable is set.
NXBASE_EXPORT std::string PipeName(const std::string& asBase);
// The 4-byte little-endian length of `asBody`, then the body.
NXBASE_EXPORT std::string EncodeFrame(const std::string& asBody);
// The body of a message frame; `asEncodedData` is already byte-stuffed.
NXBASE_EXPORT std::string MessageBody(const std::string& asSender, const std::string& asCommand,
                                      const std::string& asEncodedData);
// Splits a message body at its first two zero bytes; false when it lacks them.
NXBASE_EXPORT bool SplitMessageBody(const std::string& asBody, std::string& asSender,
                                    std::string& asCommand, std::string& asData);

// Collects bytes as they arrive and hands out whole frame bodies.
class NXBASE_EXPORT FrameReader {
  public:
    enum class Result { kFrame, kNeedMore, kMalformed };
    void Append(const char* pData, std::size_t alSize);
    // The next body (frames of length 0 are skipped); kMalformed for a length
    // above kMaxFrameLength, after which the reader stays malformed.
    Result Next(std::string& asBody);
    std::size_t Buffered() const { return amBuffer.size() - amStart; }

  private:
    std::string amBuffer;
    std::size_t amStart = 0;
    bool amMalformed = false;
};

// Whether a process runs whose executable (/proc/<pid>/exe) has the file
// name `asExecutable`.
NXBASE_EXPORT bool IsApplicationRunning(const std::string& asExecutable);
// Starts the application in its directory with the start line: the
// executable, "/WM" for "KXALWIN", then "-S", "-LNG" and the country code.
// The process id, or -1 with errno set.
NXBASE_EXPORT int StartApplication(const PostOfficeApplication& axApplication, int alCountryCode);

namespace detail {
struct Channel;
}

}  // namespace nxbase

class NXBASE_EXPORT Pipe {
  public:
    // Creates the process's transport and listens on its request socket.
    // Throws std::runtime_error when another live process listens there or
    // the name does not fit a socket path; a refused runtime directory is
    // logged and leaves the transport unable to listen or send.
    static Pipe* CreatePipe(const std::string& asOwnAppName);
    static Pipe* Instance();
    // Closes every channel and the listener.
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
    // The country code given to started applications.
    void SetCountryCode(int alCode);
    // Asked while Send waits for a started application to open its socket;
    // false gives the wait up (empty: wait the full time).
    void SetStartWaitCheck(std::function<bool()> fKeepWaiting) { fmStartWaitCheck = std::move(fKeepWaiting); }
    // Whether pipes created from now on listen on their request socket
    // (default yes); a process that is to be reached by DDE only says no.
    static void SetSocketListening(bool abListen);

    // Frames and writes one message to `asApp`, opening the channel first and
    // starting the application when it is registered but not running.
    bool Send(const std::string& asApp, const std::string& asCommand,
              const MyMemoryBlock& axEncodedData);
    bool HasChannel(const std::string& asApp) const;
    std::size_t ChannelCount() const { return amAllChannels.size(); }
    const std::string& GetOwnName() const { return amOwnName; }
    const std::string& GetSocketPath() const { return amSocketPath; }
    bool IsListening() const;

    ~Pipe();
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;

  private:
    explicit Pipe(const std::string& asOwnAppName);
    using ChannelPtr = std::shared_ptr<nxbase::detail::Channel>;

    void Listen();
    void Accept();
    ChannelPtr OpenChannel(const std::string& asApp);
    ChannelPtr OpenOrStart(const std::string& asApp);
    std::function<bool()> fmStartWaitCheck;
    void AddChannel(const ChannelPtr& axChannel);
    void ArmRead(const ChannelPtr& axChannel);
    void OnReadable(const ChannelPtr& axChannel);
    void Deliver(const ChannelPtr& axChannel);
    void HandleBody(const ChannelPtr& axChannel, const std::string& asBody);
    bool Write(const ChannelPtr& axChannel, const std::string& asFrame);
    void FlushOutgoing(const ChannelPtr& axChannel);
    void Close(const ChannelPtr& axChannel, const std::string& asReason);
    void Trace(const char* asWhat);
    bool SendByDde(const std::string& asApp, const std::string& asCommand,
                   const MyMemoryBlock& axEncodedData);
    std::string OwnRequestText() const;

    std::string amOwnName;
    std::string amProcessId;
    std::string amSocketPath;
    int amLockFd = -1;  // held while this process owns its name
    ReceiveFunction fmReceiveFunction = nullptr;
    std::function<void(const std::string&)> fmChannelLost;
    const PostOfficeApplications* pmApplications = nullptr;
    int amCountryCode = 1;
    struct Listener;
    std::unique_ptr<Listener> pmListener;
    std::map<std::string, ChannelPtr> amChannels;  // by peer name
    std::set<ChannelPtr> amAllChannels;            // every open connection
    std::unique_ptr<DDE> pmDDE;                    // the older transport, for peers on the bus
};

#endif  // NXBASE_PIPE_H_
