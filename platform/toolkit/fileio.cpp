#include "toolkit/fileio.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "toolkit/eintr.h"
#include "toolkit/string.h"

namespace toolkit {

bool WriteAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t n = RetryOnEintr([&] { return ::write(fd, bytes.data(), bytes.size()); });
        if (n <= 0) {
            if (n == 0) errno = EIO;
            return false;
        }
        bytes.remove_prefix(static_cast<std::size_t>(n));
    }
    return true;
}

namespace {

int FlagsOf(File::Mode mode) {
    switch (mode) {
        case File::Mode::kRead:
            return O_RDONLY;
        case File::Mode::kTruncate:
            return O_WRONLY | O_CREAT | O_TRUNC | O_NOCTTY;
        case File::Mode::kAppend:
            return O_WRONLY | O_CREAT | O_APPEND | O_NOFOLLOW;
        case File::Mode::kAppendTruncated:
            return O_WRONLY | O_CREAT | O_APPEND | O_NOFOLLOW | O_TRUNC;
    }
    return O_RDONLY;
}

}  // namespace

File::File(const std::string& path, Mode mode) {
    const mode_t permissions = mode == Mode::kTruncate ? 0666 : 0644;
    fd_ =
        RetryOnEintr([&] { return ::open(path.c_str(), FlagsOf(mode) | O_CLOEXEC, permissions); });
}

File& File::operator=(File&& other) noexcept {
    if (this != &other) {
        Close();
        fd_ = other.fd_;
        other.fd_ = -1;
    }
    return *this;
}

ssize_t File::Read(char* data, std::size_t size) const {
    return RetryOnEintr([&] { return ::read(fd_, data, size); });
}

bool File::WriteAll(std::string_view bytes) const {
    return fd_ >= 0 && toolkit::WriteAll(fd_, bytes);
}

bool File::WriteOnce(std::string_view bytes) const {
    const ssize_t n = RetryOnEintr([&] { return ::write(fd_, bytes.data(), bytes.size()); });
    if (n == static_cast<ssize_t>(bytes.size())) return true;
    if (n >= 0) errno = ENOSPC;  // finishing it later would interleave with other writers
    return false;
}

bool File::Sync() const {
    return RetryOnEintr([&] { return ::fsync(fd_); }) == 0;
}

bool File::Truncate(std::uint64_t size) const {
    return RetryOnEintr([&] { return ::ftruncate(fd_, static_cast<off_t>(size)); }) == 0;
}

bool File::IsRegular() const {
    struct stat info {};
    return fd_ >= 0 && ::fstat(fd_, &info) == 0 && S_ISREG(info.st_mode);
}

std::uint64_t File::Size() const {
    struct stat info {};
    return fd_ >= 0 && ::fstat(fd_, &info) == 0 ? static_cast<std::uint64_t>(info.st_size) : 0;
}

bool File::StillNamed() const {
    struct stat info {};
    return fd_ >= 0 && ::fstat(fd_, &info) == 0 && info.st_nlink > 0;
}

bool File::Close() {
    if (fd_ < 0) return true;
    const bool ok = ::close(fd_) == 0;  // never retried: the descriptor is gone either way
    fd_ = -1;
    return ok;
}

ReadEnd ReadUpTo(int fd, std::size_t limit, std::string& bytes) {
    char buffer[1 << 16];
    while (limit > 0) {
        const ssize_t n =
            RetryOnEintr([&] { return ::read(fd, buffer, std::min(sizeof buffer, limit)); });
        if (n < 0) return ReadEnd::kError;
        if (n == 0) return ReadEnd::kEnd;
        bytes.append(buffer, static_cast<std::size_t>(n));
        limit -= static_cast<std::size_t>(n);
    }
    return ReadEnd::kLimit;
}

bool ReadWholeFile(const std::string& path, std::size_t limit, std::string& bytes, std::string& why,
                   bool regularOnly) {
    bytes.clear();
    File file(path, File::Mode::kRead);
    if (!file.IsOpen()) {
        why = std::string("cannot open: ") + std::strerror(errno);
        return false;
    }
    if (regularOnly && !file.IsRegular()) {
        why = "not a regular file";
        return false;
    }
    // The size is a hint: the file may grow or shrink while it is read.
    bytes.reserve(static_cast<std::size_t>(std::min<std::uint64_t>(file.Size(), limit)));
    std::string beyond;
    const ReadEnd end = ReadUpTo(file.Descriptor(), limit, bytes);
    if (end == ReadEnd::kLimit && ReadUpTo(file.Descriptor(), 1, beyond) == ReadEnd::kLimit) {
        why = "larger than " + std::to_string(limit) + " bytes";
    } else if (end == ReadEnd::kError) {
        why = std::string("cannot read: ") + std::strerror(errno);
    } else {
        return true;
    }
    bytes.clear();
    return false;
}

bool AppendInOneWrite(const std::string& path, std::string_view bytes, bool truncate) {
    File file(path, truncate ? File::Mode::kAppendTruncated : File::Mode::kAppend);
    if (!file.IsOpen()) return false;
    const bool written = file.WriteOnce(bytes);
    const int error = errno;
    file.Close();
    errno = error;
    return written;
}

FileKind KindOf(const std::string& path) {
    struct stat info {};
    if (::stat(path.c_str(), &info) != 0) return FileKind::kNone;
    if (S_ISREG(info.st_mode)) return FileKind::kRegular;
    if (S_ISDIR(info.st_mode)) return FileKind::kDirectory;
    if (S_ISSOCK(info.st_mode)) return FileKind::kSocket;
    return FileKind::kOther;
}

bool IsReadableFile(const std::string& path) {
    return KindOf(path) == FileKind::kRegular && ::access(path.c_str(), R_OK) == 0;
}

namespace {

// A failed step: "what: reason".
bool Failed(std::string& why, const char* what, int error) {
    why = std::string(what) + ": " + std::strerror(error);
    return false;
}

// The file a path names after following every symbolic link; the path
// itself when it is no link. A dangling link gives its (missing) target.
bool FinalTarget(const std::string& path, std::string& target, std::string& why) {
    target = path;
    for (int hops = 0; hops < 40; ++hops) {
        struct stat info {};
        if (::lstat(target.c_str(), &info) != 0 || !S_ISLNK(info.st_mode)) return true;
        std::vector<char> buffer(PATH_MAX + 1);
        const ssize_t n = ::readlink(target.c_str(), buffer.data(), PATH_MAX);
        if (n < 0) return Failed(why, "cannot read the link", errno);
        std::string next(buffer.data(), static_cast<std::size_t>(n));
        if (next.empty() || next[0] != '/') {
            const std::size_t slash = target.rfind('/');
            next =
                (slash == std::string::npos ? std::string() : target.substr(0, slash + 1)) + next;
        }
        target = next;
    }
    return Failed(why, "too many symbolic links", ELOOP);
}

bool WriteDirectly(const std::string& path, std::string_view content, bool truncate,
                   std::string& why) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC | O_NOCTTY | (truncate ? O_TRUNC : 0));
    if (fd < 0) return Failed(why, "cannot open", errno);
    bool written = WriteAll(fd, content);
    int error = errno;
    if (::close(fd) != 0 && written) {
        written = false;
        error = errno;
    }
    return written || Failed(why, "write failed", error);
}

// The mode open() would give a new file. The process's umask is read from
// /proc: setting and restoring it would race with files other threads create
// meanwhile.
mode_t DefaultMode() {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        long long mask = 0;
        if (line.rfind("Umask:\t", 0) == 0 && toolkit::ParseWholeInteger(line.substr(7), mask, 8))
            return static_cast<mode_t>(0666 & ~mask);
    }
    const mode_t mask = ::umask(0);  // kernels before 4.7 do not list it
    ::umask(mask);
    return static_cast<mode_t>(0666 & ~mask);
}

}  // namespace

bool ReplaceFile(const std::string& path, std::string_view content, std::string& why) {
    std::string target;
    if (!FinalTarget(path, target, why)) return false;
    struct stat info {};
    const bool exists = ::stat(target.c_str(), &info) == 0;
    if (exists && !S_ISREG(info.st_mode)) {
        if (S_ISDIR(info.st_mode)) return Failed(why, "it is a directory", EISDIR);
        return WriteDirectly(target, content, false, why);
    }
    // A second name of the file would keep the old content after a rename:
    // a hard-linked file is rewritten where it is.
    if (exists && info.st_nlink > 1) return WriteDirectly(target, content, true, why);
    const std::size_t slash = target.rfind('/');
    const std::string temporary =
        (slash == std::string::npos ? std::string() : target.substr(0, slash + 1)) + "." +
        target.substr(slash == std::string::npos ? 0 : slash + 1) + ".XXXXXX";
    std::vector<char> name(temporary.begin(), temporary.end());
    name.push_back('\0');
    const int fd = ::mkostemp(name.data(), O_CLOEXEC);
    if (fd < 0) {
        // A directory closed to us can still hold a file we may write.
        if (exists && (errno == EACCES || errno == EPERM || errno == EROFS) &&
            ::access(target.c_str(), W_OK) == 0) {
            return WriteDirectly(target, content, true, why);
        }
        return Failed(why, "cannot create a temporary file beside it", errno);
    }
    // The replacement belongs to whoever owned the file (root writing a
    // user's file). Where we may not give it away, the file is rewritten in
    // place, which keeps its owner.
    if (exists && (info.st_uid != ::geteuid() || info.st_gid != ::getegid()) &&
        ::fchown(fd, info.st_uid, info.st_gid) != 0) {
        ::close(fd);
        ::unlink(name.data());
        return WriteDirectly(target, content, true, why);
    }
    const mode_t mode = exists ? (info.st_mode & 07777) : DefaultMode();
    bool ok = ::fchmod(fd, mode) == 0 && WriteAll(fd, content) && ::fsync(fd) == 0;
    int error = errno;
    if (::close(fd) != 0 && ok) {
        ok = false;
        error = errno;
    }
    if (ok && ::rename(name.data(), target.c_str()) != 0) {
        ok = false;
        error = errno;
    }
    if (!ok) {
        ::unlink(name.data());
        return Failed(why, "write failed", error);
    }
    return true;
}

}  // namespace toolkit
