// The operating-system seam of the ASCII data file: files opened by name,
// read and written through a buffered descriptor stream. Internal.
#ifndef NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_
#define NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_

#include <cstdint>
#include <iosfwd>
#include <memory>
#include <sstream>
#include <string>

namespace nxbase::detail {

class DescriptorBuffer;

// One data file opened by name, for reading or for writing.
//
// Writing a regular file collects the text in memory and publishes it at
// every Flush and at Close(true) with nxbase::WriteWholeFile: the file exists
// from the open on, and whenever a caller can look it holds exactly what was
// written up to the last flush, never a part of a line. A directory that
// does not take new files is fine when the file itself is writable. An
// existing target that is not a regular file (a device such as /dev/full, a
// pipe) is written directly. A symbolic link is followed to its target.
class DataFileStream {
public:
    // Opens `path` for reading. Stores the file's size (0 when it cannot be
    // opened) and whether one of its first `probe` bytes is a line feed. A
    // file that cannot be opened yields a stream that is at its end.
    static std::unique_ptr<DataFileStream> OpenForReading(const std::string& path,
                                                          std::size_t probe);
    // Opens `path` for writing. A file that cannot be created yields a stream
    // in the failed state.
    static std::unique_ptr<DataFileStream> OpenForWriting(const std::string& path);

    ~DataFileStream();
    DataFileStream(const DataFileStream&) = delete;
    DataFileStream& operator=(const DataFileStream&) = delete;

    std::iostream* Stream() const { return stream_.get(); }
    std::uint64_t Size() const { return size_; }
    bool HasLineFeed() const { return lineFeed_; }

    // Flushes buffered output; false when a write failed or when the file
    // being written has lost its last name (its directory was removed), so
    // that the data can never be found again.
    bool Flush();
    // Ends the file. A writer publishes what is left when `commit` and every
    // write succeeded; otherwise the file keeps what the last flush gave it.
    // Returns false when a commit was asked for and failed.
    bool Close(bool commit);

private:
    DataFileStream();

    std::unique_ptr<DescriptorBuffer> buffer_;
    std::unique_ptr<std::iostream> stream_;
    std::uint64_t size_ = 0;
    bool lineFeed_ = false;
    bool writing_ = false;
    bool closed_ = false;
    bool Publish();

    std::string target_;
    std::unique_ptr<std::stringstream> memory_;  // null when writing directly
    std::size_t published_ = 0;                  // bytes of memory_ in the file
    bool everPublished_ = false;
};

}  // namespace nxbase::detail

#endif  // NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_
