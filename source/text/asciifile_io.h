// The operating-system seam of the ASCII data file: files opened by name,
// read and written through a buffered descriptor stream. Internal.
#ifndef NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_
#define NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_

#include <cstdint>
#include <iosfwd>
#include <memory>
#include <string>

namespace nxbase::detail {

class DescriptorBuffer;

// One data file opened by name, for reading or for writing.
//
// Writing truncates the file at the open, so that it exists from then on
// with its owner, permissions and links, and appends: each Flush hands every
// line written so far to the kernel (readers see it, and a crash of the
// process loses none of it), Close(true) syncs the file to the disk. The
// file only ever ends in a whole line: a write that fails is taken back. A
// symbolic link is followed; a device or a pipe is written the same way.
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

    // Hands the buffered output to the kernel; false when a write failed or
    // when the file being written has lost its last name (its directory was
    // removed), so that the data can never be found again.
    bool Flush();
    // Ends the file. A writer writes what is left and syncs the file when
    // `commit`; otherwise what was not yet written is dropped and the file
    // keeps its whole lines. Returns false when a commit was asked for and
    // failed.
    bool Close(bool commit);

  private:
    DataFileStream();

    std::unique_ptr<DescriptorBuffer> buffer_;
    std::unique_ptr<std::iostream> stream_;
    std::uint64_t size_ = 0;
    bool lineFeed_ = false;
    bool writing_ = false;
    bool closed_ = false;
    bool regular_ = false;
    bool StillNamed() const;
};

}  // namespace nxbase::detail

#endif  // NXBASE_SOURCE_TEXT_ASCIIFILE_IO_H_
