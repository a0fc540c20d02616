// How a connection's byte stream splits into messages, and how replies and refusal
// notices are written back: the one thing that differs between the sockets served by
// the IPC event loop (the dictionary protocol of IpcWire.h, the kernel upcall channel
// of UpcallWire.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl {

struct IpcMessage {
    uint64_t id = 0;
    Value body;  // what the framing makes of the frame's payload
};

struct IpcDecoded {
    enum class Kind { NeedMore, Message, Error };
    Kind kind = Kind::NeedMore;
    size_t consumed = 0;  // bytes of the frame, for a message
    IpcMessage message;
    std::string error;  // for an error: why the connection is closed
};

class IpcFraming {
public:
    virtual ~IpcFraming() = default;
    // Looks at the front of the bytes read so far: a whole message, a need for more
    // bytes, or a protocol error that closes the connection. Never reads past `size`.
    virtual IpcDecoded decode(const uint8_t* bytes, size_t size) const = 0;
    // The whole reply frame to the request `messageId`; none with a reason when the
    // body cannot be sent.
    virtual std::optional<std::string> encodeReply(uint64_t messageId, const Value& body,
                                                   std::string* error) const = 0;
    // What a refused connection is told before it is closed; none to close silently.
    virtual std::optional<std::string> encodeRefusal(const std::string& reason) const = 0;
};

// The dictionary protocol of IpcWire.h: requests carry no flags, replies the reply bit.
const std::shared_ptr<const IpcFraming>& dictionaryFraming();

}  // namespace vsl
