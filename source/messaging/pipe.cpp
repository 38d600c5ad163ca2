#include "nxbase/pipe.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/file.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <boost/asio/local/stream_protocol.hpp>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fstream>
#include <stdexcept>
#include <vector>

#include "nxbase/dde.h"
#include "nxbase/logfile.h"
#include "messaging_log.h"
#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"
#include "nxbase/poapps.h"
#include "toolkit/application.h"
#include "toolkit/system.h"

extern char** environ;

namespace nxbase {

namespace detail {

// One connection to a peer, in both directions.
struct Channel {
    explicit Channel(boost::asio::io_context& context) : socket(context) {}
    boost::asio::local::stream_protocol::socket socket;
    std::string peer;             // the peer's application name, once known
    bool identified = false;      // the request or the reply has been seen
    bool closed = false;
    FrameReader reader;
    std::deque<std::string> pending;  // bodies read, not yet delivered
    std::string outgoing;             // bytes not yet taken by the socket
    bool writeArmed = false;
};

}  // namespace detail

namespace {

using Socket = boost::asio::local::stream_protocol::socket;
constexpr const char* kLogKey = "Communication";
constexpr int kReplyTimeoutMs = 5000;
constexpr auto kStartWait = std::chrono::seconds(10);
constexpr std::size_t kReadChunk = 64 * 1024;

Pipe* gPipe = nullptr;
bool gListen = true;

void Log(const std::string& asText) {
    LogFile::WriteToLog(String(asText), String(kLogKey));
}

// The peer's user id is ours: checked before a byte is read or written.
bool PeerIsSameUser(int fd, std::string& asWhy) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        asWhy = std::string("no peer credentials: ") + std::strerror(errno);
        return false;
    }
    if (credentials.uid != ::geteuid()) {
        asWhy = "peer of user id " + std::to_string(credentials.uid) + " (process " +
                std::to_string(credentials.pid) + ")";
        return false;
    }
    return true;
}

bool FillSocketAddress(const std::string& asPath, sockaddr_un& axAddress) {
    std::memset(&axAddress, 0, sizeof axAddress);
    axAddress.sun_family = AF_UNIX;
    if (asPath.size() >= sizeof axAddress.sun_path) return false;
    std::memcpy(axAddress.sun_path, asPath.c_str(), asPath.size() + 1);
    return true;
}

// A blocking connect to a listening socket; -1 when nobody accepts there.
int ConnectTo(const std::string& asPath) {
    sockaddr_un address{};
    if (!FillSocketAddress(asPath, address)) return -1;
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return -1;
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        ::close(fd);
        return -1;
    }
    return fd;
}

// Writes all bytes of a blocking descriptor in pieces; false on failure.
bool WriteBlocking(int fd, const std::string& asBytes) {
    std::size_t done = 0;
    while (done < asBytes.size()) {
        std::size_t piece = std::min(kWriteBlockSize, asBytes.size() - done);
        ssize_t n = ::send(fd, asBytes.data() + done, piece, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        done += static_cast<std::size_t>(n);
    }
    return true;
}

// Writes `bytes` from `done` on, in pieces, without blocking, until the
// socket is full; false (errno set) when the connection failed.
bool SendPieces(int fd, const std::string& bytes, std::size_t& done) {
    while (done < bytes.size()) {
        std::size_t piece = std::min(kWriteBlockSize, bytes.size() - done);
        ssize_t n = ::send(fd, bytes.data() + done, piece, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0) {
            done += static_cast<std::size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return true;
        if (n == 0) errno = EPIPE;
        return false;
    }
    return true;
}

// Reads one frame from a blocking descriptor within the time-out.
bool ReadFrameBlocking(int fd, std::string& asBody) {
    FrameReader reader;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kReplyTimeoutMs);
    char buffer[512];
    while (true) {
        FrameReader::Result result = reader.Next(asBody);
        if (result == FrameReader::Result::kFrame) return true;
        if (result == FrameReader::Result::kMalformed) return false;
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) return false;
        pollfd waiting{fd, POLLIN, 0};
        int ready = ::poll(&waiting, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) return false;
        ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        reader.Append(buffer, static_cast<std::size_t>(n));
    }
}

// The name part of a request text "<name>_<pid>".
std::string NameOfRequest(const std::string& asRequest) {
    std::size_t underscore = asRequest.rfind('_');
    return underscore == std::string::npos ? asRequest : asRequest.substr(0, underscore);
}

std::string CommLogPath() {
    std::string log = LogFile::Instance()->GetFileName();
    std::size_t slash = log.rfind('/');
    return (slash == std::string::npos ? std::string(".") : log.substr(0, slash)) + "/CommLog.log";
}

// Children started by this process; collected so that they leave no zombies.
std::vector<pid_t>& StartedChildren() {
    static std::vector<pid_t> children;
    return children;
}

void ReapStartedChildren() {
    auto& children = StartedChildren();
    for (auto at = children.begin(); at != children.end();) {
        int status = 0;
        at = ::waitpid(*at, &status, WNOHANG) == 0 ? at + 1 : children.erase(at);
    }
}

}  // namespace

// ---- frames ----

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

std::string EncodeFrame(const std::string& asBody) {
    std::uint32_t length = static_cast<std::uint32_t>(asBody.size());
    std::string frame;
    frame.reserve(4 + asBody.size());
    for (int i = 0; i < 4; ++i) frame += static_cast<char>((length >> (8 * i)) & 0xFF);
    frame += asBody;
    return frame;
}

std::string MessageBody(const std::string& asSender, const std::string& asCommand,
                        const std::string& asEncodedData) {
    std::string body;
    body.reserve(asSender.size() + asCommand.size() + asEncodedData.size() + 2);
    body += asSender;
    body += '\0';
    body += asCommand;
    body += '\0';
    body += asEncodedData;
    return body;
}

bool SplitMessageBody(const std::string& asBody, std::string& asSender, std::string& asCommand,
                      std::string& asData) {
    std::size_t first = asBody.find('\0');
    if (first == std::string::npos) return false;
    std::size_t second = asBody.find('\0', first + 1);
    if (second == std::string::npos) return false;
    asSender = asBody.substr(0, first);
    asCommand = asBody.substr(first + 1, second - first - 1);
    asData = asBody.substr(second + 1);
    return true;
}

void FrameReader::Append(const char* pData, std::size_t alSize) {
    if (amStart > 0 && amStart == amBuffer.size()) {
        amBuffer.clear();
        amStart = 0;
    }
    amBuffer.append(pData, alSize);
}

FrameReader::Result FrameReader::Next(std::string& asBody) {
    while (!amMalformed) {
        if (Buffered() < 4) return Result::kNeedMore;
        const unsigned char* head = reinterpret_cast<const unsigned char*>(amBuffer.data() + amStart);
        std::uint32_t length = head[0] | (head[1] << 8) | (head[2] << 16) |
                               (static_cast<std::uint32_t>(head[3]) << 24);
        if (length > kMaxFrameLength) {
            amMalformed = true;
            break;
        }
        if (Buffered() < 4 + static_cast<std::size_t>(length)) return Result::kNeedMore;
        asBody.assign(amBuffer, amStart + 4, length);
        amStart += 4 + length;
        // Keep the buffer from growing without bound behind the read position.
        if (amStart > (1u << 20) && amStart * 2 > amBuffer.size()) {
            amBuffer.erase(0, amStart);
            amStart = 0;
        }
        if (length == 0) continue;  // consumed, never delivered
        return Result::kFrame;
    }
    return Result::kMalformed;
}

// ---- peers' processes ----

bool IsApplicationRunning(const std::string& asExecutable) {
    DIR* proc = ::opendir("/proc");
    if (proc == nullptr) return false;
    bool found = false;
    char target[4096];
    while (dirent* entry = ::readdir(proc)) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        std::string link = std::string("/proc/") + entry->d_name + "/exe";
        ssize_t n = ::readlink(link.c_str(), target, sizeof target - 1);
        if (n <= 0) continue;
        std::string path(target, static_cast<std::size_t>(n));
        const std::string deleted = " (deleted)";
        if (path.size() > deleted.size() &&
            path.compare(path.size() - deleted.size(), deleted.size(), deleted) == 0) {
            path.erase(path.size() - deleted.size());
        }
        if (path.substr(path.rfind('/') + 1) == asExecutable) {
            found = true;
            break;
        }
    }
    ::closedir(proc);
    return found;
}

int StartApplication(const PostOfficeApplication& axApplication, int alCountryCode) {
    std::string program = axApplication.GetExecutableWithPath();
    std::vector<std::string> arguments{program};
    if (axApplication.GetExecutable() == "KXALWIN") arguments.push_back("/WM");
    arguments.push_back("-S");
    arguments.push_back("-LNG");
    arguments.push_back(std::to_string(alCountryCode));
    std::vector<char*> argv;
    for (std::string& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addchdir_np(&actions, axApplication.GetPath().c_str());
    pid_t pid = -1;
    int result = ::posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (result != 0) {
        errno = result;
        return -1;
    }
    StartedChildren().push_back(pid);
    return pid;
}

}  // namespace nxbase

using nxbase::FrameReader;
using nxbase::detail::Channel;

struct Pipe::Listener {
    explicit Listener(boost::asio::io_context& context) : acceptor(context) {}
    boost::asio::local::stream_protocol::acceptor acceptor;
};

Pipe* Pipe::CreatePipe(const std::string& asOwnAppName) {
    DeletePipe();
    auto* pipe = new Pipe(asOwnAppName);
    try {
        if (nxbase::gListen) pipe->Listen();
    } catch (...) {
        delete pipe;
        throw;
    }
    pipe->pmDDE = std::make_unique<DDE>(asOwnAppName);
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

void Pipe::SetCountryCode(int alCode) {
    amCountryCode = alCode;
    if (pmDDE) pmDDE->SetCountryCode(alCode);
}

Pipe* Pipe::Instance() {
    return nxbase::gPipe;
}

void Pipe::DeletePipe() {
    delete nxbase::gPipe;
    nxbase::gPipe = nullptr;
}

Pipe::Pipe(const std::string& asOwnAppName)
    : amOwnName(asOwnAppName), amProcessId(std::to_string(::getpid())) {}

Pipe::~Pipe() {
    pmDDE.reset();
    for (const ChannelPtr& channel : std::set<ChannelPtr>(amAllChannels)) {
        channel->closed = true;
        boost::system::error_code ignored;
        channel->socket.close(ignored);
    }
    amAllChannels.clear();
    amChannels.clear();
    if (pmListener) {
        boost::system::error_code ignored;
        pmListener->acceptor.close(ignored);
        if (!amSocketPath.empty()) ::unlink(amSocketPath.c_str());
    }
    if (amLockFd >= 0) ::close(amLockFd);  // the name is free again
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
        nxbase::Log("Pipe: runtime directory refused: " + refusal);
        return;
    }
    amSocketPath = directory + "/" + nxbase::PipeName(nxbase::kPipeRequestPrefix + amOwnName);
    sockaddr_un address{};
    if (!nxbase::FillSocketAddress(amSocketPath, address)) {
        throw std::runtime_error("Pipe: socket path too long: " + amSocketPath);
    }
    // The listener holds a lock on <socket>.lock for its lifetime: of two
    // processes starting at once only one gets the name, and a socket left by
    // a process that died (nobody holds the lock) is replaced.
    std::string lockPath = amSocketPath + ".lock";
    amLockFd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (amLockFd < 0) {
        throw std::runtime_error("Pipe: cannot open " + lockPath + ": " + std::strerror(errno));
    }
    if (::flock(amLockFd, LOCK_EX | LOCK_NB) != 0) {
        ::close(amLockFd);
        amLockFd = -1;
        throw std::runtime_error("Pipe: " + amOwnName + " is running already (" + amSocketPath +
                                 ")");
    }
    ::unlink(amSocketPath.c_str());
    auto& context = Application::Get().GetContext();
    pmListener = std::make_unique<Listener>(context);
    boost::system::error_code error;
    boost::asio::local::stream_protocol::endpoint endpoint(amSocketPath);
    pmListener->acceptor.open(endpoint.protocol(), error);
    if (!error) pmListener->acceptor.bind(endpoint, error);
    if (!error) pmListener->acceptor.listen(64, error);
    if (error) {
        throw std::runtime_error("Pipe: cannot listen on " + amSocketPath + ": " + error.message());
    }
    ::chmod(amSocketPath.c_str(), 0600);
    // Started peers must not inherit the listener (they would keep the name alive).
    ::fcntl(pmListener->acceptor.native_handle(), F_SETFD, FD_CLOEXEC);
    Accept();
}

void Pipe::Accept() {
    auto channel = std::make_shared<Channel>(Application::Get().GetContext());
    pmListener->acceptor.async_accept(channel->socket, [this, channel](
                                                           const boost::system::error_code& error) {
        if (error == boost::asio::error::operation_aborted) return;
        if (!error) {
            std::string why;
            if (nxbase::PeerIsSameUser(channel->socket.native_handle(), why)) {
                AddChannel(channel);
            } else {
                nxbase::Log("Pipe: connection refused: " + why);
                boost::system::error_code ignored;
                channel->socket.close(ignored);
            }
        }
        if (pmListener && pmListener->acceptor.is_open()) Accept();
    });
}

void Pipe::AddChannel(const ChannelPtr& axChannel) {
    boost::system::error_code ignored;
    axChannel->socket.non_blocking(true, ignored);
    ::fcntl(axChannel->socket.native_handle(), F_SETFD, FD_CLOEXEC);
    amAllChannels.insert(axChannel);
    if (axChannel->identified) {
        auto at = amChannels.find(axChannel->peer);
        if (at != amChannels.end() && at->second != axChannel) Close(at->second, "replaced");
        amChannels[axChannel->peer] = axChannel;
    }
    ArmRead(axChannel);
}

void Pipe::ArmRead(const ChannelPtr& axChannel) {
    axChannel->socket.async_wait(nxbase::Socket::wait_read,
                                 [this, axChannel](const boost::system::error_code& error) {
                                     if (axChannel->closed) return;
                                     if (error) {
                                         Close(axChannel, error.message());
                                         return;
                                     }
                                     OnReadable(axChannel);
                                 });
}

void Pipe::OnReadable(const ChannelPtr& axChannel) {
    char buffer[nxbase::kReadChunk];
    int fd = axChannel->socket.native_handle();
    // Take what is there now; the next readiness brings the rest.
    for (int round = 0; round < 16; ++round) {
        ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
        if (n > 0) {
            axChannel->reader.Append(buffer, static_cast<std::size_t>(n));
            if (static_cast<std::size_t>(n) < sizeof buffer) break;
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
        Close(axChannel, n == 0 ? "end of file" : std::strerror(errno));
        return;
    }
    std::string body;
    while (true) {
        FrameReader::Result result = axChannel->reader.Next(body);
        if (result == FrameReader::Result::kNeedMore) break;
        if (result == FrameReader::Result::kMalformed) {
            Close(axChannel, "malformed frame (length above the limit)");
            return;
        }
        axChannel->pending.push_back(std::move(body));
    }
    // Read on before delivering: a handler that waits for an answer on this
    // channel must be able to receive it.
    ArmRead(axChannel);
    Deliver(axChannel);
}

void Pipe::Deliver(const ChannelPtr& axChannel) {
    // Nested deliveries (a handler that runs the loop) take from the same
    // queue, so bodies are handled in the order they came.
    while (!axChannel->closed && !axChannel->pending.empty()) {
        std::string body = std::move(axChannel->pending.front());
        axChannel->pending.pop_front();
        Trace("ZQ Pipe::FileIOCompletionRoutine Start:");
        HandleBody(axChannel, body);
        Trace("ZQ Pipe::FileIOCompletionRoutine End:   ");
    }
}

void Pipe::HandleBody(const ChannelPtr& axChannel, const std::string& asBody) {
    const std::string prefix = nxbase::kPipeRequestPrefix;
    if (!axChannel->identified || asBody.compare(0, prefix.size(), prefix) == 0) {
        // A connection request: on a new connection the body is the request
        // text; on an existing one it carries the prefix and re-labels it.
        std::string request =
            asBody.compare(0, prefix.size(), prefix) == 0 ? asBody.substr(prefix.size()) : asBody;
        if (request.empty() || request.find('\0') != std::string::npos) {
            Close(axChannel, "malformed connection request");
            return;
        }
        std::string peer = nxbase::NameOfRequest(request);
        if (axChannel->identified && axChannel->peer != peer) {
            auto at = amChannels.find(axChannel->peer);
            if (at != amChannels.end() && at->second == axChannel) amChannels.erase(at);
        }
        axChannel->peer = peer;
        axChannel->identified = true;
        auto at = amChannels.find(peer);
        if (at != amChannels.end() && at->second != axChannel) Close(at->second, "replaced");
        amChannels[peer] = axChannel;
        Write(axChannel, nxbase::EncodeFrame(nxbase::kDirectPipePrefix + OwnRequestText()));
        return;
    }
    std::string sender, command, data;
    if (!nxbase::SplitMessageBody(asBody, sender, command, data)) {
        Close(axChannel, "malformed frame (no sender and command)");
        return;
    }
    MyMemoryBlock block(static_cast<long>(data.size()));
    std::string decoded = nxbase::DecodeBytes(data.data(), data.size());
    block.Put(decoded.data(), static_cast<long>(decoded.size()));
    if (nxbase::detail::CommunicationLogged()) {
        nxbase::Log("Pipe::PollForData <- " + sender + " " + command);
    }
    VELTRAEvent event(sender, command, block);
    if (fmReceiveFunction != nullptr) fmReceiveFunction(event);
}

bool Pipe::Write(const ChannelPtr& axChannel, const std::string& asFrame) {
    if (axChannel->closed) return false;
    if (axChannel->outgoing.size() + asFrame.size() > nxbase::kMaxQueuedBytes) {
        Close(axChannel, "peer does not read (outgoing queue full)");
        return false;
    }
    if (axChannel->outgoing.empty()) {
        // The usual case: the socket takes the whole frame at once, no copy.
        std::size_t done = 0;
        if (!nxbase::SendPieces(axChannel->socket.native_handle(), asFrame, done)) {
            Close(axChannel, std::string("write failed: ") + std::strerror(errno));
            return false;
        }
        if (done == asFrame.size()) return true;
        axChannel->outgoing.assign(asFrame, done, std::string::npos);
    } else {
        axChannel->outgoing += asFrame;
    }
    FlushOutgoing(axChannel);
    return !axChannel->closed;
}

void Pipe::FlushOutgoing(const ChannelPtr& axChannel) {
    std::string& out = axChannel->outgoing;
    std::size_t done = 0;
    if (!nxbase::SendPieces(axChannel->socket.native_handle(), out, done)) {
        out.erase(0, done);
        Close(axChannel, std::string("write failed: ") + std::strerror(errno));
        return;
    }
    out.erase(0, done);
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

void Pipe::Close(const ChannelPtr& axChannel, const std::string& asReason) {
    if (axChannel->closed) return;
    axChannel->closed = true;
    nxbase::Log("Pipe: channel " + (axChannel->peer.empty() ? std::string("(unknown)")
                                                            : axChannel->peer) +
                " closed: " + asReason);
    boost::system::error_code ignored;
    axChannel->socket.close(ignored);
    amAllChannels.erase(axChannel);
    bool current = false;
    auto at = amChannels.find(axChannel->peer);
    if (at != amChannels.end() && at->second == axChannel) {
        amChannels.erase(at);
        current = true;
    }
    nxbase::ReapStartedChildren();
    if (current && fmChannelLost) fmChannelLost(axChannel->peer);
}

Pipe::ChannelPtr Pipe::OpenChannel(const std::string& asApp) {
    if (amSocketPath.empty()) return nullptr;  // no usable runtime directory
    std::string directory = amSocketPath.substr(0, amSocketPath.rfind('/'));
    std::string path = directory + "/" + nxbase::PipeName(nxbase::kPipeRequestPrefix + asApp);
    int fd = nxbase::ConnectTo(path);
    if (fd < 0) return nullptr;
    std::string why, reply;
    bool ok = nxbase::PeerIsSameUser(fd, why);
    if (!ok) nxbase::Log("Pipe: refused to talk to " + asApp + ": " + why);
    ok = ok && nxbase::WriteBlocking(fd, nxbase::EncodeFrame(OwnRequestText())) &&
         nxbase::ReadFrameBlocking(fd, reply) &&
         reply.compare(0, std::strlen(nxbase::kDirectPipePrefix), nxbase::kDirectPipePrefix) == 0;
    if (!ok) {
        ::close(fd);
        return nullptr;
    }
    auto channel = std::make_shared<Channel>(Application::Get().GetContext());
    boost::system::error_code error;
    channel->socket.assign(boost::asio::local::stream_protocol(), fd, error);
    if (error) {
        ::close(fd);
        return nullptr;
    }
    channel->peer = asApp;
    channel->identified = true;
    AddChannel(channel);
    return channel;
}

Pipe::ChannelPtr Pipe::OpenOrStart(const std::string& asApp) {
    if (ChannelPtr channel = OpenChannel(asApp)) return channel;
    if (pmApplications == nullptr || !pmApplications->HasApplication(asApp)) return nullptr;
    PostOfficeApplication application = pmApplications->GetApplicationInfo(asApp);
    if (!nxbase::IsApplicationRunning(application.GetExecutable())) {
        nxbase::Log("Pipe: starting " + application.GetExecutableWithPath());
        if (nxbase::StartApplication(application, amCountryCode) < 0) {
            nxbase::Log("Pipe: cannot start " + application.GetExecutableWithPath() + ": " +
                        std::strerror(errno));
            return nullptr;
        }
    }
    // Wait for its request socket with a growing pause, the loop turning.
    auto deadline = std::chrono::steady_clock::now() + nxbase::kStartWait;
    std::chrono::milliseconds pause(2);
    while (std::chrono::steady_clock::now() < deadline) {
        auto until = std::chrono::steady_clock::now() + pause;
        while (std::chrono::steady_clock::now() < until) {
            Application::Get().RunOneFor(std::chrono::duration_cast<std::chrono::milliseconds>(
                until - std::chrono::steady_clock::now()));
        }
        if (ChannelPtr channel = OpenChannel(asApp)) return channel;
        if (fmStartWaitCheck && !fmStartWaitCheck()) return nullptr;
        // A peer reached by DDE only shows up on the bus instead.
        if (pmDDE && pmDDE->IsActive() && pmDDE->IsAppRunning(nxbase::kDdeService, asApp.c_str())) {
            return nullptr;
        }
        pause = std::min(pause * 2, std::chrono::milliseconds(200));
    }
    nxbase::Log("Pipe: " + asApp + " did not open its socket in time");
    return nullptr;
}

bool Pipe::Send(const std::string& asApp, const std::string& asCommand,
                const MyMemoryBlock& axEncodedData) {
    if (nxbase::detail::CommunicationLogged()) nxbase::Log("Pipe::Send -> " + asApp + " " + asCommand);
    // A process reached by DDE only also sends by DDE.
    if (!nxbase::gListen && pmDDE && pmDDE->IsActive()) {
        return SendByDde(asApp, asCommand, axEncodedData);
    }
    ChannelPtr channel;
    auto at = amChannels.find(asApp);
    if (at != amChannels.end() && !at->second->closed) {
        channel = at->second;
    } else if (!(channel = OpenChannel(asApp)) && pmDDE && pmDDE->IsActive() &&
               pmDDE->IsAppRunning(nxbase::kDdeService, asApp.c_str())) {
        // No request socket, but the application owns its topic on the bus.
        return SendByDde(asApp, asCommand, axEncodedData);
    } else if (!channel) {
        channel = OpenOrStart(asApp);
    }
    if (!channel) return SendByDde(asApp, asCommand, axEncodedData);
    // The frame built in one piece: length, sender, 0, command, 0, data.
    std::size_t dataSize = static_cast<std::size_t>(axEncodedData.Len());
    std::uint32_t length =
        static_cast<std::uint32_t>(amOwnName.size() + asCommand.size() + 2 + dataSize);
    std::string frame;
    frame.reserve(4 + length);
    for (int i = 0; i < 4; ++i) frame += static_cast<char>((length >> (8 * i)) & 0xFF);
    frame += amOwnName;
    frame += '\0';
    frame += asCommand;
    frame += '\0';
    frame.append(axEncodedData.GetDatenZeiger(), dataSize);
    return Write(channel, frame);
}

bool Pipe::SendByDde(const std::string& asApp, const std::string& asCommand,
                     const MyMemoryBlock& axEncodedData) {
    if (!pmDDE || !pmDDE->IsActive()) return false;
    return pmDDE->Send(asApp, asCommand,
                       std::string(axEncodedData.GetDatenZeiger(),
                                   static_cast<std::size_t>(axEncodedData.Len())));
}

bool Pipe::HasChannel(const std::string& asApp) const {
    auto at = amChannels.find(asApp);
    return at != amChannels.end() && !at->second->closed;
}

void Pipe::Trace(const char* asWhat) {
    if (!nxbase::detail::CommLogTraced()) return;
    auto ticks = std::chrono::steady_clock::now().time_since_epoch().count();
    std::ofstream trace(nxbase::CommLogPath(), std::ios::app);
    trace << asWhat << ticks << "\n";
}
