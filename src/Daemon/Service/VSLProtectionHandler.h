// Command 21: a protection-class change of a data container, answered from its
// completion (after the change, or when it fails).
#pragma once

#include <cstdint>

#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReply.h"

namespace vsl {

void handleSetDataProtection(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                             uint64_t* code);

}  // namespace vsl
