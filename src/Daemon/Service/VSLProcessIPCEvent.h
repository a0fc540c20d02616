// The dispatcher: one message of one peer in, one reply out.
#pragma once

#include <functional>

#include "Daemon/Service/VSLClientIdentity.h"
#include "Daemon/Service/VSLReply.h"
#include "Platform/Value.h"

namespace vsl {

// `send` carries the reply; null means the message expects none (the peer is then
// cancelled through `cancelPeer`).
void VSLProcessIPCEvent(const VSLPeerCredentials& peer, const Value& request, VSLReply::Sender send,
                        const std::function<void()>& cancelPeer);

}  // namespace vsl
