// Create, look up, list and delete containers on behalf of one client.
#include <cerrno>
#include <cstring>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Concurrency/VSLDataProtectionManager.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLInjectedFaults.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLContainerSkeleton.h"
#include "Daemon/Service/VSLReply.h"
#include "Daemon/Storage/VSLMetadata.h"
#include <algorithm>
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/LogFields.h"
#include "Platform/SandboxExtension.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

const char* const kCreateFn =
    "-[VSLClientConnection createOrLookupContainerWithContainerIdentity:createIfNecessary:transient:useLocking:withError:]";

bool isNotFound(const VSLErrorRef& e) { return errorHasCode(e, kVSLErrorNotFound); }

// The cache shares its records between requests: "existed" belongs to this call only.
VSLMetadataRef foundRecord(const VSLMetadataRef& cached) {
    auto copy = cached->mutableCopy();
    copy->setExisted(true);
    return copy;
}

// ENOENT for a missing skeleton entry, 0 for one that exists as anything (a link or
// a file included: left alone, never followed), else the failure.
int skeletonEntryState(const std::string& dir) {
    UniqueFd fd;
    int rc = durable::openDirectoryNoFollow(dir, fd.out());
    return rc == ELOOP || rc == ENOTDIR ? 0 : rc;
}

}  // namespace

bool VSLClientConnection::_createTopLevelContainerDirectory(const std::string& url, VSLContainerClass containerClass,
                                                            uid_t owner, VSLErrorRef* error) {
    return VSLFileManager::defaultManager().createDirectoryAtURL(
        url, true, 0755, containerOwnerIDForClass(containerClass, owner), static_cast<VSLDataProtectionClass>(0), error);
}

int32_t VSLClientConnection::_dataProtectionClassForContainerMetadata(const VSLMetadata& metadata) {
    if (containerClassTraits(metadata.containerClass()).skeletonProtection != VSLSkeletonProtection::Container)
        return 0;
    if (metadata.info()) {
        const Value* v = metadata.info()->find("com.tarrow.Stowage.ContentProtectionClass");
        if (v && v->signedNumber()) return static_cast<int32_t>(*v->signedNumber());
    }
    return VSLDataProtectionManager::defaultManager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        metadata.identifier());
}

bool VSLClientConnection::_createSubDirectories(const std::string& url, const VSLMetadata& metadata,
                                                VSLErrorRef* error, bool onlyMissing) {
    VSLContainerClass c = metadata.containerClass();
    const auto& user = metadata.userIdentity();
    const auto [owner, mode] = skeletonOwnershipForClass(c, user ? user->posixUIDForContainerClass(c) : 0);
    uint64_t listCode = 1;
    auto names = subdirectoriesForContainerClass(c, &listCode);
    if (!names) {
        if (error)
            *error = VSL_ERROR(listCode, nullptr, true, "Failed to get subdirectory names for %llu : %llu", c, listCode);
        return false;
    }
    int32_t protection = _dataProtectionClassForContainerMetadata(metadata);
    LogWrite(kLogLevelDebug, "-[VSLClientConnection _createSubDirectories:containerMetadata:error:]",
             "Creating subdirectories for [%llu:%@] at [%@]", c, metadata.identifier(), url);
    auto excluded = VSLGlobalConfiguration::excludedFromAppUserData();
    for (const auto& name : *names) {
        std::string dir = joinPath(url, name);
        if (onlyMissing) {
            int rc = skeletonEntryState(dir);
            if (rc != ENOENT && rc != 0) {
                if (error) *error = VSL_POSIX_ERROR(rc, "Failed to open %@: %s", dir, std::strerror(rc));
                return false;
            }
            if (rc == 0) continue;
        }
        int32_t cls = protection;
        if (isPerUserContainerClass(c) && std::find(excluded.begin(), excluded.end(), name) != excluded.end()) cls = 0;
        VSLErrorRef underlying;
        if (!VSLFileManager::defaultManager().createDirectoryAtURL(dir, true, mode, owner,
                                                                   static_cast<VSLDataProtectionClass>(cls),
                                                                   &underlying)) {
            if (error)
                *error = VSL_ERROR(kVSLErrorCreateSubdirectory, underlying, true,
                                   "Failed to create sub-dir for %@ at %@ (protClass: %d)", metadata.identifier(), dir,
                                   cls);
            return false;
        }
    }
    return true;
}

bool VSLClientConnection::mayAccess(const VSLContainerIdentity& identity, uint64_t* code) {
    const std::string& identifier = identity.identifier();
    VSLContainerClass c = identity.containerClass();
    std::string client = clientBundleIdentifier();
    auto whitelist = VSLWhitelist::sharedWhitelist();
    bool allowed = identifier == client || allowOtherIdLookup_ ||
                   (isGroupContainerClass(c) && allowGroupIdLookup_) || unrestricted_ ||
                   isEntitledForLookupWithClass(c, identifier) ||
                   whitelist->isLookupWhitelistedFromCodeSignIdentifier(client, c, identifier);
    if (!allowed) {
        auto e = VSL_ERROR(kVSLErrorNotEntitled, nullptr, true,
                           "%@ not entitled to retrieve container class %ld with identifier %@", client, c, identifier);
        *code = kVSLErrorNotEntitled;
        return false;
    }
    if (c == kVSLClassSystemData && !allowOtherIdLookup_ && !unrestricted_ &&
        !isEntitledForLookupWithClass(c, identifier)) {
        bool ok = whitelist->isLookupWhitelistedFromCodeSignIdentifier(client, c, identifier) ||
                  (identifier == client && VSLCodeSigningMapping::sharedInstance()->identifierHasSystemContainer(identifier));
        if (!ok) {
            VSL_ERROR(kVSLErrorNotEntitled, nullptr, true, "%@ not entitled for system container with identifier %@",
                      client, identifier);
            *code = kVSLErrorNotEntitled;
            return false;
        }
    }
    return true;
}

VSLMetadataRef VSLClientConnection::createOrLookupContainerWithContainerIdentity(
    const VSLContainerIdentityRef& identity, bool createIfNecessary, bool transient, bool useLocking, uint64_t* code) {
    VSLMetadataRef result;
    VSLErrorRef error;
    LogFieldScope identifierField(kLogFieldContainerIdentifier, identity ? identity->identifier() : std::string_view());
    bool ok = guardExceptions(kCreateFn, __LINE__, &error, [&]() -> bool {
        osLog(LogCategory::Unspecified, OSLogLevel::Debug,
              "createOrLookup; identity: %@, createIfNecessary: %d, transient: %d, allowOtherIdLookup: %d, "
              "unrestricted: %d, clientBundleIdentifier: %@",
              identity, createIfNecessary, transient, allowOtherIdLookup_, unrestricted_, clientBundleIdentifier());
        if (!identity) {
            error = createVSLError(kCreateFn, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                   "Cannot lookup a nil container identity.");
            return false;
        }
        uint64_t accessCode = 1;
        if (!mayAccess(*identity, &accessCode)) {
            error = createVSLError(kCreateFn, __LINE__, accessCode, nullptr, false);
            return false;
        }
        auto cache = VSLContainerCache::sharedInstance();
        bool allowKernelLookup = !(clientIdentity_ && clientIdentity_->kernel());
        VSLGlobalLockGuard lock(useLocking);

        if (!transient) {
            lock.read();
            VSLErrorRef lookupError;
            auto found = cache->containerForContainerIdentity(identity, false, true, allowKernelLookup, &lookupError);
            lock.release();
            if (found) {
                result = foundRecord(found);
                return true;
            }
            if (!isNotFound(lookupError)) {
                error = lookupError;
                return false;
            }
        }
        if (!createIfNecessary) {
            error = createVSLError(kCreateFn, __LINE__, kVSLErrorNotFound, nullptr, false,
                                   "Container with identifier: \"%@\" Not Found", identity->identifier());
            return false;
        }

        lock.write();
        VSLErrorRef secondError;
        auto raced = cache->containerForContainerIdentity(identity, transient, true, allowKernelLookup, &secondError);
        if (raced && !transient) {
            result = foundRecord(raced);
            return true;
        }
        if (raced) {
            VSLErrorRef moveError;
            if (!_moveItemAtURLToDeathRow(raced->url(), true, true, &moveError)) {
                error = createVSLError(kCreateFn, __LINE__, kVSLErrorRemoveTransient, moveError, true,
                                       "Failed to remove transient container at %@", raced->url());
                return false;
            }
        } else if (!isNotFound(secondError)) {
            error = secondError;
            return false;
        }
        result = createContainer(identity, transient, &error);
        return result != nullptr;
    });
    if (!ok) {
        if (code) *code = codeForError(error, kVSLErrorException);
        return nullptr;
    }
    return result;
}

// Under the global write lock (or the caller's): builds the container in staging and
// moves it into place in one rename.
VSLMetadataRef VSLClientConnection::createContainer(const VSLContainerIdentityRef& identity, bool transient,
                                                    VSLErrorRef* error) {
    auto& fm = VSLFileManager::defaultManager();
    auto configuration = VSLGlobalConfiguration::sharedInstance();
    VSLContainerClass c = identity->containerClass();
    const auto& user = identity->userIdentity();

    Uuid directoryUUID = Uuid::random();
    std::string directoryName = directoryUUID.string();
    osLog(LogCategory::Lifecycle, OSLogLevel::Default,
          "CreatingContainer  uuid=%{private, signpost.description:attribute}@  identifier=%{private, "
          "signpost.description:attribute}@  class=%{public, signpost.description:attribute}llu ",
          directoryName, identity->identifier(), c);

    auto stagingBase = configuration->stagingDirectoryURLForUserIdentity(user, c);
    std::string staging = joinPath(stagingBase.value_or(configuration->stagingDirectory()), directoryName);
    VSLErrorRef underlying;
    if (!_createTopLevelContainerDirectory(staging, c, user->posixUIDForContainerClass(c), &underlying)) {
        *error = VSL_ERROR(kVSLErrorCreateStagingDir, underlying, true, "Failed to create staging dir at %@ : %@",
                           staging, underlying);
        return nullptr;
    }

    // From here on a failure sends the staging directory to death row.
    const char* const writer = VSL_FUNCTION;
    auto cleanUp = [&](VSLErrorRef failure) -> VSLMetadataRef {
        VSLErrorRef moveError;
        if (!_moveItemAtURLToDeathRow(staging, true, true, &moveError))
            failure = createVSLError(writer, __LINE__, kVSLErrorRemoveStagingDir, moveError, true,
                                     "Failed to remove staging dir: %@", staging);
        *error = failure;
        return nullptr;
    };

    uint64_t idCode = 1;
    auto concrete = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), user,
                                                                            identity->identifier(), c, &idCode);
    if (!concrete) return cleanUp(createVSLError(kCreateFn, __LINE__, idCode, nullptr, false));
    const std::string uuidText = concrete->uuid().string();
    LogFieldScope uuidField(kLogFieldContainerUUID, uuidText);
    auto metadata = VSLMetadata::initWithContainerIdentity(concrete, std::nullopt, staging, std::nullopt);
    // Fails as a metadata write that cannot reach the disk does, logged where it is made.
    if (creationFailureInjectedFor(identity->identifier()))
        return cleanUp(VSL_ERROR(kVSLErrorWriteFile, VSL_POSIX_ERROR(EIO, "Injected failure"), true,
                                 "Failed to write metadata for %@", identity->identifier()));
    if (!metadata->writeMetadataToDiskWithError(&underlying)) return cleanUp(underlying);
    if (isSystemContainerClass(c) && !fm.setTopLevelSystemContainerACLAtURL(staging, &underlying))
        return cleanUp(underlying);
    if (!_createSubDirectories(staging, *metadata, &underlying)) return cleanUp(underlying);

    auto whitelist = VSLWhitelist::sharedWhitelist();
    std::optional<std::string> wellKnown;
    if (c == kVSLClassSystemGroup) wellKnown = whitelist->wellknownSystemGroupContainerForId(identity->identifier());
    if (c == kVSLClassSystemData) wellKnown = whitelist->wellknownSystemContainerForId(identity->identifier());
    auto classDirectory = configuration->containerDirectoryURLForUserIdentity(user, c, transient);
    if (!classDirectory) return cleanUp(VSL_ERROR(kVSLErrorUnexpectedClass, nullptr, true,
                                                  "Passed an unexpected container type: %llu", c));
    std::string live = joinPath(*classDirectory, wellKnown.value_or(directoryName));
    VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kCreateGate);
    if (!fm.moveItemAtURL(staging, live, &underlying))
        return cleanUp(VSL_ERROR(kVSLErrorMoveStagingDir, underlying, true,
                                 "Failed to move staging dir: %@ to live dir: %@", staging, live));

    if (deviceFacts().featureEnabled("fast_container_sizing")) fm.fastDiskUsageForURL(live);
    metadata->setUrl(live);
    metadata->setExisted(false);
    metadata->setTransient(transient);
    if (!VSLContainerCache::sharedInstance()->addContainerMetadata(metadata, live, transient, true, &underlying)) {
        *error = VSL_ERROR(kVSLErrorCacheAdd, underlying, true, "Failed to add to cache : %@, url: %@, transient: %d",
                           metadata, live, transient);
        return nullptr;
    }
    return metadata;
}

std::optional<std::vector<VSLMetadataRef>> VSLClientConnection::containersWithClass(VSLContainerClass containerClass,
                                                                                   bool transient, uint64_t* code) {
    if (!isValidContainerClass(containerClass)) {
        VSL_ERROR(kVSLErrorInvalidObject, nullptr, true, "Can't act on an invalid container class: %ld", containerClass);
        if (code) *code = kVSLErrorInvalidObject;
        return std::nullopt;
    }
    VSLErrorRef error;
    VSLGlobalLockGuard lock(true);
    lock.read();
    auto all = VSLContainerCache::sharedInstance()->allContainersForUserIdentity(
        clientIdentity_ ? clientIdentity_->userIdentity() : nullptr, containerClass, transient, true, &error);
    lock.release();
    if (!all && code) *code = codeForError(error, kVSLErrorCacheRebuild);
    return all;
}

bool VSLClientConnection::deleteContainerWithContainerIdentity(const VSLContainerIdentityRef& identity, bool transient,
                                                               uint64_t* code) {
    uint64_t lookupCode = 1;
    auto found = createOrLookupContainerWithContainerIdentity(identity, false, transient, true, &lookupCode);
    if (!found) {
        LogWrite(kLogLevelError, "-[VSLClientConnection deleteContainerWithContainerIdentity:transient:withError:]",
                 "Failed to lookup existing container to delete-identity: %@, transient: %d", identity, transient);
        if (code) *code = lookupCode;
        return false;
    }
    auto concrete = found->containerIdentity();
    commandQueue_->insertCommand(VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {concrete}, true, nullptr));
    return true;
}

void issueSandboxExtension(VSLReply& reply, const char* replyKey, const VSLMetadata& metadata,
                           const VSLClientIdentityRef& client) {
    if (auto token = sandboxExtensionForContainer(metadata, client)) reply.set(replyKey, Value::string(*token));
}

std::optional<std::string> sandboxExtensionForContainer(const VSLMetadata& metadata,
                                                        const VSLClientIdentityRef& client) {
    if (!client || !client->sandboxed()) return std::nullopt;
    VSLContainerClass c = metadata.containerClass();
    const char* extensionClass = containerClassTraits(c).sandboxExtensionClass;
    bool enterprise = metadata.userIdentity() && metadata.userIdentity()->isEnterprise();
    if (!enterprise || !extensionClass) {
        osLog(LogCategory::Sandbox, OSLogLevel::Info,
              "%@ is sandboxed and container (type: %llu) is enterprise: %d. NOT issuing token for path: %s",
              client->bundleIdentifier(), c, enterprise, metadata.url());
        return std::nullopt;
    }
    osLog(LogCategory::Sandbox, OSLogLevel::Default,
          "%@ is sandboxed and container (type: %llu) is enterprise: %d. Issuing token for path: %s",
          client->bundleIdentifier(), c, enterprise, metadata.url());
    auto token = issueSandboxFileExtension(extensionClass, metadata.url(), client->auditToken());
    if (!token) {
        LogWrite(kLogLevelError, "issueSandboxExtension", "sandbox_extension_issue_file failed for %@ at path %s: %d",
                 client->bundleIdentifier(), metadata.url(), errno);
        return std::nullopt;
    }
    return token;
}

}  // namespace vsl
