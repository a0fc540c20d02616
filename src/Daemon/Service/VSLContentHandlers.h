// Handlers of the commands that act on paths inside a container: wipeContainer (11),
// deleteContainerContent (12), stageSharedContent (26), userManagedAssetsPath (28)
// and deleteUserManagedAsset (29).
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

void handleWipeContainer(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                         uint64_t* code);
// Makes the connection unrestricted first: the entitlement of this command is the
// right to wipe any data container.
void handleDeleteContainerContent(const Value& request, const VSLReplyRef& reply,
                                  const VSLClientConnectionRef& connection, uint64_t* code);
void handleStageSharedContent(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                              uint64_t* code);
void handleUserManagedAssetsPath(const Value& request, const VSLReplyRef& reply,
                                 const VSLClientConnectionRef& connection, uint64_t* code);
void handleDeleteUserManagedAsset(const Value& request, const VSLReplyRef& reply,
                                  const VSLClientConnectionRef& connection, uint64_t* code);

}  // namespace vsl
