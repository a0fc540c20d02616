// The group containers of one owner, made or found as one set.
#include "Daemon/CodeSigning/VSLGroupManager.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kGroupsFn =
    "-[VSLClientConnection groupContainersForOwnerIdentifier:userIdentity:groupContainerClass:withError:]";

}  // namespace

std::optional<std::map<std::string, VSLMetadataRef>> VSLClientConnection::groupContainersForOwnerIdentifier(
    const std::string& ownerIdentifier, const VSLUserIdentityRef& userIdentity, VSLContainerClass groupContainerClass,
    uint64_t* code) {
    const std::string client = clientBundleIdentifier();
    bool allowed = ownerIdentifier == client || allowOtherIdLookup_ || unrestricted_ ||
                   isEntitledForLookupWithClass(groupContainerClass, ownerIdentifier) ||
                   VSLWhitelist::sharedWhitelist()->isLookupWhitelistedFromCodeSignIdentifier(
                       client, groupContainerClass, ownerIdentifier);
    if (!allowed) {
        LogWrite(kLogLevelError, kGroupsFn, "%@ not entitled to retrieve group container class %ld with identifier %@",
                 client, static_cast<long>(groupContainerClass), ownerIdentifier);
        if (code) *code = kVSLErrorNotEntitled;
        return std::nullopt;
    }
    // The groups are not the client's own identifiers.
    allowGroupIdLookup_ = true;

    std::map<std::string, VSLMetadataRef> groups;
    VSLErrorRef error;
    uint64_t queryCode = kVSLSuccess;
    bool ok = guardExceptions(kGroupsFn, __LINE__, &error, [&] {
        // One write lock over the whole set: the creations below take none of their own.
        VSLGlobalLockGuard lock;
        lock.write();
        auto identifiers = VSLGroupManager::defaultManager()->groupContainerIdentifiersForOwnerIdentifier(
            Value::string(ownerIdentifier), groupContainerClass, false, &queryCode);
        if (!identifiers) return false;
        for (const auto& group : *identifiers) {
            uint64_t groupCode = kVSLSuccess;
            auto identity =
                VSLContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group, groupContainerClass,
                                                                        &groupCode);
            VSLMetadataRef metadata =
                identity ? createOrLookupContainerWithContainerIdentity(identity, true, false, false, &groupCode)
                         : nullptr;
            if (metadata) {
                groups[group] = metadata;
            } else {
                LogWrite(kLogLevelError, kGroupsFn, "Failed to create or lookup group container: %@ : %llu",
                         identity, groupCode);
            }
        }
        return true;
    });
    if (!ok) {
        if (code) *code = error ? codeForError(error, kVSLErrorException) : queryCode;
        return std::nullopt;
    }
    return groups;
}

}  // namespace vsl
