#include "asciifile_io.h"

#include "nxbase/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <istream>
#include <streambuf>
#include <vector>

namespace nxbase::detail {

namespace {

// Bytes moved per read() or write().
constexpr std::size_t kBufferSize = 64 * 1024;

int OpenRetrying(const char* path, int flags, mode_t mode = 0) {
    int fd;
    do {
        fd = ::open(path, flags | O_CLOEXEC, mode);
    } while (fd < 0 && errno == EINTR);
    return fd;
}

ssize_t ReadRetrying(int fd, char* data, std::size_t size) {
    ssize_t n;
    do {
        n = ::read(fd, data, size);
    } while (n < 0 && errno == EINTR);
    return n;
}

bool WriteAll(int fd, const char* data, std::size_t size) {
    while (size > 0) {
        ssize_t n = ::write(fd, data, size);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        data += n;
        size -= static_cast<std::size_t>(n);
    }
    return true;
}

// The file a path finally names: symbolic links resolved when the target
// exists, the path itself otherwise.
std::string ResolvedTarget(const std::string& path) {
    struct stat info {};
    if (::lstat(path.c_str(), &info) == 0 && S_ISLNK(info.st_mode)) {
        char resolved[PATH_MAX];
        if (::realpath(path.c_str(), resolved) != nullptr) return resolved;
    }
    return path;
}

}  // namespace

// A std::streambuf over one file descriptor, for reading or for writing.
class DescriptorBuffer : public std::streambuf {
public:
    DescriptorBuffer(int fd, bool writing) : fd_(fd), buffer_(kBufferSize) {
        if (writing) {
            setp(buffer_.data(), buffer_.data() + buffer_.size());
        } else {
            setg(buffer_.data(), buffer_.data(), buffer_.data());
        }
    }
    ~DescriptorBuffer() override { CloseDescriptor(); }
    DescriptorBuffer(const DescriptorBuffer&) = delete;
    DescriptorBuffer& operator=(const DescriptorBuffer&) = delete;

    int fd() const { return fd_; }

    // Reads up to `count` bytes (at most the buffer's size) into the get
    // area, as far as the input goes; returns how many are there.
    std::size_t Prime(std::size_t count) {
        std::size_t want = std::min(count, buffer_.size());
        std::size_t have = 0;
        while (fd_ >= 0 && have < want) {
            ssize_t n = ReadRetrying(fd_, buffer_.data() + have, want - have);
            if (n <= 0) break;
            have += static_cast<std::size_t>(n);
        }
        setg(buffer_.data(), buffer_.data(), buffer_.data() + have);
        return have;
    }
    // True when the unread bytes in the get area hold `c`.
    bool Contains(char c) const {
        return std::memchr(gptr(), c, static_cast<std::size_t>(egptr() - gptr())) != nullptr;
    }
    bool failed() const { return failed_; }

    bool CloseDescriptor() {
        if (fd_ < 0) return true;
        bool ok = ::close(fd_) == 0;
        fd_ = -1;
        return ok;
    }

protected:
    int_type underflow() override {
        if (gptr() < egptr()) return traits_type::to_int_type(*gptr());
        if (fd_ < 0) return traits_type::eof();
        ssize_t n = ReadRetrying(fd_, buffer_.data(), buffer_.size());
        if (n <= 0) return traits_type::eof();
        setg(buffer_.data(), buffer_.data(), buffer_.data() + n);
        return traits_type::to_int_type(*gptr());
    }

    int_type overflow(int_type c) override {
        if (!FlushPut()) return traits_type::eof();
        if (!traits_type::eq_int_type(c, traits_type::eof())) {
            *pptr() = traits_type::to_char_type(c);
            pbump(1);
        }
        return traits_type::not_eof(c);
    }

    int sync() override {
        if (pbase() == nullptr) return 0;
        return FlushPut() ? 0 : -1;
    }

private:
    bool FlushPut() {
        if (pbase() == nullptr) return false;
        std::size_t pending = static_cast<std::size_t>(pptr() - pbase());
        if (pending > 0) {
            if (failed_ || fd_ < 0 || !WriteAll(fd_, pbase(), pending)) failed_ = true;
            setp(buffer_.data(), buffer_.data() + buffer_.size());
        }
        return !failed_;
    }

    int fd_;
    bool failed_ = false;
    std::vector<char> buffer_;
};

DataFileStream::DataFileStream() = default;

DataFileStream::~DataFileStream() { Close(false); }

std::unique_ptr<DataFileStream> DataFileStream::OpenForReading(const std::string& path,
                                                               std::size_t probe) {
    std::unique_ptr<DataFileStream> file(new DataFileStream());
    int fd = OpenRetrying(path.c_str(), O_RDONLY);
    file->buffer_ = std::make_unique<DescriptorBuffer>(fd, false);
    file->stream_ = std::make_unique<std::iostream>(file->buffer_.get());
    if (fd >= 0) {
        struct stat info {};
        if (::fstat(fd, &info) == 0 && S_ISREG(info.st_mode)) {
            file->size_ = static_cast<std::uint64_t>(info.st_size);
        }
        // The line-feed probe reads the head of the file into the buffer, so
        // that the bytes are read once and pipes work as well as files.
        file->buffer_->Prime(probe);
        file->lineFeed_ = file->buffer_->Contains('\n');
    }
    return file;
}

std::unique_ptr<DataFileStream> DataFileStream::OpenForWriting(const std::string& path) {
    std::unique_ptr<DataFileStream> file(new DataFileStream());
    file->writing_ = true;
    file->target_ = ResolvedTarget(path);

    struct stat info {};
    if (::stat(file->target_.c_str(), &info) == 0 && !S_ISREG(info.st_mode)) {
        const int fd = OpenRetrying(file->target_.c_str(), O_WRONLY | O_TRUNC);
        file->buffer_ = std::make_unique<DescriptorBuffer>(fd, true);
        file->stream_ = std::make_unique<std::iostream>(file->buffer_.get());
        if (fd < 0) file->stream_->setstate(std::ios::badbit);
        return file;
    }
    file->memory_ = std::make_unique<std::stringstream>(std::ios::out | std::ios::binary);
    file->stream_ = std::make_unique<std::iostream>(file->memory_->rdbuf());
    // The file exists from the open on, as callers expect of a file opened
    // for writing.
    if (!file->Publish()) file->stream_->setstate(std::ios::badbit);
    return file;
}

bool DataFileStream::Publish() {
    stream_->flush();
    if (stream_->fail()) return false;
    const std::string content = memory_->str();
    if (everPublished_ && content.size() == published_) return true;
    try {
        nxbase::WriteWholeFile(target_, content);
    } catch (const std::exception&) {
        return false;
    }
    published_ = content.size();
    everPublished_ = true;
    return true;
}

bool DataFileStream::Flush() {
    if (!writing_ || closed_) return true;
    if (memory_) return Publish();
    stream_->flush();
    if (stream_->fail() || buffer_->failed() || buffer_->fd() < 0) return false;
    struct stat info {};
    return ::fstat(buffer_->fd(), &info) == 0 && info.st_nlink > 0;
}

bool DataFileStream::Close(bool commit) {
    if (closed_) return true;
    closed_ = true;
    if (!writing_) {
        buffer_->CloseDescriptor();
        return true;
    }
    if (memory_) {
        if (!commit) return true;
        closed_ = false;
        const bool ok = Publish();
        closed_ = true;
        return ok;
    }
    stream_->flush();
    const bool ok = commit && !stream_->fail() && !buffer_->failed() && buffer_->fd() >= 0;
    return (buffer_->CloseDescriptor() && ok) || !commit;
}

}  // namespace nxbase::detail
