// POSIX and iconv calls of the text subsystem; see text_os.h.
#include "text_os.h"

#include <fcntl.h>
#include <iconv.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <clocale>
#include <cstdlib>

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

// One conversion descriptor per thread, opened on first use: iconv_open
// costs far more than converting one line.
class Utf8To1252Converter {
  public:
    Utf8To1252Converter() : cd_(::iconv_open("WINDOWS-1252", "UTF-8")) {}
    ~Utf8To1252Converter() {
        if (valid()) ::iconv_close(cd_);
    }
    Utf8To1252Converter(const Utf8To1252Converter&) = delete;
    Utf8To1252Converter& operator=(const Utf8To1252Converter&) = delete;

    bool valid() const { return cd_ != reinterpret_cast<iconv_t>(-1); }
    iconv_t get() const { return cd_; }
    void Reset() { ::iconv(cd_, nullptr, nullptr, nullptr, nullptr); }

  private:
    iconv_t cd_;
};

// Length of the well-formed UTF-8 sequence at the start of `bytes`, 0 when
// the bytes there do not form one (RFC 3629: no overlong forms, no
// surrogates, nothing above U+10FFFF).
std::size_t Utf8SequenceLength(std::string_view bytes) {
    if (bytes.empty()) return 0;
    const auto b0 = static_cast<unsigned char>(bytes[0]);
    std::size_t length = 0;
    unsigned char low = 0x80;
    unsigned char high = 0xBF;
    if (b0 < 0x80) return 1;
    if (b0 >= 0xC2 && b0 <= 0xDF) {
        length = 2;
    } else if (b0 >= 0xE0 && b0 <= 0xEF) {
        length = 3;
        if (b0 == 0xE0) low = 0xA0;
        if (b0 == 0xED) high = 0x9F;
    } else if (b0 >= 0xF0 && b0 <= 0xF4) {
        length = 4;
        if (b0 == 0xF0) low = 0x90;
        if (b0 == 0xF4) high = 0x8F;
    } else {
        return 0;
    }
    if (bytes.size() < length) return 0;
    for (std::size_t i = 1; i < length; ++i) {
        const auto b = static_cast<unsigned char>(bytes[i]);
        if (b < (i == 1 ? low : 0x80) || b > (i == 1 ? high : 0xBF)) return 0;
    }
    return length;
}

bool IsAscii(std::string_view bytes) {
    for (char c : bytes) {
        if (static_cast<unsigned char>(c) >= 0x80) return false;
    }
    return true;
}

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
        ssize_t got = ::read(fd.get(), &bytes[done], bytes.size() - done);
        if (got < 0) {
            if (errno == EINTR) continue;
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

std::string Utf8ToWindows1252(std::string_view utf8) {
    if (IsAscii(utf8)) return std::string(utf8);

    thread_local Utf8To1252Converter converter;
    std::string out;
    out.reserve(utf8.size());
    if (!converter.valid()) {
        // Without the converter keep ASCII and mark everything else.
        for (std::size_t i = 0; i < utf8.size();) {
            std::size_t length = Utf8SequenceLength(utf8.substr(i));
            out.push_back(length == 1 ? utf8[i] : '?');
            i += length == 0 ? 1 : length;
        }
        return out;
    }

    converter.Reset();
    // Windows-1252 needs at most one byte per input byte.
    std::string buffer(utf8.size() + 1, '\0');
    std::size_t position = 0;
    while (position < utf8.size()) {
        char* in = const_cast<char*>(utf8.data() + position);
        std::size_t inLeft = utf8.size() - position;
        char* outStart = buffer.data();
        char* outPtr = outStart;
        std::size_t outLeft = buffer.size();
        std::size_t result = ::iconv(converter.get(), &in, &inLeft, &outPtr, &outLeft);
        out.append(outStart, static_cast<std::size_t>(outPtr - outStart));
        position = utf8.size() - inLeft;
        if (result != static_cast<std::size_t>(-1)) break;
        if (errno == E2BIG) continue;
        // EINVAL: a sequence cut off by the end of the text; EILSEQ: a
        // character the code page lacks or a malformed byte.
        out.push_back('?');
        if (errno == EINVAL) break;
        std::size_t length = Utf8SequenceLength(utf8.substr(position));
        position += length == 0 ? 1 : length;
        converter.Reset();
    }
    return out;
}

}  // namespace nxbase::detail
