// Imports of what older builds kept outside the database: the file-based store, the
// legacy entitlements file, group identifiers in data containers' metadata and the
// code-signing information cached in bundle containers' metadata. None of them
// fails its caller; every problem is logged and the import goes on.
#include <cerrno>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/CodeSigning/VSLCodeSigningMappingHelpers.h"
#include "Daemon/CodeSigning/VSLGroupManager.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kMappingFileName = "vsl_code_signing_info.plist";
const char* const kLegacyEntitlementsFileName = "vsl_entitlements.plist";
const char* const kLegacyChildBundleIds = "com.tarrow.Vesselry.ChildPluginBundleIDs";
const char* const kLegacyRegisteredByCaller = "com.tarrow.Vesselry.EntitlementsRegisteredByCaller";
const char* const kLegacyPlaceholders = "com.tarrow.Vesselry.PlaceholderEntitlements";
const char* const kGroupContainerIdsKey = "com.tarrow.Stowage.GroupContainerIDs";

std::string libraryFile(const char* name) {
    return VSLGlobalConfiguration::sharedInstance()->libraryDirectory() + "/" + name;
}

// Takes `key` out of `dictionary`; none unless it was a dictionary.
std::optional<Dictionary> takeDictionary(Dictionary& dictionary, const char* key) {
    auto it = dictionary.find(key);
    if (it == dictionary.end()) return std::nullopt;
    std::optional<Dictionary> result;
    if (const Dictionary* d = it->second.dictionaryValue()) result = *d;
    dictionary.erase(it);
    return result;
}

std::optional<std::vector<std::string>> stringList(const Value* value) {
    const Array* array = value ? value->arrayValue() : nullptr;
    if (!array) return std::nullopt;
    std::vector<std::string> list;
    for (const Value& v : *array)
        if (const std::string* s = v.stringValue()) list.push_back(*s);
    return list;
}

const Value* infoValue(const VSLMetadata& container, const char* key) {
    return container.info() ? container.info()->find(key) : nullptr;
}

// Without locking: the caller holds the global write lock. 1 or the failure's code.
uint64_t clearInfoValue(VSLClientConnection& connection, const VSLMetadata& container, const char* key) {
    uint64_t code = kVSLSuccess;
    connection.setInfoValue(std::nullopt, Value::string(key), container.containerIdentity(), false, &code);
    return code;
}

VSLContainerClass dataClassForBundleClass(VSLContainerClass bundleClass) {
    switch (bundleClass) {
        case kVSLClassApplication: return kVSLClassApplicationData;
        case kVSLClassPlugin: return kVSLClassPluginData;
        case kVSLClassVPNPlugin: return kVSLClassVPNPluginData;
        default: return kVSLClassUndefined;
    }
}

}  // namespace

// ---- the file-based store ----

std::optional<std::vector<std::pair<std::string, VSLCodeSigningEntry>>>
VSLCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(const std::string& path) {
    VSLErrorRef error;
    auto dictionary = VSL_dictionaryWithContentsOfURL(path, 0, &error);
    if (!dictionary) {
        if (!isPOSIXError(error, ENOENT))
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to read code signing mapping file at %@ : %@", path, error);
        return std::nullopt;
    }
    std::vector<std::pair<std::string, VSLCodeSigningEntry>> entries;
    for (const auto& [identifier, serialized] : *dictionary->dictionaryValue()) {
        auto entry = VSLCodeSigningEntry::initWithSerializedDictionary(serialized);
        if (!entry) {
            LogWrite(kLogLevelError, VSL_FUNCTION, "Skipping malformed code signing entry for %@", identifier);
            continue;
        }
        entries.emplace_back(identifier, std::move(*entry));
    }
    return entries;
}

void VSLCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
    assertOnQueue();
    const std::string path = libraryFile(kMappingFileName);
    auto entries = _readCodeSigningMappingFromDiskAtURL(path);
    if (!entries) return;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migrating code signing info from file to DB");
    uint16_t migrated = 0;
    uint16_t failed = 0;
    for (const auto& [identifier, entry] : *entries) {
        VSLErrorRef error;
        if (codeSigningMappingDB_->addCodeSigningEntry(&entry, identifier, &error)) {
            migrated++;
        } else {
            failed++;
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to migrate code signing entry for %@ : %@", identifier,
                     error);
        }
    }
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Successfully migrated %d entries, failed to migrate %d",
             static_cast<int>(migrated), static_cast<int>(failed));
    // Every entry failed: keep the file for the next start.
    if (migrated == 0) return;
    if (durable::removeFile(path) != 0 && errno != ENOENT)
        LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to remove legacy code signing mapping file: %@",
                 VSL_POSIX_ERROR(errno, "unlink %s", path.c_str()));
}

void VSLCodeSigningMapping::migrateFromMappingFileToDBIfNecessary() {
    queue_->sync([this] { _onQueue_migrateFromMappingFileToDBIfNecessary(); });
}

// ---- the legacy entitlements file ----

void VSLCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
    assertOnQueue();
    const std::string path = libraryFile(kLegacyEntitlementsFileName);
    VSLErrorRef readError;
    auto read = VSL_dictionaryWithContentsOfURL(path, 0, &readError);
    if (!read && isPOSIXError(readError, ENOENT)) return;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Performing legacy entitlement migration");
    if (!read) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Entitlement File exists at %@, but we unexpectedly cant read it", path);
        return;
    }
    Dictionary remaining = *read->dictionaryValue();
    const Dictionary children = takeDictionary(remaining, kLegacyChildBundleIds).value_or(Dictionary{});
    const Dictionary byCaller = takeDictionary(remaining, kLegacyRegisteredByCaller).value_or(Dictionary{});
    const Dictionary placeholders = takeDictionary(remaining, kLegacyPlaceholders).value_or(Dictionary{});

    for (const auto& [identifier, entitlements] : remaining) {
        VSLErrorRef lookupError;
        auto existing = _onQueue_codeSigningEntryForIdentifier(identifier, &lookupError);
        if (existing && !existing->invalid) {
            LogWrite(kLogLevelNotice, VSL_FUNCTION,
                     "Already have code signing info for %@.  No need to migrate legacy entitlements.", identifier);
            continue;
        }
        if (!existing && lookupError && !isNotInDatabase(lookupError)) continue;  // logged by the lookup
        if (!entitlements.isDictionary()) {
            LogWrite(kLogLevelError, VSL_FUNCTION, "Skipping legacy entitlements for %@: not a dictionary", identifier);
            continue;
        }
        LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migrating legacy entitlements for %@", identifier);
        auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(
            Value::dictionary(Dictionary{{kVSLEntitlementsKey, entitlements}}), kVSLClassUndefined);
        if (auto it = children.find(identifier); it != children.end())
            entry.childBundleIdentifiers = stringList(&it->second);
        entry.placeholder = placeholders.count(identifier) != 0;
        auto flag = byCaller.find(identifier);
        entry.registeredByCaller = flag != byCaller.end() && flag->second.boolValue().value_or(false);
        entry.invalid = !entry.registeredByCaller;
        VSLErrorRef writeError;
        if (!codeSigningMappingDB_->addCodeSigningEntry(&entry, identifier, &writeError))
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to write migrated legacy info to DB for %@ : %@",
                     identifier, writeError);
    }
    if (durable::removeFile(path) != 0 && errno != ENOENT)
        LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to remove legacy file at %@: %@", path,
                 VSL_POSIX_ERROR(errno, "unlink"));
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Legacy entitlement migration completed");
}

// ---- group identifiers in data containers ----

void VSLCodeSigningMapping::migrateAppGroupIdsFromDataContainersToFile() {
    auto status = VSLMigrationStatus::initForSystemMigration();
    if (!status || status->hasMigrationOccurredForType(kVSLMigrationGroupId)) return;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Performing group ID migration");
    VSLUserIdentityRef legacy = VSLUserIdentityCache::userIdentityForLegacyMobileUser();
    VSLClientConnectionRef connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(legacy);
    for (VSLContainerClass containerClass : {kVSLClassApplicationData, kVSLClassPluginData, kVSLClassVPNPluginData}) {
        VSLErrorRef listError;
        auto containers =
            VSLContainerCache::sharedInstance()->allContainersForUserIdentity(legacy, containerClass, false, &listError);
        if (!containers) {
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to fetch list of containers for userId: 501, class %ld : %@",
                     static_cast<long>(containerClass), listError);
            return;  // no marker: tried again next time
        }
        queue_->sync([&] { _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(*containers); });
        for (const auto& container : *containers) {
            if (!infoValue(*container, kGroupContainerIdsKey)) continue;
            uint64_t code = clearInfoValue(*connection, *container, kGroupContainerIdsKey);
            if (code != kVSLSuccess)
                LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to clear group id metadata for %@ : %llu",
                         container->identifier(), static_cast<unsigned long long>(code));
        }
    }
    status->setMigrationCompleteForType(kVSLMigrationGroupId);
}

void VSLCodeSigningMapping::_onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
    const std::vector<VSLMetadataRef>& containers) {
    assertOnQueue();
    for (const auto& container : containers) {
        const Value* groups = infoValue(*container, kGroupContainerIdsKey);
        if (!groups) continue;
        const std::string& identifier = container->identifier();
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Debug,
              "Data container for userId: 501, identifier %@ references container IDs: %@", identifier, *groups);
        VSLErrorRef lookupError;
        if (_onQueue_codeSigningEntryForIdentifier(identifier, &lookupError)) {
            LogWrite(kLogLevelNotice, VSL_FUNCTION,
                     "Deleting app group entitlements for %@ because we already have them in mapping", identifier);
            continue;
        }
        if (!isNotInDatabase(lookupError)) continue;  // logged by the lookup
        if (!groups->arrayValue()) {
            LogWrite(kLogLevelError, VSL_FUNCTION, "Skipping group identifiers of %@: not an array", identifier);
            continue;
        }
        LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migrating app group entitlements for %@", identifier);
        Dictionary entitlements{{kVSLApplicationGroupsEntitlement, *groups}};
        auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(
            Value::dictionary(Dictionary{{kVSLEntitlementsKey, Value::dictionary(std::move(entitlements))}}),
            container->containerClass());
        entry.invalid = true;
        VSLErrorRef writeError;
        if (!codeSigningMappingDB_->addCodeSigningEntry(&entry, identifier, &writeError))
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to write migrated group id info to DB for %@ : %@",
                     identifier, writeError);
    }
}

// ---- code-signing information cached in bundle containers ----

void VSLCodeSigningMapping::migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
    auto status = VSLMigrationStatus::initForSystemMigration();
    if (!status || status->hasMigrationOccurredForType(kVSLMigrationCodeSigning)) return;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Performing code signing migration");
    VSLUserIdentityRef user = VSLUserIdentityCache::defaultUserIdentity();
    VSLClientConnectionRef connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(user);
    for (VSLContainerClass containerClass :
         {kVSLClassApplication, kVSLClassPlugin, kVSLClassVPNPlugin, kVSLClassFramework}) {
        VSLErrorRef listError;
        auto containers =
            VSLContainerCache::sharedInstance()->allContainersForUserIdentity(user, containerClass, false, &listError);
        if (!containers) {
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to fetch list of containers for class %llu : %@",
                     static_cast<unsigned long long>(containerClass), listError);
            continue;
        }
        queue_->sync([&] {
            _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(*containers,
                                                                                             containerClass);
        });
        for (const auto& container : *containers) {
            const Value* cached = infoValue(*container, kVSLCachedCodeSigningInfoKey);
            if (!cached || !cached->isDictionary()) continue;
            uint64_t code = clearInfoValue(*connection, *container, kVSLCachedCodeSigningInfoKey);
            if (code != kVSLSuccess)
                LogWrite(kLogLevelError, VSL_FUNCTION, "Error setting info value for identity %@ : %llu",
                         container->containerIdentity(), static_cast<unsigned long long>(code));
        }
    }
    status->setMigrationCompleteForType(kVSLMigrationCodeSigning);
}

void VSLCodeSigningMapping::_onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
    const std::vector<VSLMetadataRef>& containers, VSLContainerClass containerClass) {
    assertOnQueue();
    for (const auto& container : containers) {
        const Value* cached = infoValue(*container, kVSLCachedCodeSigningInfoKey);
        if (!cached || !cached->isDictionary()) continue;
        const std::string& identifier = container->identifier();
        VSLErrorRef lookupError;
        auto existing = _onQueue_codeSigningEntryForIdentifier(identifier, &lookupError);
        if (existing && !existing->invalid) {
            LogWrite(kLogLevelNotice, VSL_FUNCTION,
                     "Deleting cached code signing info for %@ because we already have it in mapping", identifier);
            continue;
        }
        if (!existing && lookupError && !isNotInDatabase(lookupError)) continue;  // logged by the lookup
        LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migrating code signing info for %@", identifier);
        Dictionary info = *cached->dictionaryValue();
        const Value* entitlements = cached->find("Entitlements");
        if (entitlements) info[kVSLEntitlementsKey] = *entitlements;
        auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(Value::dictionary(std::move(info)),
                                                                  dataClassForBundleClass(containerClass));
        VSLErrorRef writeError;
        if (!codeSigningMappingDB_->addCodeSigningEntry(&entry, identifier, &writeError))
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Failed to write migrated cached cs info from bundle container to DB for %@ : %@", identifier,
                     writeError);
    }
}

// ---- start-up ----

void VSLCodeSigningMapping::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    VSLGlobalWriteLock lock;
    const bool multiUser = deviceFacts().multiUser;
    if (!multiUser) migrateAppGroupIdsFromDataContainersToFile();
    queue_->sync([this] { _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile(); });
    migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    // Stagings are only queued, with locking: the caller drains the queue once this
    // lock is released.
    if (!multiUser)
        VSLGroupManager::defaultManager()->reconcileGroupContainersOfType(kVSLGroupTypeApplication, commandQueue, false);
}

}  // namespace vsl
