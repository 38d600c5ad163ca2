#include "nxbase/files.h"

#include <dlfcn.h>
#include <filesystem>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>
#include <vector>

String MakeValidFileName(const String& asName) {
    std::string name = asName.str();
    for (char& c : name) {
        unsigned char u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7F || std::strchr("\\/:*?\"<>|", c) != nullptr) c = '_';
    }
    // Windows drops trailing blanks and dots from names; keep them visible.
    for (auto it = name.rbegin(); it != name.rend() && (*it == ' ' || *it == '.'); ++it) *it = '_';
    if (name.empty()) name = "_";
    return String(name);
}

namespace nxbase {
namespace {

[[noreturn]] void Fail(const std::string& path, const std::string& what, int error) {
    throw std::runtime_error("cannot write " + path + ": " + what + ": " + std::strerror(error));
}

// Writes all of `content` to `fd`; false with errno set on failure.
bool WriteAll(int fd, std::string_view content) {
    while (!content.empty()) {
        ssize_t n = ::write(fd, content.data(), content.size());
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) {
            if (n == 0) errno = EIO;
            return false;
        }
        content.remove_prefix(static_cast<std::size_t>(n));
    }
    return true;
}

// The file a path names after following every symbolic link; the path
// itself when it is no link. A dangling link gives its (missing) target.
std::string FinalTarget(const std::string& path) {
    std::string current = path;
    for (int hops = 0; hops < 40; ++hops) {
        struct stat info {};
        if (::lstat(current.c_str(), &info) != 0 || !S_ISLNK(info.st_mode)) return current;
        std::vector<char> buffer(PATH_MAX + 1);
        ssize_t n = ::readlink(current.c_str(), buffer.data(), PATH_MAX);
        if (n < 0) Fail(path, "cannot read the link", errno);
        std::string target(buffer.data(), static_cast<std::size_t>(n));
        if (target.empty() || target[0] != '/') {
            std::size_t slash = current.rfind('/');
            target = (slash == std::string::npos ? std::string() : current.substr(0, slash + 1)) +
                     target;
        }
        current = target;
    }
    Fail(path, "too many symbolic links", ELOOP);
}

void WriteDirectly(const std::string& path, std::string_view content, bool truncate) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC | O_NOCTTY | (truncate ? O_TRUNC : 0));
    if (fd < 0) Fail(path, "cannot open", errno);
    bool written = WriteAll(fd, content);
    int error = errno;
    if (::close(fd) != 0 && written) {
        written = false;
        error = errno;
    }
    if (!written) Fail(path, "write failed", error);
}

}  // namespace

void WriteWholeFile(const std::string& path, std::string_view content) {
    std::string target = FinalTarget(path);
    struct stat info {};
    bool exists = ::stat(target.c_str(), &info) == 0;
    if (exists && !S_ISREG(info.st_mode)) {
        if (S_ISDIR(info.st_mode)) Fail(path, "it is a directory", EISDIR);
        WriteDirectly(target, content, false);
        return;
    }
    // A second name of the file would keep the old content after a rename:
    // a hard-linked file is rewritten where it is.
    if (exists && info.st_nlink > 1) {
        WriteDirectly(target, content, true);
        return;
    }
    std::size_t slash = target.rfind('/');
    std::string temporary =
        (slash == std::string::npos ? std::string() : target.substr(0, slash + 1)) + "." +
        target.substr(slash == std::string::npos ? 0 : slash + 1) + ".XXXXXX";
    std::vector<char> name(temporary.begin(), temporary.end());
    name.push_back('\0');
    int fd = ::mkostemp(name.data(), O_CLOEXEC);
    if (fd < 0) {
        // A directory closed to us can still hold a file we may write.
        if (exists && (errno == EACCES || errno == EPERM || errno == EROFS) &&
            ::access(target.c_str(), W_OK) == 0) {
            WriteDirectly(target, content, true);
            return;
        }
        Fail(path, "cannot create a temporary file beside it", errno);
    }
    // The replacement belongs to whoever owned the file (root writing a
    // user's file). Where we may not give it away, the file is rewritten in
    // place, which keeps its owner.
    if (exists && (info.st_uid != ::geteuid() || info.st_gid != ::getegid()) &&
        ::fchown(fd, info.st_uid, info.st_gid) != 0) {
        ::close(fd);
        ::unlink(name.data());
        WriteDirectly(target, content, true);
        return;
    }
    mode_t mode = exists ? (info.st_mode & 07777) : [] {
        mode_t mask = ::umask(0);
        ::umask(mask);
        return static_cast<mode_t>(0666 & ~mask);
    }();
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
        Fail(path, "write failed", error);
    }
}

std::string LibraryDataDirectory() {
    std::error_code ignored;
    Dl_info info{};
    if (dladdr(reinterpret_cast<void*>(&LibraryDataDirectory), &info) != 0 && info.dli_fname != nullptr) {
        const std::filesystem::path library = std::filesystem::weakly_canonical(info.dli_fname, ignored);
        const std::filesystem::path installed = library.parent_path() / NXBASE_LIBDIR_TO_DATADIR;
        if (std::filesystem::is_directory(installed, ignored)) return installed.lexically_normal().string();
    }
    if (std::filesystem::is_directory(NXBASE_SOURCE_DATA_DIR, ignored)) return NXBASE_SOURCE_DATA_DIR;
    return "";
}

}  // namespace nxbase
