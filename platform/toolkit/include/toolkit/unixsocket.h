// The operating-system calls of the messaging transport on Unix stream
// sockets: connect, peer check, read, write and the name lock that a
// listener holds. They sit behind one replaceable object so that tests can
// inject failures (a refused connect, a full socket, a failing write).
#ifndef TOOLKIT_UNIXSOCKET_H_
#define TOOLKIT_UNIXSOCKET_H_

#include <sys/types.h>

#include <cstddef>
#include <string>

#include "nxbase/export.h"

namespace toolkit {

class NXBASE_EXPORT SocketCalls {
  public:
    virtual ~SocketCalls() = default;
    // Starts a non-blocking connection to the socket at `path`: the
    // descriptor (close-on-exec), or -1 with errno set (ENOENT or
    // ECONNREFUSED: nobody listens; EAGAIN: its queue of connections is full;
    // ENAMETOOLONG: the path does not fit a socket address).
    virtual int Connect(const std::string& path);
    // True when the peer's user id is ours; else `why` says whose it is.
    virtual bool PeerIsSameUser(int fd, std::string& why);
    // One write of at most `size` bytes that never blocks, retried on EINTR
    // and never raising SIGPIPE: the count written, or -1 with errno set
    // (EAGAIN when the socket is full).
    virtual ssize_t Send(int fd, const char* data, std::size_t size);
    // One read that never blocks, retried on EINTR: the count (0 at end of
    // file), or -1 with errno set.
    virtual ssize_t Receive(int fd, char* data, std::size_t size);
    // Takes the exclusive lock of a name (the file `lockPath`, created 0600):
    // the held descriptor, or -1 with `why` set ("running already" when
    // another process holds it).
    virtual int LockName(const std::string& lockPath, std::string& why);
    // Whether some process holds the lock of `lockPath`.
    virtual bool IsNameLocked(const std::string& lockPath);
    // Removes the socket file at `path` (a listener's, or one left behind).
    virtual void RemoveSocketFile(const std::string& path);
    // Lets only this user connect to the socket file at `path` (mode 0600).
    virtual void MakeOwnerOnly(const std::string& path);
    // Renames the socket file `from` to `to` (replacing what is there): false,
    // errno set, when it failed.
    virtual bool RenameSocketFile(const std::string& from, const std::string& to);
    // Keeps `fd` from programs this process starts (close-on-exec).
    virtual void KeepFromChildren(int fd);
    // Closes a descriptor these calls gave.
    virtual void Close(int fd);
    // Removes the lock file and releases the lock taken by LockName.
    virtual void UnlockName(int fd, const std::string& lockPath);
};

// The longest path a socket address holds.
NXBASE_EXPORT std::size_t MaxSocketPathLength();

// The calls in use: the system's unless a test replaced them.
NXBASE_EXPORT SocketCalls& Sockets();
// Replaces the calls (null: the system's again); returns the previous ones.
NXBASE_EXPORT SocketCalls* SetSocketCalls(SocketCalls* calls);

}  // namespace toolkit

#endif  // TOOLKIT_UNIXSOCKET_H_
