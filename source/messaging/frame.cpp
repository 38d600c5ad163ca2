#include "nxbase/frame.h"

#include <algorithm>
#include <cstring>

namespace nxbase {

namespace {

// Frames at least this long are collected in a buffer of their own.
constexpr std::size_t kLargeFrame = 64 * 1024;

void StoreLength(char* pHeader, std::uint32_t alLength) {
    for (std::size_t i = 0; i < kFrameHeaderSize; ++i) {
        pHeader[i] = static_cast<char>((alLength >> (8 * i)) & 0xFF);
    }
}

std::uint32_t ReadLength(const char* pHeader) {
    const auto* bytes = reinterpret_cast<const unsigned char*>(pHeader);
    return static_cast<std::uint32_t>(bytes[0]) | (static_cast<std::uint32_t>(bytes[1]) << 8) |
           (static_cast<std::uint32_t>(bytes[2]) << 16) |
           (static_cast<std::uint32_t>(bytes[3]) << 24);
}

}  // namespace

std::string EncodeFrame(const std::string& asBody) {
    std::string frame(kFrameHeaderSize + asBody.size(), '\0');
    StoreLength(frame.data(), static_cast<std::uint32_t>(asBody.size()));
    std::memcpy(frame.data() + kFrameHeaderSize, asBody.data(), asBody.size());
    return frame;
}

std::string MessageBody(const std::string& asSender, const std::string& asCommand,
                        const std::string& asEncodedData) {
    std::string body;
    body.reserve(asSender.size() + asCommand.size() + asEncodedData.size() + 2);
    body += asSender;
    body += '\0';
    body += asCommand;
    body += '\0';
    body += asEncodedData;
    return body;
}

std::string MessageFrame(const std::string& asSender, const std::string& asCommand,
                         const char* pEncodedData, std::size_t alSize) {
    std::string frame;
    BuildMessageFrame(frame, asSender, asCommand, std::string_view(pEncodedData, alSize));
    return frame;
}

void BuildMessageFrame(std::string& asFrame, std::string_view asSender, std::string_view asCommand,
                       std::string_view asEncodedData) {
    std::size_t length = asSender.size() + asCommand.size() + 2 + asEncodedData.size();
    // Sized once and filled by copies: every message passes here.
    asFrame.resize(kFrameHeaderSize + length);
    StoreLength(asFrame.data(), static_cast<std::uint32_t>(length));
    char* out = asFrame.data() + kFrameHeaderSize;
    auto put = [&out](std::string_view field) {
        if (!field.empty()) std::memcpy(out, field.data(), field.size());
        out += field.size();
    };
    put(asSender);
    *out++ = '\0';
    put(asCommand);
    *out++ = '\0';
    put(asEncodedData);
}

bool FindMessageFields(const std::string& asBody, std::size_t& alFirst, std::size_t& alSecond) {
    alFirst = asBody.find('\0');
    if (alFirst == std::string::npos) return false;
    alSecond = asBody.find('\0', alFirst + 1);
    return alSecond != std::string::npos;
}

bool SplitMessageBody(const std::string& asBody, std::string& asSender, std::string& asCommand,
                      std::string& asData) {
    std::size_t first = 0, second = 0;
    if (!FindMessageFields(asBody, first, second)) return false;
    asSender = asBody.substr(0, first);
    asCommand = asBody.substr(first + 1, second - first - 1);
    asData = asBody.substr(second + 1);
    return true;
}

bool SplitRequest(const std::string& asRequest, std::string& asName) {
    std::size_t underscore = asRequest.rfind('_');
    if (underscore == std::string::npos || underscore == 0 || underscore + 1 == asRequest.size()) {
        return false;
    }
    bool digits = std::all_of(asRequest.begin() + static_cast<long>(underscore) + 1,
                              asRequest.end(), [](char c) { return c >= '0' && c <= '9'; });
    if (!digits || asRequest.find('\0') != std::string::npos) return false;
    asName = asRequest.substr(0, underscore);
    return true;
}

void FrameReader::Append(const char* pData, std::size_t alSize) {
    if (amInLarge) {
        std::size_t take = std::min(alSize, amLargeLength - amLarge.size());
        ReserveLarge(amLarge.size() + take);
        amLarge.append(pData, take);
        pData += take;
        alSize -= take;
    }
    if (alSize == 0) return;
    if (amStart == amBuffer.size()) {
        amBuffer.clear();
        amStart = 0;
    }
    amBuffer.append(pData, alSize);
}

// Room for `needed` bytes of the large frame: doubling, capped at its size,
// so that the old and the new buffer together never exceed twice the frame.
void FrameReader::ReserveLarge(std::size_t needed) {
    if (needed <= amLarge.capacity()) return;
    const std::size_t doubled = std::max(needed, std::max(2 * amLarge.capacity(), kLargeFrame));
    amLarge.reserve(std::min(doubled, amLargeLength));
}

void FrameReader::Compact() {
    if (amStart == amBuffer.size()) {
        amBuffer.clear();
        amStart = 0;
    } else if (amStart > kLargeFrame && amStart * 2 > amBuffer.size()) {
        amBuffer.erase(0, amStart);
        amStart = 0;
    }
}

FrameReader::Result FrameReader::Next(std::string& asBody) {
    while (!amMalformed) {
        if (amInLarge) {
            if (amLarge.size() < amLargeLength) return Result::kNeedMore;
            asBody.swap(amLarge);
            std::string().swap(amLarge);
            amInLarge = false;
            return Result::kFrame;
        }
        std::size_t available = amBuffer.size() - amStart;
        if (available < kFrameHeaderSize) return Result::kNeedMore;
        std::uint32_t length = ReadLength(amBuffer.data() + amStart);
        if (length > kMaxFrameLength) {
            amMalformed = true;
            break;
        }
        std::size_t whole = kFrameHeaderSize + length;
        if (available >= whole) {
            asBody.assign(amBuffer, amStart + kFrameHeaderSize, length);
            amStart += whole;
            Compact();
            if (length == 0) continue;  // consumed, never delivered
            return Result::kFrame;
        }
        if (length < kLargeFrame) return Result::kNeedMore;
        // A large frame: its body goes into a buffer of its own, which grows
        // with the bytes that arrive (a claimed length costs nothing before
        // its bytes come) and never beyond the frame's size.
        amLargeLength = length;
        amLarge.clear();
        ReserveLarge(available - kFrameHeaderSize);
        amLarge.append(amBuffer, amStart + kFrameHeaderSize, std::string::npos);
        amInLarge = true;
        amBuffer.clear();
        std::string().swap(amBuffer);
        amStart = 0;
        return Result::kNeedMore;
    }
    return Result::kMalformed;
}

}  // namespace nxbase
