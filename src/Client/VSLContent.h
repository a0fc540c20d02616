// libvessel calls for the content of containers: wiping a data container, staging
// shared content inside a system group container, and the user-managed assets
// directory of an application. Each builds its request, sends it and returns the
// reply; `replyCode` (VSLContainerInfo.h) reads "ReplyError".
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Client/VSLConnection.h"

namespace vsl::client {

// wipeContainer: a plug-in data container named in the caller's wipe list.
VSLReply wipeContainer(VSLConnection& connection, const std::string& identifier);
// deleteContainerContent: any data container of the class.
VSLReply deleteContainerContent(VSLConnection& connection, const std::string& identifier, uint64_t containerClass);
// "ReplyPath": where the content went. Both paths are relative to the container.
VSLReply stageSharedContent(VSLConnection& connection, const std::string& systemGroupIdentifier,
                            const std::string& sourcePath, const std::string& destPath);
// "ReplyPath" ("Library/..." when relative) and "ReplyExisted"; code 71 when there is
// none and creation was not asked for. No identifier: the caller's own.
VSLReply userManagedAssetsPath(VSLConnection& connection, const std::optional<std::string>& identifier,
                               bool isRelative, bool createIfNecessary);
// `relativePath` is relative to the assets directory.
VSLReply deleteUserManagedAsset(VSLConnection& connection, const std::string& identifier,
                                const std::string& relativePath);

}  // namespace vsl::client
