// libvessel calls for the data-migration service; both need
// "com.tarrow.private.Vesselry.dataMigration". `replyCode` (VSLContainerInfo.h) reads
// the result.
#pragma once

#include "Client/VSLConnection.h"

namespace vsl::client {

// System containers' ACLs, bundle ownership, the legacy code-signing imports.
VSLReply performDataMigration(VSLConnection& connection);
// Skeletons of every user's containers, protection classes, retired containers.
VSLReply performPerUserDataMigration(VSLConnection& connection);

}  // namespace vsl::client
