// Handlers of the group commands: createOrLookupGroupContainers (13),
// groupContainerIdentifiers (14), systemContainerPath (15), systemGroupContainers (16)
// and systemGroupContainerPath (17).
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

// Application groups of an owner, created when missing; tokens and personas for
// sandboxed clients.
void handleCreateOrLookupGroupContainers(const Value& request, const VSLReplyRef& reply,
                                         const VSLClientConnectionRef& connection, uint64_t* code);
// The owner's application-group identifiers; creates nothing.
void handleGroupContainerIdentifiers(const Value& request, const VSLReplyRef& reply,
                                     const VSLClientConnectionRef& connection, uint64_t* code);
// A system container; a well-known one of another identifier needs no entitlement.
void handleSystemContainerPath(const Value& request, const VSLReplyRef& reply,
                               const VSLClientConnectionRef& connection, uint64_t* code);
void handleSystemGroupContainers(const Value& request, const VSLReplyRef& reply,
                                 const VSLClientConnectionRef& connection, uint64_t* code);
// One system group: the caller's entitled groups through its owner, else a
// well-known group; anything else is refused.
void handleSystemGroupContainerPath(const Value& request, const VSLReplyRef& reply,
                                    const VSLClientConnectionRef& connection, uint64_t* code);

}  // namespace vsl
