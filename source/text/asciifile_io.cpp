#include "asciifile_io.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <istream>
#include <streambuf>
#include <string_view>
#include <vector>

#include "toolkit/fileio.h"

namespace nxbase::detail {

namespace {

// Bytes moved per read() or write().
constexpr std::size_t kBufferSize = 64 * 1024;

}  // namespace

// A std::streambuf over one open file, for reading or for writing.
//
// Written text reaches the descriptor in whole lines: when the buffer fills,
// everything up to its last line feed is written and the rest kept (a line
// longer than the buffer grows it). A sync writes all that is pending. When a
// write fails the file is cut back to what the earlier writes left, so that
// it never ends in a part of a line.
class DescriptorBuffer : public std::streambuf {
  public:
    DescriptorBuffer(toolkit::File file, bool writing, bool regularFile = false)
        : file_(std::move(file)), regularFile_(regularFile), buffer_(kBufferSize) {
        if (writing) {
            setp(buffer_.data(), buffer_.data() + buffer_.size());
        } else {
            setg(buffer_.data(), buffer_.data(), buffer_.data());
        }
    }
    ~DescriptorBuffer() override { CloseDescriptor(); }
    DescriptorBuffer(const DescriptorBuffer&) = delete;
    DescriptorBuffer& operator=(const DescriptorBuffer&) = delete;

    const toolkit::File& file() const { return file_; }

    // Reads up to `count` bytes (at most the buffer's size) into the get
    // area, as far as the input goes; returns how many are there.
    std::size_t Prime(std::size_t count) {
        std::size_t want = std::min(count, buffer_.size());
        std::size_t have = 0;
        while (file_.IsOpen() && have < want) {
            ssize_t n = file_.Read(buffer_.data() + have, want - have);
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
    // Drops what is pending without writing it.
    void Discard() {
        if (pbase() != nullptr) setp(buffer_.data(), buffer_.data() + buffer_.size());
    }

    bool CloseDescriptor() { return file_.Close(); }

  protected:
    int_type underflow() override {
        if (gptr() < egptr()) return traits_type::to_int_type(*gptr());
        if (!file_.IsOpen()) return traits_type::eof();
        ssize_t n = file_.Read(buffer_.data(), buffer_.size());
        if (n <= 0) return traits_type::eof();
        setg(buffer_.data(), buffer_.data(), buffer_.data() + n);
        return traits_type::to_int_type(*gptr());
    }

    int_type overflow(int_type c) override {
        if (pbase() == nullptr || failed_) return traits_type::eof();
        if (!WriteCompleteLines()) return traits_type::eof();
        if (pptr() == epptr()) Grow();
        if (!traits_type::eq_int_type(c, traits_type::eof())) {
            *pptr() = traits_type::to_char_type(c);
            pbump(1);
        }
        return traits_type::not_eof(c);
    }

    int sync() override {
        if (pbase() == nullptr) return 0;
        if (failed_) return -1;
        const std::size_t pending = static_cast<std::size_t>(pptr() - pbase());
        return Write(pbase(), pending) ? (Discard(), 0) : -1;
    }

  private:
    // Writes the pending text up to its last line feed and moves the rest to
    // the front of the buffer.
    bool WriteCompleteLines() {
        const std::size_t pending = static_cast<std::size_t>(pptr() - pbase());
        const char* data = pbase();
        const void* last = ::memrchr(data, '\n', pending);
        if (last == nullptr) return true;
        const std::size_t lines =
            static_cast<std::size_t>(static_cast<const char*>(last) - data) + 1;
        if (!Write(data, lines)) return false;
        const std::size_t rest = pending - lines;
        std::memmove(buffer_.data(), data + lines, rest);
        setp(buffer_.data(), buffer_.data() + buffer_.size());
        pbump(static_cast<int>(rest));
        return true;
    }

    void Grow() {
        const std::size_t pending = static_cast<std::size_t>(pptr() - pbase());
        buffer_.resize(buffer_.size() * 2);
        setp(buffer_.data(), buffer_.data() + buffer_.size());
        pbump(static_cast<int>(pending));
    }

    bool Write(const char* data, std::size_t size) {
        if (size == 0) return true;
        if (file_.WriteAll(std::string_view(data, size))) {
            written_ += size;
            return true;
        }
        failed_ = true;
        // A part of a line may have reached the file; take it back.
        if (file_.IsOpen() && regularFile_) (void)file_.Truncate(written_);
        return false;
    }

    toolkit::File file_;
    bool regularFile_;
    bool failed_ = false;
    std::uint64_t written_ = 0;
    std::vector<char> buffer_;
};

DataFileStream::DataFileStream() = default;

DataFileStream::~DataFileStream() {
    Close(false);
}

std::unique_ptr<DataFileStream> DataFileStream::OpenForReading(const std::string& path,
                                                               std::size_t probe) {
    std::unique_ptr<DataFileStream> file(new DataFileStream());
    toolkit::File opened(path, toolkit::File::Mode::kRead);
    const bool open = opened.IsOpen();
    if (open && opened.IsRegular()) file->size_ = opened.Size();
    file->buffer_ = std::make_unique<DescriptorBuffer>(std::move(opened), false);
    file->stream_ = std::make_unique<std::iostream>(file->buffer_.get());
    if (open) {
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
    // Truncated in place: owner, permissions and hard links stay as they
    // are, a symbolic link is followed, and a directory closed to new files
    // is no obstacle when the file itself is writable.
    toolkit::File opened(path, toolkit::File::Mode::kTruncate);
    const bool open = opened.IsOpen();
    file->regular_ = opened.IsRegular();
    file->buffer_ = std::make_unique<DescriptorBuffer>(std::move(opened), true, file->regular_);
    file->stream_ = std::make_unique<std::iostream>(file->buffer_.get());
    if (!open) file->stream_->setstate(std::ios::badbit);
    return file;
}

bool DataFileStream::Flush() {
    if (!writing_ || closed_) return true;
    stream_->flush();
    return !stream_->fail() && !buffer_->failed() && buffer_->file().IsOpen() && StillNamed();
}

bool DataFileStream::StillNamed() const {
    return !regular_ || buffer_->file().StillNamed();
}

bool DataFileStream::Close(bool commit) {
    if (closed_) return true;
    closed_ = true;
    if (!writing_) {
        buffer_->CloseDescriptor();
        return true;
    }
    if (!commit) {
        buffer_->Discard();
        buffer_->CloseDescriptor();
        return true;
    }
    stream_->flush();
    bool ok = !stream_->fail() && !buffer_->failed() && buffer_->file().IsOpen() && StillNamed();
    if (ok && regular_) ok = buffer_->file().Sync();
    return buffer_->CloseDescriptor() && ok;
}

}  // namespace nxbase::detail
