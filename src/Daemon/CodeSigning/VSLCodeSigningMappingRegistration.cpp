// Registration: processing a new, changed or removed entry, staging what the change
// makes obsolete, writing entries, a client's own entitlements, and invalidating
// entries whose bundle went away.
#include <algorithm>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/CodeSigning/VSLCodeSigningMappingHelpers.h"
#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Platform/Log.h"

namespace vsl {

uint64_t VSLCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    VSLGlobalWriteLock lock;
    VSLErrorRef enumerationError;
    auto identifiers = identifiersWithError(&enumerationError);
    if (!identifiers) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
              "Failed to enumerate containers when invalidating code signing info: %@", enumerationError);
        identifiers.emplace();
    }
    uint64_t result = kVSLSuccess;
    const auto& cache = VSLContainerCache::sharedInstance();
    for (const auto& identifier : *identifiers) {
        std::optional<VSLCodeSigningEntry> entry;
        VSLErrorRef entryError;
        bool isPlugIn = false;
        bool hasParent = false;
        queue_->sync([&] {
            entry = _onQueue_codeSigningEntryForIdentifier(identifier, &entryError);
            isPlugIn = entry && entry->dataContainerClass >= kVSLClassPlugin &&
                       entry->dataContainerClass <= kVSLClassVPNPluginData;
            if (isPlugIn)
                hasParent = codeSigningMappingDB_->parentIdentifierForChildIdentifier(identifier, nullptr).has_value();
        });
        if (!entry) {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Error fetching code sign info for %@ to check for invalidation: %@", identifier, entryError);
            continue;
        }
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Info,
              "Checking for invalidation: identifier = %@, codeSigningEntry = <%p>, isRegisteredByCaller = %d, "
              "isPlugIn = %d, hasParent = %d",
              identifier, static_cast<const void*>(&*entry), entry->registeredByCaller, isPlugIn, hasParent);
        if (entry->registeredByCaller || (isPlugIn && hasParent)) continue;

        bool bundleExists = false;
        for (VSLContainerClass c : {kVSLClassApplication, kVSLClassPlugin, kVSLClassVPNPlugin}) {
            uint64_t code = kVSLSuccess;
            auto identity = VSLContainerIdentity::containerIdentityWithIdentifier(identifier, c, &code);
            VSLErrorRef lookupError;
            if (identity && cache->containerForContainerIdentity(identity, false, false, &lookupError)) {
                bundleExists = true;
                break;
            }
        }
        if (bundleExists) continue;

        osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Invalidating: identifier = %@, isPlugin = %d",
              identifier, isPlugIn);
        VSLErrorRef invalidateError;
        if (!invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, &invalidateError)) {
            auto e = VSL_ERROR(kVSLErrorDatabase, invalidateError, true,
                               "Failed to invalidate code signing info for %@ : %@", identifier, invalidateError);
            result = codeForError(e, kVSLErrorDatabase);
        }
    }
    return result;
}

// ---- registration ----

uint64_t VSLCodeSigningMapping::processCodeSigningInfo(const std::optional<Value>& codeSigningInfo,
                                                       const std::optional<std::string>& identifier,
                                                       const std::optional<Value>& options,
                                                       const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    std::optional<Value> oldEntitlements;
    if (identifier) oldEntitlements = entitlementsForIdentifier(*identifier);
    uint64_t result = kVSLSuccess;
    queue_->sync([&] {
        result = _onQueue_processCodeSigningInfo(codeSigningInfo, identifier, options, oldEntitlements, commandQueue);
    });
    return result;
}

uint64_t VSLCodeSigningMapping::_onQueue_processCodeSigningInfo(const std::optional<Value>& codeSigningInfo,
                                                                const std::optional<std::string>& identifier,
                                                                const std::optional<Value>& options,
                                                                const std::optional<Value>& oldEntitlements,
                                                                const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    assertOnQueue();
    try {
        if (!identifier) return kVSLErrorMissingIdentifier;
        VSLErrorRef error;
        auto oldEntry = _onQueue_codeSigningEntryForIdentifier(*identifier, &error);
        if (!oldEntry && error && !isNotInDatabase(error)) return codeForError(error, kVSLErrorDatabase);

        VSLCodeSigningEntry newEntry;
        if (const Value* c = optionValue(options, kVSLOptionDataContainerClass))
            newEntry.dataContainerClass = c->unsignedNumber().value_or(0);

        std::vector<VSLCodeSigningEntry> values;
        std::vector<std::string> identifiers;
        const Value* parentValue = optionValue(options, kVSLOptionParentBundleID);
        if (parentValue && parentValue->stringValue()) {
            const std::string& parent = *parentValue->stringValue();
            VSLErrorRef parentError;
            auto parentEntry = _onQueue_codeSigningEntryForIdentifier(parent, &parentError);
            if (!parentEntry && parentError && !isNotInDatabase(parentError))
                return codeForError(parentError, kVSLErrorDatabase);
            // An unregistered parent stays blank and is never written.
            if (!parentEntry) parentEntry.emplace();
            auto& children = parentEntry->childBundleIdentifiers;
            if (!children || std::find(children->begin(), children->end(), *identifier) == children->end()) {
                if (!children) children.emplace();
                children->push_back(*identifier);
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Debug,
                      "Staging Child Bundles: %@ for parent ID: %@ by appending: %@", stringListValue(children), parent,
                      *identifier);
                values.push_back(std::move(*parentEntry));
                identifiers.push_back(parent);
            }
        }

        newEntry.registeredByCaller = propertyListTruthValue(optionValue(options, kVSLOptionRegisteredByCaller));
        newEntry.placeholder = propertyListTruthValue(optionValue(options, kVSLOptionPlaceholder));
        newEntry.advanceCopy = propertyListTruthValue(optionValue(options, kVSLOptionAdvanceCopy));
        if (const Value* info = presentValue(codeSigningInfo); info && info->isDictionary())
            newEntry.codeSigningInfo = *info;

        if (!(oldEntry && *oldEntry == newEntry)) {
            const Value* oldEnts = presentValue(oldEntitlements);
            const Value* newEnts = newEntry.entitlements();
            _onQueue_stageSystemContainerIfLost(*identifier, oldEnts, newEnts, commandQueue);

            // Computed before anything is written, so the counts still hold this identifier's old references.
            auto newAppGroups =
                _copyApplicationGroupEntitlementForIdentifier(*identifier, newEnts, kVSLApplicationGroupsEntitlement);
            auto oldAppGroups =
                _copyApplicationGroupEntitlementForIdentifier(*identifier, oldEnts, kVSLApplicationGroupsEntitlement);
            if (newAppGroups || oldAppGroups)
                _onQueue_handleChangeFromOldGroupContainerIds(oldAppGroups, newAppGroups, kVSLGroupTypeApplication,
                                                              commandQueue);
            auto newSystemGroups = _systemGroupIdentifiersForIdentifier(*identifier, newEnts);
            auto oldSystemGroups = _systemGroupIdentifiersForIdentifier(*identifier, oldEnts);
            if (newSystemGroups || oldSystemGroups)
                _onQueue_handleChangeFromOldGroupContainerIds(oldSystemGroups, newSystemGroups, kVSLGroupTypeSystem,
                                                              commandQueue);
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
                  "Reconciled; old app groups: %@, new app groups: %@, old system groups: %@, new system groups: %@",
                  listValue(oldAppGroups), listValue(newAppGroups), listValue(oldSystemGroups),
                  listValue(newSystemGroups));
            values.push_back(std::move(newEntry));
            identifiers.push_back(*identifier);
        }

        if (!values.empty()) {
            if (auto e = _onQueue_setCodeSigningDictionaryValues(values, identifiers))
                return codeForError(e, kVSLErrorDatabase);
        }
        return kVSLSuccess;
    } catch (...) {
        return codeForError(errorForCaughtException(VSL_FUNCTION, __LINE__), kVSLErrorException);
    }
}

void VSLCodeSigningMapping::_onQueue_stageSystemContainerIfLost(const std::string& identifier,
                                                                const Value* oldEntitlements,
                                                                const Value* newEntitlements,
                                                                const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    bool had = oldEntitlements && propertyListTruthValue(oldEntitlements->find(kVSLSystemContainerEntitlement));
    bool has = newEntitlements && propertyListTruthValue(newEntitlements->find(kVSLSystemContainerEntitlement));
    if (!had || has) return;
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithIdentifier(identifier, kVSLClassSystemData, &code);
    if (!identity) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to create system container identity for %@: %@",
              identifier, code);
        return;
    }
    osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
          "Deleting system container for ID: %@ because it is no longer in the entitlements", identifier);
    if (!commandQueue) return;
    commandQueue->insertCommand(VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {identity}, true, [identifier](uint64_t failure) {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Failed to destroy system container with identifier %@: %llu", identifier, failure);
        }));
}

VSLErrorRef VSLCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(
    const std::vector<VSLCodeSigningEntry>& values, const std::vector<std::string>& identifiers) {
    assertOnQueue();
    if (values.size() != identifiers.size())
        return VSL_ERROR(kVSLErrorInputCountMismatch, nullptr, true,
                         "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                         static_cast<long>(values.size()), static_cast<long>(identifiers.size()));
    for (size_t i = 0; i < values.size(); i++) {
        const std::string& identifier = identifiers[i];
        const VSLCodeSigningEntry& value = values[i];
        VSLErrorRef readError;
        auto stored = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier, &readError);
        if (!stored && readError && !isNotInDatabase(readError)) {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Error retrieving entry from DB with identifier %@ : %@", identifier, readError);
            return readError;
        }
        if (stored && !stored->codeSigningInfo) stored.reset();
        bool valueIsNone = !value.codeSigningInfo;
        if (!stored && valueIsNone) continue;
        if (stored && !valueIsNone && *stored == value) continue;
        VSLErrorRef writeError;
        if (valueIsNone) {
            if (!codeSigningMappingDB_->deleteCodeSigningEntryWithIdentifier(identifier, &writeError)) {
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                      "Failed to delete code signing info from DB for %@ : %@", identifier, writeError);
                return writeError;
            }
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Deleted Code Signing Mapping for ID: %@",
                  identifier);
        } else {
            if (!codeSigningMappingDB_->addCodeSigningEntry(&value, identifier, &writeError)) {
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                      "Failed to write code signing info to DB for %@ : %@", identifier, writeError);
                return writeError;
            }
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Set Code Signing Mapping for ID: %@ : %@",
                  identifier, value);
        }
    }
    return nullptr;
}

uint64_t VSLCodeSigningMapping::processCallerRegisteredEntitlements(
    const std::optional<Value>& entitlements, const std::optional<std::string>& identifier,
    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    if (!identifier || identifier->empty()) return kVSLErrorMissingIdentifier;
    const Value* given = presentValue(entitlements);
    // Every message of every client comes here: an answer already found costs no
    // database read and no wait behind other clients on the queue.
    if (callerEntitlements_.isUnchanged(*identifier, given, codeSigningMappingDB_->generation())) return kVSLSuccess;
    uint64_t result = kVSLSuccess;
    bool reRegister = false;
    queue_->sync([&] {
        const uint64_t generation = codeSigningMappingDB_->generation();
        VSLErrorRef error;
        auto entry = _onQueue_codeSigningEntryForIdentifier(*identifier, &error, false);
        if (!entry && error && !isNotInDatabase(error)) {
            result = codeForError(error, kVSLErrorDatabase);
            return;
        }
        if (entry && entry->codeSigningInfo) {
            if (!entry->registeredByCaller) {  // installer-registered information wins
                callerEntitlements_.remember(*identifier, given, true, generation);
                return;
            }
            const Value* stored = entry->entitlements();
            bool same = stored && given ? propertyListValuesEqual(*stored, *given) : !stored && !given;
            if (same) {
                callerEntitlements_.remember(*identifier, given, false, generation);
                return;
            }
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "%@ has changed entitlements. Re-registering.",
                  *identifier);
        }
        reRegister = true;
    });
    if (!reRegister) return result;
    Dictionary info;
    if (given) info[kVSLEntitlementsKey] = *given;
    VSLGlobalWriteLock lock;
    return processCodeSigningInfo(Value::dictionary(std::move(info)), identifier,
                                  dict({{kVSLOptionRegisteredByCaller, Value::boolean(true)}}), commandQueue);
}

void VSLCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    std::vector<std::string> list;
    if (auto children = childBundleIdentifiersForParentIdentifier(identifier)) list = std::move(*children);
    list.push_back(identifier);
    for (const auto& item : list) {
        uint64_t code = processCodeSigningInfo(std::nullopt, item, std::nullopt, commandQueue);
        if (code != kVSLSuccess)
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to clear entitlements for %@ : %llu", item,
                  code);
    }
}

}  // namespace vsl
