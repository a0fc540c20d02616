// Shared by the cache tests: one system root for the whole binary (the default user
// identity is made once per process and must keep pointing into it), emptied before
// each test; identity caches with and without personas; containers made on disk.
#pragma once

#include <memory>
#include <string>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Support/TempRoot.h"

namespace vsl::test {

TempRoot& cacheTestRoot();
// Empties the containers, the daemon's directories and run/ of the shared root and
// starts the global configuration afresh.
void resetCacheTestRoot();

std::shared_ptr<VSLUserIdentityCache> identityCacheWithoutPersonas();
std::shared_ptr<VSLUserIdentityCache> identityCacheWithPersonas(const PersonaAttributesList& personas);

// The class directory (created) of that user identity and class.
std::string classDirectory(const VSLUserIdentityRef& user, VSLContainerClass containerClass, bool transient = false);
// A new directory named by a fresh UUID in the class directory, with its metadata
// file written by VSLMetadata.
VSLMetadataRef makeContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass,
                             const std::string& identifier, bool transient = false);
std::string metadataPathOf(const std::string& containerDirectory);

void writeBytes(const std::string& path, const std::string& bytes);
std::string binaryPlist(const Value& value);

}  // namespace vsl::test
