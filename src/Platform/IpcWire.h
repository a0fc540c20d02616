// The IPC frame format: a u32 length prefix, then "VSLM", u16 version, u16 flags,
// u64 message id and one encoded dictionary. Little-endian throughout. The decoder
// is strict: a frame either decodes exactly or is a protocol error, and it never
// reads past the bytes it is given.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl {

constexpr uint32_t kIpcMaxFrameLength = 16u << 20;  // bytes after the length prefix
constexpr uint16_t kIpcVersion = 1;
constexpr uint16_t kIpcFlagReply = 0x1;
constexpr size_t kIpcLengthPrefix = 4;
constexpr size_t kIpcHeaderLength = 16;  // magic, version, flags, message id
constexpr size_t kIpcMaxDepth = 64;      // the body dictionary is level 1

// Message id 0 is never a request's: a reply frame carrying it is the server's notice
// that it refused the connection, sent just before it closes it. Its body holds the
// reason under kIpcRefusalKey (a string).
constexpr uint64_t kIpcNoticeMessageId = 0;
inline constexpr const char* kIpcRefusalKey = "ReplyConnectionRefused";

struct IpcFrame {
    uint64_t messageId = 0;
    uint16_t flags = 0;
    Value body;  // always a dictionary
};

// A whole frame, length prefix included. Refuses (none, with a reason) what the
// other side would reject: a body that is not a dictionary, strings or keys that
// are not UTF-8 or hold a NUL, nesting over the depth limit, a frame over the limit,
// flags other than the reply bit.
std::optional<std::string> encodeFrame(uint64_t messageId, uint16_t flags, const Value& body,
                                       std::string* error = nullptr);

// Reads the length prefix of a frame; none when it is over the limit or too short
// to hold a header (a protocol error either way).
std::optional<uint32_t> decodeFrameLength(const uint8_t prefix[kIpcLengthPrefix]);

// Decodes the bytes that follow the length prefix (exactly `length` of them).
std::optional<IpcFrame> decodeFrameBody(const uint8_t* bytes, size_t length,
                                        std::string* error = nullptr);

}  // namespace vsl
