// Client commands 18 (processCodeSigningInfo), 19 (getCodeSigningInfo) and 20
// (invalidateCodeSigningInfo): thin handlers over the code-signing mapping.
#pragma once

#include <cstdint>

#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReply.h"
#include "Platform/Value.h"

namespace vsl {

// "CodeSigningInfo" (dictionary; absent removes the entry), "Identifier",
// "OptionsDictionary"; the code is the operation's result.
void processCodeSigningInfoCommand(const Value& request, const VSLReplyRef& reply,
                                   const VSLClientConnectionRef& connection, uint64_t* code);
// "Identifier" -> "ReplyInfoDictionary"; code 21 when there is nothing to give.
void getCodeSigningInfoCommand(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                               uint64_t* code);
// Invalidates entries whose bundle container is gone; the code is the result.
void invalidateCodeSigningInfoCommand(const Value& request, const VSLReplyRef& reply,
                                      const VSLClientConnectionRef& connection, uint64_t* code);

}  // namespace vsl
