// Content operations on paths that clients name: wiping a data container, staging
// shared content inside a system group container, and the user-managed assets
// directory of an application's data container. A client path is resolved once;
// only the resolved path is used, and what changes below a container is reached
// through descriptors that follow no link.
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLContentFileOperations.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

const char* const kWipeFn = "-[VSLClientConnection deleteDataContainerContentWithContainerIdentity:withError:]";
const char* const kStageFn =
    "-[VSLClientConnection stageSharedContentForIdentifier:sourceRelativePath:destRelativePath:withError:]";
const char* const kAssetsPathFn =
    "-[VSLClientConnection userManagedAssetsPathWithContainerIdentity:isRelative:createIfNecessary:existed:withError:]";
const char* const kDeleteAssetFn =
    "-[VSLClientConnection deleteUserManagedAssetWithContainerIdentity:relativePath:withError:]";
const char* const kAssetsParent = "Library";
const char* const kAssetsPrefix = "com.tarrow.UserManagedAssets.";

bool fail(uint64_t* code, const VSLErrorRef& error) {
    if (code) *code = codeForError(error, kVSLErrorException);
    return false;
}

bool hasParentComponent(const std::string& path) {
    for (size_t at = 0; at <= path.size();) {
        size_t end = std::min(path.find('/', at), path.size());
        if (path.compare(at, end - at, "..") == 0 && end - at == 2) return true;
        at = end + 1;
    }
    return false;
}

// The record as it is now, once the caller holds the container's lock: another
// request may have replaced it since it was first found.
VSLMetadataRef currentRecord(const VSLMetadataRef& found) {
    auto now = VSLContainerCache::sharedInstance()->containerForContainerIdentity(found->containerIdentity());
    return now ? now : found;
}

// A directory, not a link or anything else, at `name` below `parent`.
bool isDirectoryBelow(const std::string& parent, const std::string& name) {
    UniqueFd fd;
    return durable::openDirectoryNoFollow(joinPath(parent, name), fd.out()) == 0;
}

// An application's data container, for its assets directory.
VSLMetadataRef findDataContainer(const char* function, const VSLContainerIdentityRef& identity, VSLErrorRef* error) {
    VSLErrorRef underlying;
    auto found =
        VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, true, &underlying);
    if (!found)
        *error = createVSLError(function, __LINE__, kVSLErrorInvalidObject, underlying, true,
                                "Failed to create app data container for user managed assets path for %@: %@",
                                identity, underlying);
    return found;
}

}  // namespace

bool VSLClientConnection::deleteDataContainerContentWithContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                          uint64_t* code) {
    VSLErrorRef error;
    bool ok = guardExceptions(kWipeFn, __LINE__, &error, [&]() -> bool {
        if (!identity) {
            error = createVSLError(kWipeFn, __LINE__, kVSLErrorMissingIdentifier, nullptr, true,
                                   "Can't wipe container with nil identifier: %@", "(null)");
            return false;
        }
        const VSLContainerClass c = identity->containerClass();
        const std::string& identifier = identity->identifier();
        if (!isPerUserContainerClass(c)) {
            error = createVSLError(kWipeFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "Can't wipe container non-data container of type: %llu, identifier: %@", c,
                                   identifier);
            return false;
        }
        if (!unrestricted_) {
            if (c != kVSLClassPluginData) {
                error = createVSLError(kWipeFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                       "Can't wipe container with of type: %llu, identifier: %@", c, identifier);
                return false;
            }
            const auto& list = wipeIdentifiers_;
            if (!list || std::find(list->begin(), list->end(), identifier) == list->end()) {
                error = createVSLError(kWipeFn, __LINE__, kVSLErrorNotEntitled, nullptr, true,
                                       "Not entitled to wipe container with identifier: %@", identifier);
                return false;
            }
        }
        allowOtherIdLookup_ = true;
        uint64_t step = kVSLSuccess;
        auto existing = createOrLookupContainerWithContainerIdentity(identity, false, false, true, &step);
        if (!existing) {
            error = createVSLError(kWipeFn, __LINE__, step, nullptr, true,
                                   "Failed to lookup existing container to wipe-identifier: %@", identifier);
            return false;
        }
        auto fresh = createOrLookupContainerWithContainerIdentity(identity, true, true, true, &step);
        if (!fresh) {
            error = createVSLError(kWipeFn, __LINE__, step, nullptr, true,
                                   "Failed to create transient container for wipe-identifier: %@", identifier);
            return false;
        }
        replaceContainerIdentity(existing->containerIdentity(), fresh->containerIdentity(), true, true, &step);
        if (step != kVSLSuccess) {
            error = createVSLError(kWipeFn, __LINE__, step, nullptr, true,
                                   "Failed replace operation during delete all content");
            return false;
        }
        return true;
    });
    return ok || fail(code, error);
}

std::optional<std::string> VSLClientConnection::stageSharedContentForIdentifier(const Value& identifierValue,
                                                                                const Value& sourceValue,
                                                                                const Value& destValue,
                                                                                uint64_t* code) {
    std::optional<std::string> result;
    VSLErrorRef error;
    bool ok = guardExceptions(kStageFn, __LINE__, &error, [&]() -> bool {
        const auto* identifier = identifierValue.stringValue();
        const auto* source = sourceValue.stringValue();
        const auto* dest = destValue.stringValue();
        if (!identifier || !source || !dest) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "Can't act on invalid input: ID: %@, source: %@, dest: %@", identifierValue,
                                   sourceValue, destValue);
            return false;
        }
        if (hasParentComponent(*source) || hasParentComponent(*dest)) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                   "Paths can't contain dots. source: %@, dest: %@", *source, *dest);
            return false;
        }
        uint64_t step = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithIdentifier(*identifier, kVSLClassSystemGroup, &step);
        if (!identity) {
            error = createVSLError(kStageFn, __LINE__, step, nullptr, false);
            return false;
        }
        const std::string client = clientBundleIdentifier();
        auto mapping = VSLCodeSigningMapping::sharedInstance();
        auto groups = mapping && !client.empty() ? mapping->systemGroupIdentifiersForIdentifier(client) : std::nullopt;
        if (!groups || std::find(groups->begin(), groups->end(), *identifier) == groups->end()) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorNotEntitled, nullptr, true,
                                   "%@ not entitled for system group container %@", client, *identifier);
            return false;
        }
        VSLErrorRef underlying;
        auto found = VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, true,
                                                                                       &underlying);
        if (!found) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorNotFound, underlying, true,
                                   "System group container with identifier %@ not found: %@", *identifier, underlying);
            return false;
        }
        VSLIdentifierLockGuard lock({found->uuid().string()}, true);
        found = currentRecord(found);
        const std::string& base = found->url();
        const auto& fm = VSLFileManager::defaultManager();
        // The container itself is neither a source nor a destination: its ACLs are not
        // a stage's to reset.
        auto resolve = [&](const std::string& relative) -> std::optional<std::string> {
            auto real = fm.realPathForURL(joinPath(base, relative), base);
            auto realBase = fm._realPathForURL(base, false);
            if (real && realBase && *real == *realBase) return std::nullopt;
            return real;
        };
        auto from = resolve(*source);
        if (!from) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Invalid source URL %@ for %@ at %@", joinPath(base, *source), *identifier, base);
            return false;
        }
        auto to = resolve(*dest);
        if (!to) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Invalid dest URL %@ for %@ at %@", joinPath(base, *dest), *identifier, base);
            return false;
        }
        if (!fm.standardizeACLsAtURL(*from, false, &underlying)) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorSetACL, underlying, true,
                                   "Failed to standardize ACLs for %@ at %@: %@", *identifier, *from, underlying);
            return false;
        }
        if (!fm.moveItemAtURL(*from, *to, &underlying)) {
            error = createVSLError(kStageFn, __LINE__, kVSLErrorSharedContentMove, underlying, true,
                                   "Failed move for %@ from %@ to: %@: %@", *identifier, *from, *to, underlying);
            return false;
        }
        result = *to;
        return true;
    });
    if (!ok) fail(code, error);
    return ok ? result : std::nullopt;
}

std::optional<std::string> VSLClientConnection::userManagedAssetsPathWithContainerIdentity(
    const VSLContainerIdentityRef& identity, bool isRelative, bool createIfNecessary, bool* existed, uint64_t* code) {
    std::optional<std::string> result;
    VSLErrorRef error;
    bool ok = guardExceptions(kAssetsPathFn, __LINE__, &error, [&]() -> bool {
        if (!entitled_ && identity->identifier() != clientBundleIdentifier()) {
            error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                   "%@ trying to retrieve path for identifier: %@ without entitlement",
                                   clientBundleIdentifier(), identity->identifier());
            return false;
        }
        auto found = findDataContainer(kAssetsPathFn, identity, &error);
        if (!found) return false;
        if (found->url().empty()) {
            error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "No URL in container metadata object: %@", found);
            return false;
        }
        VSLIdentifierLockGuard lock({found->uuid().string()}, true);
        found = currentRecord(found);
        const std::string parent = joinPath(found->url(), kAssetsParent);
        std::optional<std::string> name = found->userManagedAssetsDirName();
        if (name && isDirectoryBelow(parent, *name)) {
            *existed = true;
        } else if (!createIfNecessary) {
            error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorUserManagedAssetsNotFound, nullptr, false,
                                   "User managed path for %@:%@ Not Found", identity->identifier(), found->url());
            return false;
        } else {
            name = makeUserManagedAssetsDirectory(parent, *found, &error);
            if (!name) return false;
            *existed = false;
        }
        result = isRelative ? std::string(kAssetsParent) + "/" + *name : joinPath(parent, *name);
        return true;
    });
    if (!ok) fail(code, error);
    return ok ? result : std::nullopt;
}

bool VSLClientConnection::deleteUserManagedAssetWithContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                      const std::optional<std::string>& relativePath,
                                                                      uint64_t* code) {
    VSLErrorRef error;
    bool ok = guardExceptions(kDeleteAssetFn, __LINE__, &error, [&]() -> bool {
        if (!identity || !relativePath) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "Can't act on invalid input: ID: %@, Path: %@",
                                   identity ? identity->identifier() : "(null)", relativePath.value_or("(null)"));
            return false;
        }
        auto found = findDataContainer(kDeleteAssetFn, identity, &error);
        if (!found) return false;
        VSLIdentifierLockGuard lock({found->uuid().string()}, true);
        found = currentRecord(found);
        if (found->url().empty() || !found->userManagedAssetsDirName()) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "No userManagedAssetsDirName or URL in container metadata object: %@", found);
            return false;
        }
        const std::string assets =
            joinPath(joinPath(found->url(), kAssetsParent), *found->userManagedAssetsDirName());
        const std::string target = relativePath->empty() ? assets : assets + "/" + *relativePath;
        auto ops = currentContentFileOperations();
        auto realAssets = ops.realPath(assets);
        // The directory itself must be where the container says: a link in its place
        // would make anything it points to look like an asset.
        auto realContainer = ops.realPath(found->url());
        if (realAssets && (!realContainer || *realAssets != joinPath(joinPath(*realContainer, kAssetsParent),
                                                                     *found->userManagedAssetsDirName())))
            realAssets.reset();
        if (!realAssets) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Unable to get realpath for resource %@", assets);
            return false;
        }
        auto realTarget = ops.realPath(target);
        if (!realTarget) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Unable to get realpath for resource %@", target);
            return false;
        }
        if (*realTarget == *realAssets) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Illegal attempt to delete user managed assets directory at %@", *realTarget);
            return false;
        }
        if (realTarget->compare(0, realAssets->size() + 1, *realAssets + "/") != 0 ||
            realTarget->size() <= realAssets->size() + 1) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                   "Illegal attempt to delete asset not residing in user managed assets directory %@",
                                   *realAssets);
            return false;
        }
        // Every step below the container is taken without following a link, so a
        // directory swapped for one after the check ends the removal.
        const std::string below = std::string(kAssetsParent) + "/" + *found->userManagedAssetsDirName() + "/" +
                                  realTarget->substr(realAssets->size() + 1);
        VSLErrorRef underlying;
        if (!ops.removeItemBelowDirectory(*realContainer, below, &underlying)) {
            error = createVSLError(kDeleteAssetFn, __LINE__, kVSLErrorMoveToDeathRow, underlying, true,
                                   "Failed to remove asset at %@", *realTarget);
            return false;
        }
        return true;
    });
    return ok || fail(code, error);
}

// With the container's write lock held. The directory is made in the parent reached
// without following links, and its mode and owner are set through its descriptor.
std::optional<std::string> VSLClientConnection::makeUserManagedAssetsDirectory(const std::string& parent,
                                                                               const VSLMetadata& container,
                                                                               VSLErrorRef* error) {
    const auto& fm = VSLFileManager::defaultManager();
    VSLErrorRef underlying;
    UniqueFd parentFd;
    std::optional<std::string> made;
    if (int rc = durable::openDirectoryNoFollow(parent, parentFd.out()))
        underlying = createPOSIXError(kAssetsPathFn, __LINE__, rc, "opendir of %s failed: %s", parent,
                                      std::strerror(rc));
    else
        made = fm.createTemporaryDirectoryInDirectoryURL(durable::descriptorPath(parentFd.get()), kAssetsPrefix,
                                                         &underlying);
    if (!made) {
        *error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorCreateSubdirectory, underlying, true,
                                "Failed to create user managed assets dir at %@: %@", parent, underlying);
        return std::nullopt;
    }
    const std::string name = lastPathComponent(*made);
    const std::string path = joinPath(parent, name);
    bool done = false;
    UniqueFd dir(::openat(parentFd.get(), name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    int rc = dir.valid() ? durable::changeModeOfNode(dir.get(), path, 0755) : errno;
    if (rc) {
        *error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorCreateSubdirectory, nullptr, true,
                                "Failed to chmod user managed assets dir at %@: %s", path, std::strerror(rc));
    } else if (const auto& user = container.userIdentity(); !user) {
        *error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorCreateSubdirectory, nullptr, true,
                                "Failed to chown user managed assets dir at %@: %s", path, "no user identity");
    } else if ((rc = durable::changeOwnerOfNode(dir.get(), path,
                                                user->posixUIDForContainerClass(container.containerClass()),
                                                user->posixGIDForContainerClass(container.containerClass())))) {
        *error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorCreateSubdirectory, nullptr, true,
                                "Failed to chown user managed assets dir at %@: %s", path, std::strerror(rc));
    } else {
        auto changed = container.mutableCopy();
        changed->setUserManagedAssetsDirName(name);
        if (!changed->writeMetadataToDiskWithError(error)) {
            // the writer's error passes through
        } else if (!VSLContainerCache::sharedInstance()->addContainerMetadata(changed, changed->url(),
                                                                              changed->transient(), false,
                                                                              &underlying)) {
            *error = createVSLError(kAssetsPathFn, __LINE__, kVSLErrorCacheAdd, underlying, true,
                                    "Failed to add to cache: %@, url: %@, transient: %d", changed, changed->url(),
                                    changed->transient());
        } else {
            done = true;
        }
    }
    if (!done) {
        // Nobody knows its name: leave nothing behind.
        VSLErrorRef cleanUp;
        fm.removeItemBelowDirectoryAtURL(parent, name, &cleanUp);
        return std::nullopt;
    }
    return name;
}

}  // namespace vsl
