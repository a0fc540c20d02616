#include "Platform/IpcFraming.h"

#include "Platform/IpcWire.h"

namespace vsl {

namespace {

class DictionaryFraming final : public IpcFraming {
public:
    IpcDecoded decode(const uint8_t* bytes, size_t size) const override {
        IpcDecoded out;
        if (size < kIpcLengthPrefix) return out;
        auto length = decodeFrameLength(bytes);
        if (!length) {
            out.kind = IpcDecoded::Kind::Error;
            out.error = "bad frame length";
            return out;
        }
        if (size - kIpcLengthPrefix < *length) return out;
        auto frame = decodeFrameBody(bytes + kIpcLengthPrefix, *length, &out.error);
        if (!frame || frame->flags != 0) {
            out.kind = IpcDecoded::Kind::Error;
            if (frame) out.error = "reply flag on a request";
            return out;
        }
        out.kind = IpcDecoded::Kind::Message;
        out.consumed = kIpcLengthPrefix + *length;
        out.message = IpcMessage{frame->messageId, std::move(frame->body)};
        return out;
    }

    std::optional<std::string> encodeReply(uint64_t messageId, const Value& body, std::string* error) const override {
        return encodeFrame(messageId, kIpcFlagReply, body, error);
    }

    std::optional<std::string> encodeRefusal(const std::string& reason) const override {
        return encodeFrame(kIpcNoticeMessageId, kIpcFlagReply, dict({{kIpcRefusalKey, Value::string(reason)}}));
    }
};

}  // namespace

const std::shared_ptr<const IpcFraming>& dictionaryFraming() {
    static const std::shared_ptr<const IpcFraming> framing = std::make_shared<DictionaryFraming>();
    return framing;
}

}  // namespace vsl
