// Fuzzes the IPC frame decoder with untrusted bytes as a client would send them
// after the length prefix. Whatever decodes must re-encode, and its encoding must
// be a fixed point: decode(encode(v)) encodes to the same bytes again.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "Platform/IpcWire.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size >= vsl::kIpcLengthPrefix) (void)vsl::decodeFrameLength(data);
    auto frame = vsl::decodeFrameBody(data, size);
    if (!frame) return 0;
    if (!frame->body.isDictionary() || (frame->flags & ~vsl::kIpcFlagReply) != 0) std::abort();
    auto encoded = vsl::encodeFrame(frame->messageId, frame->flags, frame->body);
    if (!encoded) std::abort();
    const auto* bytes = reinterpret_cast<const uint8_t*>(encoded->data());
    auto length = vsl::decodeFrameLength(bytes);
    if (!length || *length != encoded->size() - vsl::kIpcLengthPrefix) std::abort();
    auto again = vsl::decodeFrameBody(bytes + vsl::kIpcLengthPrefix, *length);
    if (!again || again->messageId != frame->messageId) std::abort();
    auto reencoded = vsl::encodeFrame(again->messageId, again->flags, again->body);
    if (!reencoded || *reencoded != *encoded) std::abort();
    return 0;
}
