// Handlers of the container commands: createOrLookup (0), containersWithClass (1)
// and deleteContainer (10).
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

void handleCreateOrLookup(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                          uint64_t* code);
void handleContainersWithClass(const Value& request, const VSLReplyRef& reply,
                               const VSLClientConnectionRef& connection, uint64_t* code);
void handleDeleteContainer(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                           uint64_t* code);

}  // namespace vsl

namespace vsl {
// deleteContainersOnDeathRow (4): answers from the completion, after destruction.
void handleDeleteContainersOnDeathRow(const Value& request, const VSLReplyRef& reply,
                                      const VSLClientConnectionRef& connection, uint64_t* code);
}  // namespace vsl
