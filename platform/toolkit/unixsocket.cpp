#include "toolkit/unixsocket.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "toolkit/eintr.h"

namespace toolkit {

namespace {

SocketCalls gSystemCalls;
SocketCalls* gCalls = &gSystemCalls;

// Tries to take the lock this often when the file is replaced under us.
constexpr int kLockAttempts = 8;

}  // namespace

int SocketCalls::Connect(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        errno = ENAMETOOLONG;
        return -1;
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) return -1;
    const int result = RetryOnEintr(
        [&] { return ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address); });
    if (result != 0) {
        int error = errno;
        ::close(fd);
        errno = error;
        return -1;
    }
    return fd;
}

bool SocketCalls::PeerIsSameUser(int fd, std::string& why) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        why = std::string("no peer credentials: ") + std::strerror(errno);
        return false;
    }
    if (credentials.uid != ::geteuid()) {
        why = "peer of user id " + std::to_string(credentials.uid) + " (process " +
              std::to_string(credentials.pid) + ")";
        return false;
    }
    return true;
}

ssize_t SocketCalls::Send(int fd, const char* data, std::size_t size) {
    const ssize_t n =
        RetryOnEintr([&] { return ::send(fd, data, size, MSG_DONTWAIT | MSG_NOSIGNAL); });
    return n;
}

ssize_t SocketCalls::Receive(int fd, char* data, std::size_t size) {
    const ssize_t n = RetryOnEintr([&] { return ::recv(fd, data, size, MSG_DONTWAIT); });
    return n;
}

int SocketCalls::LockName(const std::string& lockPath, std::string& why) {
    for (int attempt = 0; attempt < kLockAttempts; ++attempt) {
        int fd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
        if (fd < 0) {
            why = "cannot open " + lockPath + ": " + std::strerror(errno);
            return -1;
        }
        if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
            why = errno == EWOULDBLOCK ? std::string("running already")
                                       : "cannot lock " + lockPath + ": " + std::strerror(errno);
            ::close(fd);
            return -1;
        }
        // The owner before us removes the file when it stops: a lock on a
        // file that is no longer there holds nothing, so take the new one.
        struct stat held {
        }, named{};
        if (::fstat(fd, &held) == 0 && ::stat(lockPath.c_str(), &named) == 0 &&
            held.st_ino == named.st_ino && held.st_dev == named.st_dev) {
            return fd;
        }
        ::close(fd);
    }
    why = "cannot lock " + lockPath + ": it keeps being replaced";
    return -1;
}

bool SocketCalls::IsNameLocked(const std::string& lockPath) {
    int fd = ::open(lockPath.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return false;
    bool held = ::flock(fd, LOCK_SH | LOCK_NB) != 0 && errno == EWOULDBLOCK;
    ::close(fd);
    return held;
}

void SocketCalls::RemoveSocketFile(const std::string& path) {
    ::unlink(path.c_str());
}

void SocketCalls::MakeOwnerOnly(const std::string& path) {
    ::chmod(path.c_str(), 0600);
}

bool SocketCalls::RenameSocketFile(const std::string& from, const std::string& to) {
    return ::rename(from.c_str(), to.c_str()) == 0;
}

void SocketCalls::KeepFromChildren(int fd) {
    ::fcntl(fd, F_SETFD, FD_CLOEXEC);
}

void SocketCalls::Close(int fd) {
    ::close(fd);
}

std::size_t MaxSocketPathLength() {
    return sizeof(sockaddr_un::sun_path) - 1;
}

void SocketCalls::UnlockName(int fd, const std::string& lockPath) {
    if (fd < 0) return;
    ::unlink(lockPath.c_str());  // while still held, so nobody takes a doomed file
    ::close(fd);
}

SocketCalls& Sockets() {
    return *gCalls;
}

SocketCalls* SetSocketCalls(SocketCalls* calls) {
    SocketCalls* previous = gCalls;
    gCalls = calls ? calls : &gSystemCalls;
    return previous == &gSystemCalls ? nullptr : previous;
}

}  // namespace toolkit
