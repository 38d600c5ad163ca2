// POSIX calls of the text subsystem; see text_os.h.
#include "text_os.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <clocale>
#include <cstdlib>

#include "toolkit/eintr.h"
#include "toolkit/string.h"

namespace nxbase::detail {

namespace {

// Closes the descriptor on every path out of ReadWholeFile.
class FileDescriptor {
  public:
    explicit FileDescriptor(int fd) : fd_(fd) {}
    ~FileDescriptor() {
        if (fd_ >= 0) ::close(fd_);
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    int get() const { return fd_; }

  private:
    int fd_ = -1;
};

}  // namespace

bool ReadWholeFile(const std::string& path, std::string& bytes) {
    bytes.clear();
    FileDescriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.get() < 0) return false;
    struct stat info {};
    if (::fstat(fd.get(), &info) != 0 || !S_ISREG(info.st_mode)) return false;
    if (static_cast<unsigned long long>(info.st_size) > kMaxReadFileBytes) return false;
    bytes.resize(static_cast<std::size_t>(info.st_size));
    std::size_t done = 0;
    for (;;) {
        if (done == bytes.size()) {
            // The file may have grown since fstat: read on until the end.
            if (bytes.size() >= kMaxReadFileBytes) break;
            bytes.resize(bytes.size() + 4096);
        }
        const ssize_t got = toolkit::RetryOnEintr(
            [&] { return ::read(fd.get(), &bytes[done], bytes.size() - done); });
        if (got < 0) {
            bytes.clear();
            return false;
        }
        if (got == 0) break;
        done += static_cast<std::size_t>(got);
    }
    bytes.resize(done);
    return true;
}

bool IsReadableFile(const std::string& path) {
    struct stat info {};
    return ::stat(path.c_str(), &info) == 0 && S_ISREG(info.st_mode) &&
           ::access(path.c_str(), R_OK) == 0;
}

std::string GetEnvironment(const char* name) {
    const char* value = std::getenv(name);
    return value != nullptr ? std::string(value) : std::string();
}

std::string QueryCLocale(int category) {
    const char* current = std::setlocale(category, nullptr);
    return current != nullptr ? std::string(current) : std::string();
}

std::string SetCLocale(int category, const std::string& name) {
    const char* result = std::setlocale(category, name.c_str());
    return result != nullptr ? std::string(result) : std::string();
}

// One converter for the whole library (the toolkit's): every byte of the
// code page has a character, so ANSI text survives the round trip.
std::string Utf8ToWindows1252(std::string_view utf8) {
    return toolkit::Utf8ToWindows1252(utf8);
}

}  // namespace nxbase::detail
