// Handlers of the container commands: createOrLookup (0), containersWithClass (1),
// stageContainerForDelete (3), deleteContainersOnDeathRow (4) and deleteContainer (10).
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

void handleCreateOrLookup(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                          uint64_t* code);
void handleContainersWithClass(const Value& request, const VSLReplyRef& reply,
                               const VSLClientConnectionRef& connection, uint64_t* code);
void handleDeleteContainer(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                           uint64_t* code);
// Four arrays of equal length, one container per index; the valid ones are staged in
// one queued command, an invalid one is skipped with its code kept.
void handleStageContainerForDelete(const Value& request, const VSLReplyRef& reply,
                                   const VSLClientConnectionRef& connection, uint64_t* code);
// deleteContainersOnDeathRow (4): answers from the completion, after destruction.
void handleDeleteContainersOnDeathRow(const Value& request, const VSLReplyRef& reply,
                                      const VSLClientConnectionRef& connection, uint64_t* code);
}  // namespace vsl
