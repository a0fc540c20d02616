// The message demultiplexer of the kernel upcall channel: routes a request by its
// message id and says what to answer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "Daemon/Service/VSLCodeSigningService.h"

namespace vsl {

struct VSLUpcallMessage {
    uint32_t id = 0;
    VSLAuditToken auditToken{};  // the sender's; the kernel's carries pid 0
    const void* bytes = nullptr;
    size_t size = 0;
};

struct VSLUpcallReply {
    bool prepared = false;  // a reply goes back; otherwise none does
    int32_t returnCode = 0;
    std::string bytes;  // the reply packbuff when the code is 0
};

// True when the routine handled the request. The routine's id always gets a reply
// (its return code, with the packbuff on success); the id after it gets MIG_BAD_ID
// (-303) and false; any other id is not handled and gets no reply.
bool demux_server(const VSLUpcallMessage& request, VSLUpcallReply* reply);

}  // namespace vsl
