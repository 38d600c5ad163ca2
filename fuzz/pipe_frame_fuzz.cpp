// Feeds arbitrary bytes to the transport's frame reader in pieces (the first
// byte sets the piece size, as sockets deliver them in any split) and takes
// every body apart as the delivery does. The reader must hand out exactly the
// frames the bytes hold, never read outside them, and stop for good at a
// length above the limit.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"

namespace {

void Require(bool axCondition) {
    if (!axCondition) std::abort();
}

// The frames of `bytes` by a plain walk, for comparison.
std::size_t CountWholeFrames(const std::uint8_t* data, std::size_t size, bool& malformed) {
    std::size_t at = 0, frames = 0;
    malformed = false;
    while (size - at >= 4) {
        std::uint32_t length = data[at] | (data[at + 1] << 8) | (data[at + 2] << 16) |
                               (static_cast<std::uint32_t>(data[at + 3]) << 24);
        if (length > nxbase::kMaxFrameLength) {
            malformed = true;
            break;
        }
        if (size - at - 4 < length) break;
        if (length > 0) ++frames;
        at += 4 + length;
    }
    return frames;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) return 0;
    std::size_t piece = data[0] % 64 + 1;
    const std::uint8_t* stream = data + 1;
    std::size_t length = size - 1;

    nxbase::FrameReader reader;
    std::size_t frames = 0;
    bool malformed = false;
    std::string body;
    for (std::size_t at = 0; at < length && !malformed; at += piece) {
        std::size_t n = std::min(piece, length - at);
        reader.Append(reinterpret_cast<const char*>(stream + at), n);
        while (true) {
            nxbase::FrameReader::Result result = reader.Next(body);
            if (result == nxbase::FrameReader::Result::kNeedMore) break;
            if (result == nxbase::FrameReader::Result::kMalformed) {
                malformed = true;
                break;
            }
            Require(!body.empty());
            ++frames;
            std::string sender, command, rest;
            if (nxbase::SplitMessageBody(body, sender, command, rest)) {
                Require(sender.size() + command.size() + rest.size() + 2 == body.size());
                Require(sender.find('\0') == std::string::npos);
                Require(command.find('\0') == std::string::npos);
                std::string decoded = nxbase::DecodeBytes(rest.data(), rest.size());
                std::string encoded = nxbase::EncodeBytes(decoded.data(), decoded.size());
                Require(nxbase::DecodeBytes(encoded.data(), encoded.size()) == decoded);
                nxbase::NumberOfCommandText(command);
            }
        }
    }
    bool expectMalformed = false;
    std::size_t expected = CountWholeFrames(stream, length, expectMalformed);
    Require(frames == expected);
    Require(malformed == expectMalformed);
    return 0;
}
