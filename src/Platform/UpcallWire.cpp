#include "Platform/UpcallWire.h"

#include <unistd.h>

#include <cstring>

#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

uint32_t readU32(const uint8_t* p) {
    return static_cast<uint32_t>(p[0]) | static_cast<uint32_t>(p[1]) << 8 | static_cast<uint32_t>(p[2]) << 16 |
           static_cast<uint32_t>(p[3]) << 24;
}

void appendU32(std::string& out, uint32_t v) {
    for (int i = 0; i < 4; i++) out.push_back(static_cast<char>((v >> (8 * i)) & 0xFF));
}

// Splits off one frame: its length when whole, none while more bytes are needed;
// false for a length out of bounds.
bool frameLength(const uint8_t* bytes, size_t size, uint32_t minimum, std::optional<uint32_t>* length,
                 std::string* error) {
    *length = std::nullopt;
    if (size < 4) return true;
    const uint32_t n = readU32(bytes);
    if (n > kUpcallMaxFrameLength || n < minimum) {
        if (error) *error = "frame length " + std::to_string(n) + " out of bounds";
        return false;
    }
    if (size - 4 >= n) *length = n;
    return true;
}

class UpcallServerFraming final : public IpcFraming {
public:
    IpcDecoded decode(const uint8_t* bytes, size_t size) const override {
        IpcDecoded out;
        std::optional<uint32_t> length;
        if (!frameLength(bytes, size, 4, &length, &out.error)) {
            out.kind = IpcDecoded::Kind::Error;
            return out;
        }
        if (!length) return out;
        out.kind = IpcDecoded::Kind::Message;
        out.consumed = 4 + *length;
        out.message.id = readU32(bytes + 4);
        out.message.body = Value::data(Data(bytes + kUpcallRequestHeader, bytes + out.consumed));
        return out;
    }

    std::optional<std::string> encodeReply(uint64_t messageId, const Value& body, std::string* error) const override {
        const Value* code = body.find(kUpcallReturnCodeKey);
        const Value* reply = body.find(kUpcallReplyBytesKey);
        if (!code || !code->int64Value() || (reply && !reply->dataValue())) {
            if (error) *error = "not an upcall reply";
            return std::nullopt;
        }
        std::string packbuff;
        if (reply) packbuff.assign(reply->dataValue()->begin(), reply->dataValue()->end());
        auto frame = encodeUpcallReplyFrame(static_cast<uint32_t>(messageId), static_cast<int32_t>(*code->int64Value()),
                                            packbuff);
        if (!frame && error) *error = "reply over the frame limit";
        return frame;
    }

    // The kernel reads replies only: a refused connection is just closed.
    std::optional<std::string> encodeRefusal(const std::string&) const override { return std::nullopt; }
};

}  // namespace

Value upcallReplyBody(int32_t returnCode, const std::string& packbuff) {
    Dictionary d{{kUpcallReturnCodeKey, Value::int64(returnCode)}};
    if (returnCode == 0) d.emplace(kUpcallReplyBytesKey, Value::data(Data(packbuff.begin(), packbuff.end())));
    return Value::dictionary(std::move(d));
}

const std::shared_ptr<const IpcFraming>& upcallServerFraming() {
    static const std::shared_ptr<const IpcFraming> framing = std::make_shared<UpcallServerFraming>();
    return framing;
}

std::optional<std::string> encodeUpcallRequestFrame(uint32_t messageId, const std::string& packbuff) {
    if (packbuff.size() > kUpcallMaxFrameLength - 4) return std::nullopt;
    std::string out;
    out.reserve(kUpcallRequestHeader + packbuff.size());
    appendU32(out, static_cast<uint32_t>(4 + packbuff.size()));
    appendU32(out, messageId);
    out += packbuff;
    return out;
}

std::optional<std::string> encodeUpcallReplyFrame(uint32_t requestId, int32_t returnCode,
                                                  const std::string& packbuff) {
    const std::string& body = returnCode == 0 ? packbuff : std::string();
    if (body.size() > kUpcallMaxFrameLength - 8) return std::nullopt;
    std::string out;
    out.reserve(kUpcallReplyHeader + body.size());
    appendU32(out, static_cast<uint32_t>(8 + body.size()));
    appendU32(out, requestId + kUpcallReplyIdOffset);
    appendU32(out, static_cast<uint32_t>(returnCode));
    out += body;
    return out;
}

UpcallDecodeStatus decodeUpcallReplyFrame(const uint8_t* bytes, size_t size, UpcallReplyFrame* frame,
                                          size_t* consumed, std::string* error) {
    std::optional<uint32_t> length;
    if (!frameLength(bytes, size, 8, &length, error)) return UpcallDecodeStatus::Error;
    if (!length) return UpcallDecodeStatus::NeedMore;
    frame->messageId = readU32(bytes + 4);
    frame->returnCode = static_cast<int32_t>(readU32(bytes + 8));
    if (frame->returnCode != 0 && *length != 8) {
        if (error) *error = "a failed reply carries a packbuff";
        return UpcallDecodeStatus::Error;
    }
    frame->packbuff.assign(reinterpret_cast<const char*>(bytes) + kUpcallReplyHeader, *length - 8);
    *consumed = 4 + *length;
    return UpcallDecodeStatus::Frame;
}

std::string defaultUpcallServicePath() { return rootedPath("run/vesseld/com.tarrow.vesseld.upcall"); }

bool isUpcallKernelStandIn(uid_t peerUID) { return peerUID == 0 || peerUID == ::geteuid(); }

AuditToken upcallSenderToken(const AuditToken& peerToken, uid_t peerUID) {
    AuditToken token = peerToken;
    if (isUpcallKernelStandIn(peerUID)) token.words[5] = 0;
    return token;
}

}  // namespace vsl
