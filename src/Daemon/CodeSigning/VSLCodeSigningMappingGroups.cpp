// Group identifiers from entitlements, and the incremental reference counting that
// stages a group container once no stored identifier names its group any more.
#include <algorithm>
#include <set>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kSystemGroupPrefix = "systemgroup.";

}  // namespace

std::optional<std::vector<std::string>> VSLCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(
    const std::string& identifier, const Value* entitlements, const char* groupKey) {
    const Value* value = entitlements ? entitlements->find(groupKey) : nullptr;
    if (!value || value->isNull()) return std::nullopt;
    std::vector<std::string> groups;
    bool supported = true;
    if (const std::string* s = value->stringValue()) {
        groups.push_back(*s);
    } else if (const Array* items = value->arrayValue()) {
        for (const Value& item : *items) {
            if (!item.stringValue()) {
                supported = false;
                break;
            }
            groups.push_back(*item.stringValue());
        }
    } else {
        supported = false;
    }
    if (!supported) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
              "Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey, identifier);
        return std::nullopt;
    }
    std::set<std::string> seen;
    std::vector<std::string> unique;
    for (auto& g : groups)
        if (seen.insert(g).second) unique.push_back(std::move(g));
    return unique;
}

std::optional<std::vector<std::string>> VSLCodeSigningMapping::_systemGroupIdentifiersForIdentifier(
    const std::string& identifier, const Value* entitlements) {
    auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, kVSLSystemGroupsEntitlement);
    if (!groups || groups->empty())
        groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                               kVSLSystemGroupContainersEntitlement);
    if (!groups) return std::nullopt;
    std::vector<std::string> accepted;
    for (auto& g : *groups) {
        if (g.rfind(kSystemGroupPrefix, 0) == 0) {
            accepted.push_back(std::move(g));
        } else {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "System group ID %@ does not have proper prefix, ignoring.", g);
        }
    }
    return accepted;
}

VSLCountedSet VSLCodeSigningMapping::copyReferenceCountSetOfType(VSLGroupType type) {
    VSLCountedSet counts;
    queue_->sync([&] { counts = _onQueue_copyReferenceCountSetOfType(type); });
    return counts;
}

void VSLCodeSigningMapping::_onQueue_iterateGroupIdsWithKey(const char* key, const char* fallBackKey,
                                                            const GroupIdsBlock& block) {
    assertOnQueue();
    VSLErrorRef error = codeSigningMappingDB_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const VSLCodeSigningEntry& entry) {
            const Value* entitlements = entry.entitlements();
            auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, key);
            if ((!groups || groups->empty()) && fallBackKey)
                groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, fallBackKey);
            if (groups) block(identifier, *groups);
        });
    if (error)
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to enumerate code signing info: %@", error);
}

VSLCountedSet VSLCodeSigningMapping::_onQueue_copyReferenceCountSetOfType(VSLGroupType type) {
    assertOnQueue();
    VSLCountedSet counts;
    const char* key = type == kVSLGroupTypeSystem ? kVSLSystemGroupsEntitlement : kVSLApplicationGroupsEntitlement;
    const char* fallBackKey = type == kVSLGroupTypeSystem ? kVSLSystemGroupContainersEntitlement : nullptr;
    _onQueue_iterateGroupIdsWithKey(
        key, fallBackKey, [&](const std::string& identifier, const std::vector<std::string>& groups) {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Debug,
                  "Entitlements for identifier %@ references container IDs: %@", identifier, stringListValue(groups));
            for (const auto& g : groups) counts[g]++;
        });
    return counts;
}

void VSLCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const std::optional<std::vector<std::string>>& oldIds, const std::optional<std::vector<std::string>>& newIds,
    VSLGroupType type, const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    assertOnQueue();
    if (!oldIds && !newIds) return;
    if (oldIds && newIds && *oldIds == *newIds) return;
    if (!oldIds) return;  // nothing was named before, so nothing lost a reference
    std::vector<std::string> removed;
    for (const auto& g : *oldIds)
        if (!newIds || std::find(newIds->begin(), newIds->end(), g) == newIds->end()) removed.push_back(g);
    _onQueue_removeReferenceForGroupIdentifiers(removed, type, commandQueue);
}

void VSLCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& groupIdentifiers, VSLGroupType type,
    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    assertOnQueue();
    if (groupIdentifiers.empty()) return;
    VSLCountedSet counts = _onQueue_copyReferenceCountSetOfType(type);
    if (type == kVSLGroupTypeSystem) {
        // System-group containers are never removed one change at a time.
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
              "Would have removed system group container references for %@", stringListValue(groupIdentifiers));
        return;
    }
    auto configuration = VSLGlobalConfiguration::sharedInstance();
    userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        auto perUser = configuration->getPerUserConfigurationForUserIdentity(user);
        if (perUser && perUser->existsUserBaseDirectory())
            _onQueue_removeGroupContainersIfNeededforUserIdentity(user, kVSLClassAppGroup, groupIdentifiers, counts,
                                                                  commandQueue);
    });
}

void VSLCodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const VSLUserIdentityRef& userIdentity, uint64_t groupContainerClass,
    const std::vector<std::string>& groupIdentifiers, VSLCountedSet referenceCounts,
    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    assertOnQueue();
    for (const auto& group : groupIdentifiers) {
        uint64_t& count = referenceCounts[group];
        if (count == 1) {
            // The identifier being changed is the only one that names it.
            uint64_t code = kVSLSuccess;
            auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group,
                                                                                    groupContainerClass, &code);
            if (identity && commandQueue) {
                commandQueue->insertCommand(VSLCommandStageForDelete::commandForStageForDeleteOfUnreferencedGroups(
                    {identity}, true, [group, userIdentity](uint64_t failure) {
                        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                              "Failed to destroy group container with identifier %@ for %@: %llu", group, userIdentity,
                              failure);
                    }));
            }
        } else {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Reference count for user: %@, ID: %@ is %ld",
                  userIdentity, group, static_cast<long>(count));
        }
        if (count > 0) count--;
    }
}

}  // namespace vsl
