#include "Daemon/CodeSigning/VSLGroupManager.h"

#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kOwnerQueryFn =
    "-[VSLGroupManager groupContainerIdentifiersForOwnerIdentifier:groupContainerClass:useLocking:withError:]";

bool hasHome(const VSLUserIdentityRef& user) {
    auto perUser = VSLGlobalConfiguration::sharedInstance()->getPerUserConfigurationForUserIdentity(user);
    return perUser && perUser->existsUserBaseDirectory();
}

}  // namespace

const std::shared_ptr<VSLGroupManager>& VSLGroupManager::defaultManager() {
    static const std::shared_ptr<VSLGroupManager> manager =
        std::make_shared<VSLGroupManager>(VSLUserIdentitySharedCache::sharedInstance());
    return manager;
}

VSLGroupManager::VSLGroupManager(std::shared_ptr<VSLUserIdentityCache> userIdentityCache)
    : userIdentityCache_(std::move(userIdentityCache)) {}

std::optional<std::vector<std::string>> VSLGroupManager::groupContainerIdentifiersForOwnerIdentifier(
    const Value& ownerIdentifier, VSLContainerClass groupContainerClass, bool useLocking, uint64_t* code) {
    const std::string* owner = ownerIdentifier.stringValue();
    if (!owner) {
        LogWrite(kLogLevelError, kOwnerQueryFn, "Can't act on an invalid object: ID: %@", ownerIdentifier);
        if (code) *code = kVSLErrorInvalidObject;
        return std::nullopt;
    }
    std::optional<std::vector<std::string>> result;
    VSLErrorRef error;
    bool ok = guardExceptions(kOwnerQueryFn, __LINE__, &error, [&] {
        VSLGlobalLockGuard lock(useLocking);
        lock.write();
        auto mapping = VSLCodeSigningMapping::sharedInstance();
        std::optional<std::vector<std::string>> groups;
        if (mapping) {
            groups = containerClassTraits(groupContainerClass).groupType == kVSLGroupTypeSystem
                         ? mapping->systemGroupIdentifiersForIdentifier(*owner)
                         : mapping->appGroupIdentifiersForIdentifier(*owner);
        }
        result = groups.value_or(std::vector<std::string>{});
        return true;
    });
    if (!ok) {
        if (code) *code = codeForError(error, kVSLErrorException);
        return std::nullopt;
    }
    return result;
}

void VSLGroupManager::reconcileGroupContainersOfType(VSLGroupType type,
                                                     const std::shared_ptr<VSLCommandQueue>& commandQueue,
                                                     bool useLocking) {
    VSLGlobalLockGuard lock(useLocking);
    lock.write();
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    if (!mapping) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
              "Failed to get reference count information for group type: %ld", static_cast<long>(type));
        return;
    }
    const VSLCountedSet counts = mapping->copyReferenceCountSetOfType(type);
    const VSLContainerClass containerClass = groupContainerClassForType(type);
    if (containerClassTraits(containerClass).groupScope == VSLGroupScope::Device) {
        _cleanupUnreferencedGroupContainersForUserIdentity(VSLUserIdentityCache::defaultUserIdentity(), containerClass,
                                                           counts, commandQueue);
        return;
    }
    userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        if (hasHome(user))
            _cleanupUnreferencedGroupContainersForUserIdentity(user, containerClass, counts, commandQueue);
    });
}

void VSLGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(
    const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass, const VSLCountedSet& referenceCounts,
    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    VSLErrorRef error;
    auto containers =
        VSLContainerCache::sharedInstance()->allContainersForUserIdentity(userIdentity, containerClass, false, &error);
    if (!containers) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to fetch group container list for %@: %@",
              userIdentity, error);
        return;
    }
    for (const auto& container : *containers) {
        const std::string& group = container->identifier();
        auto counted = referenceCounts.find(group);
        if (counted != referenceCounts.end() && counted->second > 0) continue;
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Removing group container %@ for %@ at %@", group,
              userIdentity, container->url());
        if (!commandQueue) continue;
        // With locking: the queue is drained after the caller's write lock is released.
        commandQueue->insertCommand(VSLCommandStageForDelete::commandForStageForDeleteOfUnreferencedGroups(
            {container->containerIdentity()}, true, [group, userIdentity](uint64_t failure) {
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                      "Failed to destroy group container with identifier %@ for %@: %llu", group, userIdentity,
                      failure);
            }));
    }
}

}  // namespace vsl
