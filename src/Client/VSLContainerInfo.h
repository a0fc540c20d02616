// libvessel calls for one existing container (info values, metadata, default
// structure, directory renaming, disk usage) and the test controls of internal builds.
// Each builds its request, sends it and returns the reply; `replyCode` reads
// "ReplyError" (0 when the daemon gave no reply).
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Client/VSLConnection.h"

namespace vsl::client {

// A concrete container: what the identity keys of a request name.
struct VSLContainerRef {
    std::string identifier;
    uint64_t containerClass = 0;
    Uuid uuid;
    std::optional<std::string> personaUniqueString;
};

// The request of a call, for tools that add keys of their own before sending.
Dictionary identityRequest(uint64_t command, const VSLContainerRef& container);

uint64_t replyCode(const VSLReply& reply);

// No value removes the key.
VSLReply setInfoValue(VSLConnection& connection, const VSLContainerRef& container, const std::string& key,
                      const std::optional<Value>& value);
// "ReplyInfoValue" holds the value; code 24 when the key has none.
VSLReply infoValueForKey(VSLConnection& connection, const VSLContainerRef& container, const std::string& key);
// "ReplyPath", "ReplyTransient", and "ReplyInfoDictionary" when asked for.
VSLReply metadata(VSLConnection& connection, const VSLContainerRef& container, bool infoDictionary);
VSLReply recreateDefaultStructure(VSLConnection& connection, const VSLContainerRef& container);
VSLReply regenerateDirectoryUUID(VSLConnection& connection, const VSLContainerRef& container);
// "ReplyDiskUsage" in bytes.
VSLReply diskUsage(VSLConnection& connection, const VSLContainerRef& container);

VSLReply setTestLock(VSLConnection& connection, uint64_t lock, bool enable);
VSLReply retryTest(VSLConnection& connection, uint64_t numRetryCrashes);

}  // namespace vsl::client
