// libvessel calls for group and system containers. An owner or identifier left out
// is the caller's own. Each returns the reply; `replyCode` (VSLContainerInfo.h)
// reads its result.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Client/VSLConnection.h"

namespace vsl::client {

// "ReplyGroupContainerDict" (group -> path); for a sandboxed caller also
// "ReplySandboxTokenDict" and "ReplyPersonaUniqueStringDict" when not empty.
VSLReply createOrLookupGroupContainers(VSLConnection& connection,
                                       const std::optional<std::string>& owner = std::nullopt);
// "ReplyGroupIdentifiersArray"; creates nothing.
VSLReply groupContainerIdentifiers(VSLConnection& connection, const std::optional<std::string>& owner = std::nullopt);
// "ReplyPath" of the system container.
VSLReply systemContainerPath(VSLConnection& connection, const std::optional<std::string>& identifier = std::nullopt);
// "ReplyGroupContainerDict" of the owner's system groups.
VSLReply systemGroupContainers(VSLConnection& connection, const std::optional<std::string>& owner = std::nullopt);
// "ReplyPath" of one system group.
VSLReply systemGroupContainerPath(VSLConnection& connection, const std::string& groupIdentifier,
                                  const std::optional<std::string>& owner = std::nullopt);

// The string entries of a reply dictionary (paths, tokens or persona strings by group).
std::map<std::string, std::string> groupStrings(const VSLReply& reply, const char* key);
// "ReplyGroupIdentifiersArray" as strings.
std::vector<std::string> groupIdentifiers(const VSLReply& reply);

}  // namespace vsl::client
