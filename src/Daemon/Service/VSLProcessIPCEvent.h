// The dispatcher: one message of one peer in, one reply out.
#pragma once

#include <functional>

#include "Daemon/Service/VSLClientIdentity.h"
#include "Daemon/Service/VSLCommandTable.h"
#include "Daemon/Service/VSLReply.h"
#include "Platform/Value.h"

namespace vsl {

// `send` carries the reply; null means the message expects none (the peer is then
// cancelled through `cancelPeer`).
void VSLProcessIPCEvent(const VSLPeerCredentials& peer, const Value& request, VSLReply::Sender send,
                        const std::function<void()>& cancelPeer);

// Runs the row's handler, then drains the message's command queue whatever the
// handler did (a row without a handler answers 49): deferred work queued before the
// handler, by the caller's entitlement registration, must not be lost. An exception
// becomes code 40 and drops the reply keys; internal builds abort instead.
void runCommandRow(const VSLCommandRow& row, const Value& request, const VSLReplyRef& reply,
                   const VSLClientConnectionRef& connection, uint64_t* code);

}  // namespace vsl
