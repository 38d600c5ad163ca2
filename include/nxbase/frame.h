// The byte format of the messaging transport, free of any I/O: a frame is a
// 4-byte little-endian length and a body; a message body is the sender, 0x00,
// the command, 0x00 and the byte-stuffed data block (so without zero bytes).
// The connection request and its reply are frames with a plain text body.
#ifndef NXBASE_FRAME_H_
#define NXBASE_FRAME_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "nxbase/export.h"

namespace nxbase {

// Frames longer than this are malformed.
constexpr std::uint32_t kMaxFrameLength = 64u << 20;
// The length field in front of every body.
constexpr std::size_t kFrameHeaderSize = 4;

inline constexpr const char* kPipeRequestPrefix = "PipeRequest-";
inline constexpr const char* kDirectPipePrefix = "DirectPipe-";

// The 4-byte little-endian length of `asBody`, then the body. Lengths above
// kMaxFrameLength are the caller's to refuse: a reader refuses such frames.
NXBASE_EXPORT std::string EncodeFrame(const std::string& asBody);
// The body of a message frame; `asEncodedData` is already byte-stuffed.
NXBASE_EXPORT std::string MessageBody(const std::string& asSender, const std::string& asCommand,
                                      const std::string& asEncodedData);
// The whole frame of a message in one allocation: length, sender, 0x00,
// command, 0x00, the byte-stuffed data.
NXBASE_EXPORT std::string MessageFrame(const std::string& asSender, const std::string& asCommand,
                                       const char* pEncodedData, std::size_t alSize);
// The same written over `asFrame`, whose storage is reused (sized once and
// filled by copies).
NXBASE_EXPORT void BuildMessageFrame(std::string& asFrame, std::string_view asSender,
                                     std::string_view asCommand, std::string_view asEncodedData);
// The positions of a message body's first two zero bytes (after the sender
// and after the command), without copying; false when it lacks them.
NXBASE_EXPORT bool FindMessageFields(const std::string& asBody, std::size_t& alFirst,
                                     std::size_t& alSecond);
// Splits a message body at its first two zero bytes; false when it lacks them.
NXBASE_EXPORT bool SplitMessageBody(const std::string& asBody, std::string& asSender,
                                    std::string& asCommand, std::string& asData);
// Splits a connection request "<name>_<process id>"; false unless the name
// is not empty and the process id is a decimal number.
NXBASE_EXPORT bool SplitRequest(const std::string& asRequest, std::string& asName);

// Collects bytes as they arrive and hands out whole frame bodies. A large
// frame is collected in a buffer of its own that grows with the bytes that
// arrive, never beyond the frame's size, and is handed out without a copy:
// the reader holds at most twice a frame's bytes, and only while its buffer
// grows.
class NXBASE_EXPORT FrameReader {
  public:
    enum class Result { kFrame, kNeedMore, kMalformed };
    void Append(const char* pData, std::size_t alSize);
    // The next body (frames of length 0 are skipped); kMalformed for a length
    // above kMaxFrameLength, after which the reader stays malformed.
    Result Next(std::string& asBody);
    // Bytes received that belong to frames not yet handed out.
    std::size_t Buffered() const { return amBuffer.size() - amStart + amLarge.size(); }

  private:
    void Compact();
    void ReserveLarge(std::size_t alNeeded);

    std::string amBuffer;  // headers and small frames
    std::size_t amStart = 0;
    std::string amLarge;  // the body of a large frame being filled
    std::size_t amLargeLength = 0;
    bool amInLarge = false;
    bool amMalformed = false;
};

}  // namespace nxbase

#endif  // NXBASE_FRAME_H_
