// The container cache's side of the kernel sandbox: which containers are mirrored
// into the per-user state, pushing items, and reading them back for a lookup.
#include <cstring>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Platform/SandboxState.h"

namespace vsl {

namespace {

struct SandboxTarget {
    uint64_t itemType;
    uid_t uid;
};

// Bundle classes keep no item; classes outside 1..13 have none either. System items
// are filed under uid 0, per-user ones under the user's.
std::optional<SandboxTarget> sandboxTarget(const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass) {
    const auto& traits = containerClassTraits(containerClass);
    if (traits.sandboxItemType == 0) return std::nullopt;
    if (traits.owner != VSLContainerOwner::User || !userIdentity) return SandboxTarget{traits.sandboxItemType, 0};
    return SandboxTarget{traits.sandboxItemType, userIdentity->posixUIDForContainerClass(containerClass)};
}

int32_t personaIDOf(const VSLUserIdentityRef& userIdentity) {
    return userIdentity ? userIdentity->kernelPersonaID() : 0;
}

// The kernel compares identifiers as C strings of at most this many bytes.
constexpr size_t kKernelItemIdentifierLimit = 1024;

}  // namespace

bool VSLContainerCache::setSandboxContainerMappingForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                  const std::string& identifier,
                                                                  VSLContainerClass containerClass,
                                                                  const std::optional<std::string>& url) {
    if (isBundleContainerClass(containerClass)) return true;
    auto target = sandboxTarget(userIdentity, containerClass);
    if (!target) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Unsupported class for setting sandbox container mapping: %llu",
                 containerClass);
        return false;
    }
    const int32_t personaID = personaIDOf(userIdentity);
    const char* path = url ? url->c_str() : nullptr;
    if (int rc = SandboxState::setItem(target->uid, {target->itemType, personaID, identifier, std::nullopt})) {
        LogWrite(kLogLevelError, VSL_FUNCTION,
                 "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d",
                 target->uid, target->itemType, identifier, containerClass, path, rc);
        return false;
    }
    if (url) {
        if (int rc = SandboxState::setItem(target->uid, {target->itemType, personaID, identifier, *url})) {
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d",
                     target->uid, target->itemType, identifier, containerClass, path, rc);
            return false;
        }
    }
    osLog(LogCategory::Sandbox, OSLogLevel::Default,
          "Pushed user: %u, itemType: %llu, identifier %s, class: %llu, persona id: %d, path: %s", target->uid,
          target->itemType, identifier, containerClass, personaID, path);
    return true;
}

void VSLContainerCache::pushSandboxItems(const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass,
                                         const std::vector<VSLMetadataRef>& records) {
    auto target = sandboxTarget(userIdentity, containerClass);
    if (!target || records.empty()) return;
    // One write for the whole class: replacing an item is the same as removing and
    // setting it, and a rebuild after a restart finds most items already in place.
    const int32_t personaID = personaIDOf(userIdentity);
    std::vector<SandboxContainerItemChange> changes;
    changes.reserve(records.size());
    for (const auto& metadata : records)
        changes.push_back({target->itemType, personaID, metadata->identifier(), metadata->url()});
    int rc = SandboxState::setItems(target->uid, changes);
    for (const auto& change : changes) {
        if (rc != 0)
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Failed to set container mapping during create/lookup operation of %@, %llu", change.identifier,
                     containerClass);
        else
            osLog(LogCategory::Sandbox, OSLogLevel::Default,
                  "Pushed user: %u, itemType: %llu, identifier %s, class: %llu, persona id: %d, path: %s", target->uid,
                  target->itemType, change.identifier, containerClass, personaID, change.path);
    }
}

bool VSLContainerCache::shouldRegisterSandboxMappingWithUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     VSLContainerClass containerClass) {
    bool decision = false;
    bool multi = false;
    std::optional<std::string> parent;
    const bool enterprise = userIdentity && userIdentity->isEnterprise();
    switch (containerClassTraits(containerClass).family) {
    case VSLContainerFamily::Data: {
        if (isChildDataContainerClass(containerClass) && codeSigningMapping_)
            parent = codeSigningMapping_->parentIdentifierForChildIdentifier(identifier);
        const std::string& bundleIdentifier = parent ? *parent : identifier;
        VSLUserIdentitySet identities;
        if (userIdentityCache_) identities = userIdentityCache_->userIdentitiesForBundleIdentifier(bundleIdentifier);
        bool includesPersonal = false;
        for (const auto& identity : identities)
            if (identity && identity->personaType() == kVSLPersonaTypePersonal) includesPersonal = true;
        multi = identities.size() >= 2 && includesPersonal;
        decision = multi ? !enterprise : identities.count(userIdentity) > 0;
        break;
    }
    case VSLContainerFamily::Group: decision = true; break;
    default: decision = !enterprise; break;
    }
    osLog(LogCategory::Sandbox, OSLogLevel::Info,
          "Deciding to register userIdentity: %@, identifier: %@ (%@), containerClass: %llu with sandbox: %d because "
          "isMulti: %d",
          userIdentity ? userIdentity->shortDescription() : std::string("(null)"), identifier, parent, containerClass,
          decision, multi);
    return decision;
}

VSLMetadataRef VSLContainerCache::_lock_metadataFromSandboxForContainerIdentity(const VSLContainerIdentity& identity) {
    const VSLContainerClass containerClass = identity.containerClass();
    const VSLUserIdentityRef& userIdentity = identity.userIdentity();
    auto target = sandboxTarget(userIdentity, containerClass);
    if (!target) return nullptr;

    SignpostInterval signpost(LogCategory::Sandbox, "ReadFromSandbox", std::string());
    uint64_t count = 0;
    std::optional<std::string> candidate;
    int rc = SandboxState::iterateItems(target->uid, [&](const SandboxContainerItem& item) {
        count++;
        if (item.type != target->itemType) return;
        if (item.identifier.empty() || item.path.empty()) {
            osLog(LogCategory::Sandbox, OSLogLevel::Debug, "Skipping sandbox item without identifier or path");
            return;
        }
        if (containerClassTraits(containerClass).family == VSLContainerFamily::Group && item.personaID != personaIDOf(userIdentity)) return;
        if (std::strncmp(item.identifier.c_str(), identity.identifier().c_str(), kKernelItemIdentifierLimit) == 0)
            candidate = item.path;
    });
    if (rc != 0) {
        osLog(LogCategory::Sandbox, OSLogLevel::Error, "Failed to read back sandbox cache; result = %d", rc);
        return nullptr;
    }

    VSLMetadataRef found;
    if (candidate) {
        VSLErrorRef error;
        auto metadata = VSLMetadata::readAndValidateMetadataAtUrl(*candidate, userIdentity, true, &error,
                                                                  userIdentityCache_.get());
        if (!metadata) {
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Could not validate container from Sandbox-provided path [%@]; error = %@", *candidate, error);
        } else if (metadata->containerClass() != containerClass || metadata->identifier() != identity.identifier()) {
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Attempted to fetch container from Sandbox-provided path [%@] that was not what was expected; "
                     "expected class: %llu, expected identifier: [%@], actual class: %llu, actual identifier: [%@]",
                     *candidate, containerClass, identity.identifier(), metadata->containerClass(),
                     metadata->identifier());
        } else {
            osLog(LogCategory::Sandbox, OSLogLevel::Default, "Found %@ in the kernel sandbox's cache at [%@]",
                  identity.identifier(), *candidate);
            found = std::move(metadata);
        }
    }
    signpost.end(" count=%{private, signpost.description:attribute}llu  identifier=%{private, signpost.description:attribute}@ ",
                 count, found ? std::optional<std::string>(found->identifier()) : std::nullopt);
    return found;
}

}  // namespace vsl
