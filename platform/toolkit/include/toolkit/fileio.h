// The library's file layer: an open file that closes itself, a capped
// whole-file read, a whole write, an append that is one write(), and what a
// path names. Writing never leaves anything half done: every byte of a write
// or an error; a whole file replaced, or the old one kept. Every call goes on
// after signals. Any thread may call these.
#ifndef TOOLKIT_FILEIO_H_
#define TOOLKIT_FILEIO_H_

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "nxbase/export.h"

namespace toolkit {

// One open file descriptor (close-on-exec), closed with the object.
class NXBASE_EXPORT File {
  public:
    enum class Mode {
        kRead,
        // Created with mode 0666 under the umask, or truncated in place (its
        // owner, permissions and links stay); a symbolic link is followed.
        kTruncate,
        // Appends; created with mode 0644; the last component of the path is
        // never followed as a symbolic link.
        kAppend,
        // kAppend, emptied first.
        kAppendTruncated,
    };
    File() = default;
    // Opens `path`; IsOpen() is false, errno set, when it cannot be opened.
    File(const std::string& path, Mode mode);
    ~File() { Close(); }
    File(File&& other) noexcept : fd_(other.fd_) { other.fd_ = -1; }
    File& operator=(File&& other) noexcept;
    File(const File&) = delete;
    File& operator=(const File&) = delete;

    bool IsOpen() const { return fd_ >= 0; }
    int Descriptor() const { return fd_; }
    // One read(): the count (0 at the end), or -1 with errno set.
    ssize_t Read(char* data, std::size_t size) const;
    // Every byte, going on after short writes (see WriteAll below).
    bool WriteAll(std::string_view bytes) const;
    // One write() that must take every byte: false, errno set (ENOSPC for a
    // short write), otherwise. Appends stay whole lines across processes.
    bool WriteOnce(std::string_view bytes) const;
    bool Sync() const;
    bool Truncate(std::uint64_t size) const;
    // What the open file is: a regular file, its size, and whether it still
    // has a name (a removed file keeps its data only while it is open).
    bool IsRegular() const;
    std::uint64_t Size() const;
    bool StillNamed() const;
    // Closes now; false when close() reported an error.
    bool Close();

  private:
    int fd_ = -1;
};

// How ReadUpTo ended.
enum class ReadEnd { kEnd, kLimit, kError };
// Appends at most `limit` more bytes of descriptor `fd` to `bytes`: kEnd at
// the end of the input, kLimit when `limit` bytes came first, kError with
// errno set.
NXBASE_EXPORT ReadEnd ReadUpTo(int fd, std::size_t limit, std::string& bytes);

// Reads the whole file at `path` into `bytes`, at most `limit` bytes, and
// (with `regularOnly`) only a regular file. False with `bytes` empty and
// `why` set ("cannot open: No such file or directory", "not a regular file",
// "larger than 1024 bytes", "cannot read: ...") otherwise.
NXBASE_EXPORT bool ReadWholeFile(const std::string& path, std::size_t limit, std::string& bytes,
                                 std::string& why, bool regularOnly = true);

// Appends `bytes` to the file at `path` in one write() (File::kAppend, or
// kAppendTruncated with `truncate`): lines stay whole across threads and
// processes. False, errno set, when it cannot be opened or the write is short.
NXBASE_EXPORT bool AppendInOneWrite(const std::string& path, std::string_view bytes,
                                    bool truncate = false);

// What `path` names, symbolic links followed.
enum class FileKind { kNone, kRegular, kDirectory, kSocket, kOther };
NXBASE_EXPORT FileKind KindOf(const std::string& path);
// A regular file this process may read.
NXBASE_EXPORT bool IsReadableFile(const std::string& path);

// Writes all of `fd`, going on after signals and short writes;
// false with errno set (EIO for a write that took nothing) on failure.
NXBASE_EXPORT bool WriteAll(int fd, std::string_view bytes);

// Makes `content` the whole of the file at `path`, so that readers see the
// old file or the complete new one, never a part:
// - a regular file (or a missing one) is replaced through a temporary file
//   in its directory, synced and renamed over it; an existing file keeps its
//   permissions and its owner. The file is rewritten in place instead, which
//   is not atomic, when it has more than one hard link (so that every name
//   sees the new content), when its owner cannot be given to the
//   replacement, or when the directory cannot take the temporary file but
//   the file itself is writable.
// - a symbolic link is followed to its final target, which is replaced as
//   above; the link stays a link.
// - anything else (a FIFO, a terminal, /dev/null, /dev/full) is opened and
//   written directly, never replaced by a plain file.
// Every step is checked. On failure returns false with `why` saying what
// failed and why ("cannot open: Permission denied"), and leaves no temporary
// file behind; only a process killed while writing leaves its ".<name>.XXXXXX".
// A new file gets the mode open() gives under the process's umask.
NXBASE_EXPORT bool ReplaceFile(const std::string& path, std::string_view content, std::string& why);

}  // namespace toolkit

#endif  // TOOLKIT_FILEIO_H_
