// libvessel's side of the kernel upcall channel (Platform/UpcallWire.h): a client that
// plays the kernel, for tests, launchers and `vesselctl upcall`. One caller at a
// time; replies come back in request order.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Client/VSLUpcallMessages.h"
#include "Platform/UniqueFd.h"
#include "Platform/UpcallWire.h"

namespace vsl::client {

enum class VSLUpcallStatus {
    Ok,             // a reply frame arrived
    Timeout,        // none in time
    Closed,         // the daemon closed the connection
    ProtocolError,  // what arrived is not a reply frame
};

const char* upcallStatusName(VSLUpcallStatus status);

class VSLUpcallClient {
    struct Passkey {};

public:
    // None with a reason (errno as connect(2) left it) when nothing answers there.
    static std::unique_ptr<VSLUpcallClient> connect(const std::string& socketPath, std::string* error = nullptr);
    static std::string socketPathForSystemRoot(const std::string& root);

    VSLUpcallClient(Passkey, UniqueFd fd);

    // Sends bytes as they are (whole frames, or anything a test wants to send).
    bool sendBytes(const std::string& bytes, std::string* error = nullptr);
    bool sendRequest(uint32_t messageId, const std::string& packbuff, std::string* error = nullptr);
    // Waits for the next reply frame.
    VSLUpcallStatus receiveReply(UpcallReplyFrame* frame, std::chrono::milliseconds timeout,
                                 std::string* error = nullptr);
    // The routine's request and its reply.
    VSLUpcallStatus getProcessContainers(const std::string& packbuff, UpcallReplyFrame* frame,
                                         std::chrono::milliseconds timeout, std::string* error = nullptr);

private:
    UniqueFd fd_;
    std::string inbox_;
};

}  // namespace vsl::client
