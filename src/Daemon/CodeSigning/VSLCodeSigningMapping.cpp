#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"

#include <algorithm>
#include <mutex>

#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLInvariant.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/Log.h"

namespace vsl {

const char* const kVSLApplicationGroupsEntitlement = "com.tarrow.security.application-groups";
const char* const kVSLSystemGroupsEntitlement = "com.tarrow.security.system-groups";
const char* const kVSLSystemGroupContainersEntitlement = "com.tarrow.security.system-group-containers";
const char* const kVSLSystemContainerEntitlement = "com.tarrow.security.system-container";
const char* const kVSLOptionDataContainerClass = "com.tarrow.Vesselry.DataContainerClass";
const char* const kVSLOptionParentBundleID = "com.tarrow.Vesselry.ParentBundleID";
const char* const kVSLOptionRegisteredByCaller = "RegByCaller";
const char* const kVSLOptionPlaceholder = "com.tarrow.Vesselry.PlaceholderEntitlements";
const char* const kVSLOptionAdvanceCopy = "com.tarrow.Vesselry.AdvanceCopy";
const char* const kVSLCachedCodeSigningInfoKey = "com.tarrow.Stowage.CachedCodeSigningInfo";

namespace {

const char* const kQueueLabel = "com.tarrow.Vesselry.EntitlementQueue";

std::mutex gSharedMutex;
std::shared_ptr<VSLCodeSigningMapping> gShared;

// The global write lock for one scope; taken before the mapping's queue is entered.
class GlobalWriteLock {
public:
    GlobalWriteLock() { lock_all_identifiers_for_writing(); }
    ~GlobalWriteLock() { unlock_all_identifiers(); }
    GlobalWriteLock(const GlobalWriteLock&) = delete;
    GlobalWriteLock& operator=(const GlobalWriteLock&) = delete;
};

bool isNotFound(const VSLErrorRef& e) {
    return e && e->isVSLDomain() && static_cast<uint64_t>(e->code) == kVSLErrorNotInDatabase;
}

const Value* option(const std::optional<Value>& options, const char* key) {
    if (!options || !options->isDictionary()) return nullptr;
    const Value* v = options->find(key);
    return v && !v->isNull() ? v : nullptr;
}

const Value* presentValue(const std::optional<Value>& v) { return v && !v->isNull() ? &*v : nullptr; }

std::optional<Value> listValue(const std::optional<std::vector<std::string>>& list) {
    if (!list) return std::nullopt;
    return stringListValue(list);
}

}  // namespace

// ---- life cycle ----

std::shared_ptr<VSLCodeSigningMapping> VSLCodeSigningMapping::sharedInstance() {
    std::lock_guard g(gSharedMutex);
    if (gShared) return gShared;
    auto database = VSLSQLiteDB::initWithParentDirectoryURL(VSLGlobalConfiguration::sharedInstance()->libraryDirectory());
    if (!database) {
        LogWrite(kLogLevelError, "+[VSLCodeSigningMapping sharedInstance]", "Failed to initialize database.");
        return nullptr;
    }
    gShared = create(std::move(database), VSLUserIdentitySharedCache::sharedInstance());
    return gShared;
}

void VSLCodeSigningMapping::setSharedInstanceForTesting(std::shared_ptr<VSLCodeSigningMapping> mapping) {
    std::lock_guard g(gSharedMutex);
    gShared = std::move(mapping);
}

std::shared_ptr<VSLCodeSigningMapping> VSLCodeSigningMapping::create(
    std::unique_ptr<VSLSQLiteDB> database, std::shared_ptr<VSLUserIdentityCache> userIdentityCache) {
    return std::make_shared<VSLCodeSigningMapping>(Passkey{}, std::move(database), std::move(userIdentityCache));
}

VSLCodeSigningMapping::VSLCodeSigningMapping(Passkey, std::unique_ptr<VSLSQLiteDB> database,
                                             std::shared_ptr<VSLUserIdentityCache> userIdentityCache)
    : queue_(WorkQueue::serial(kQueueLabel)),
      codeSigningMappingDB_(std::move(database)),
      userIdentityCache_(std::move(userIdentityCache)) {}

void VSLCodeSigningMapping::assertOnQueue() const { VSL_INVARIANT(queue_->isCurrent()); }

// ---- reading ----

std::optional<VSLCodeSigningEntry> VSLCodeSigningMapping::_onQueue_codeSigningEntryForIdentifier(
    const std::string& identifier, VSLErrorRef* error) {
    assertOnQueue();
    VSLErrorRef e;
    auto entry = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier, &e);
    if (!entry && e && !isNotFound(e))
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Error retrieving entry from DB with identifier %@ : %@",
              identifier, e);
    if (error) *error = e;
    return entry;
}

std::optional<VSLCodeSigningEntry> VSLCodeSigningMapping::codeSigningEntryForIdentifier(const std::string& identifier,
                                                                                       VSLErrorRef* error) {
    std::optional<VSLCodeSigningEntry> entry;
    queue_->sync([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier, error); });
    return entry;
}

std::optional<Value> VSLCodeSigningMapping::_onQueue_entitlementsForIdentifier(const std::string& identifier) {
    auto entry = _onQueue_codeSigningEntryForIdentifier(identifier, nullptr);
    if (const Value* e = entry ? entry->entitlements() : nullptr) return *e;
    return std::nullopt;
}

std::optional<Value> VSLCodeSigningMapping::entitlementsForIdentifier(const std::string& identifier) {
    std::optional<Value> stored;
    queue_->sync([&] { stored = _onQueue_entitlementsForIdentifier(identifier); });
    if (stored) return stored;

    // Nothing stored: the bundle container may still carry what an older install cached.
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithIdentifier(identifier, kVSLClassApplication, &code);
    if (!identity) return std::nullopt;
    VSLErrorRef lookupError;
    auto container = VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false,
                                                                                        &lookupError);
    const Value* cached = container && container->info() ? container->info()->find(kVSLCachedCodeSigningInfoKey) : nullptr;
    if (!cached || !cached->isDictionary()) return std::nullopt;
    osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
          "Migrating code signing info from bundle container upon request for %@", identifier);
    Dictionary info = *cached->dictionaryValue();
    const Value* entitlements = cached->find("Entitlements");
    if (entitlements && !entitlements->isNull())
        info[kVSLEntitlementsKey] = *entitlements;
    else
        info.erase(kVSLEntitlementsKey);
    std::vector<VSLCodeSigningEntry> values{
        VSLCodeSigningEntry::initWithCodeSigningInfo(Value::dictionary(std::move(info)), kVSLClassApplicationData)};
    std::vector<std::string> identifiers{container->identifier()};
    queue_->sync([&] { _onQueue_setCodeSigningDictionaryValues(values, identifiers); });
    if (entitlements && !entitlements->isNull()) return *entitlements;
    return std::nullopt;
}

std::optional<Value> VSLCodeSigningMapping::getCodeSigningInfoForIdentifier(const std::string& identifier) {
    GlobalWriteLock lock;
    std::optional<VSLCodeSigningEntry> entry;
    queue_->sync([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier, nullptr); });
    // Stored entitlements mean there is nothing to import; otherwise look at the bundle
    // container first, then read what that may have stored.
    if (!entry || !entry->entitlements()) {
        entitlementsForIdentifier(identifier);
        queue_->sync([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier, nullptr); });
    }
    if (entry && !entry->placeholder && !entry->advanceCopy && !entry->invalid) return entry->codeSigningInfo;
    return std::nullopt;
}

std::optional<std::vector<std::string>> VSLCodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    auto entitlements = entitlementsForIdentifier(identifier);
    return _copyApplicationGroupEntitlementForIdentifier(identifier, presentValue(entitlements),
                                                         kVSLApplicationGroupsEntitlement);
}

std::optional<std::vector<std::string>> VSLCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    auto entitlements = entitlementsForIdentifier(identifier);
    return _systemGroupIdentifiersForIdentifier(identifier, presentValue(entitlements));
}

bool VSLCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
    auto entitlements = entitlementsForIdentifier(identifier);
    return entitlements && propertyListTruthValue(entitlements->find(kVSLSystemContainerEntitlement));
}

uint64_t VSLCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
    auto entry = codeSigningEntryForIdentifier(identifier, nullptr);
    return entry ? entry->dataContainerClass : 0;
}

bool VSLCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
    auto entry = codeSigningEntryForIdentifier(identifier, nullptr);
    return entry && entry->registeredByCaller;
}

std::optional<std::vector<std::string>> VSLCodeSigningMapping::childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
    std::optional<std::vector<std::string>> children;
    queue_->sync([&] {
        assertOnQueue();
        VSLErrorRef e;
        children = codeSigningMappingDB_->childIdentifiersForParentIdentifier(identifier, &e);
        if (!children && !isNotFound(e))
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Error retrieving entry from DB with identifier %@ : %@", identifier, e);
    });
    return children;
}

std::optional<std::string> VSLCodeSigningMapping::parentIdentifierForChildIdentifier(const std::string& identifier) {
    std::optional<std::string> parent;
    queue_->sync([&] {
        assertOnQueue();
        VSLErrorRef e;
        parent = codeSigningMappingDB_->parentIdentifierForChildIdentifier(identifier, &e);
        if (!parent && !isNotFound(e))
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Error retrieving entry from DB with identifier %@ : %@", identifier, e);
    });
    return parent;
}

std::optional<std::set<std::string>> VSLCodeSigningMapping::identifiersWithError(VSLErrorRef* error) {
    std::optional<std::set<std::string>> identifiers;
    queue_->sync([&] {
        assertOnQueue();
        identifiers = codeSigningMappingDB_->identifiersWithError(error);
    });
    return identifiers;
}

// ---- maintenance ----

bool VSLCodeSigningMapping::invalidateCodeSigningInfoForIdentifier(const std::string& identifier, VSLErrorRef* error) {
    bool ok = false;
    queue_->sync([&] {
        assertOnQueue();
        ok = codeSigningMappingDB_->invalidateCodeSigningWithIdentifier(identifier, error);
    });
    return ok;
}

bool VSLCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                                  VSLErrorRef* error) {
    bool ok = false;
    queue_->sync([&] {
        assertOnQueue();
        ok = codeSigningMappingDB_->invalidateCodeSigningForIdentifierAndAllChildren(identifier, error);
    });
    return ok;
}

bool VSLCodeSigningMapping::removeAllAdvanceCopiesWithError(VSLErrorRef* error) {
    bool ok = false;
    queue_->sync([&] {
        assertOnQueue();
        ok = codeSigningMappingDB_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(error);
    });
    return ok;
}

uint64_t VSLCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    GlobalWriteLock lock;
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
            if (isPlugIn) hasParent = codeSigningMappingDB_->parentIdentifierForChildIdentifier(identifier, nullptr).has_value();
        });
        if (!entry) {
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error,
                  "Error fetching code sign info for %@ to check for invalidation: %@", identifier, entryError);
            continue;
        }
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Info,
              "Checking for invalidation: identifier = %@, codeSigningEntry = <%p>, isRegisteredByCaller = %d, isPlugIn "
              "= %d, hasParent = %d",
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
            auto e = VSL_ERROR(kVSLErrorDatabase, invalidateError, true, "Failed to invalidate code signing info for %@ : %@",
                               identifier, invalidateError);
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
        if (!oldEntry && error && !isNotFound(error)) return codeForError(error, kVSLErrorDatabase);

        VSLCodeSigningEntry newEntry;
        if (const Value* c = option(options, kVSLOptionDataContainerClass))
            newEntry.dataContainerClass = c->unsignedNumber().value_or(0);

        std::vector<VSLCodeSigningEntry> values;
        std::vector<std::string> identifiers;
        const Value* parentValue = option(options, kVSLOptionParentBundleID);
        if (parentValue && parentValue->stringValue()) {
            const std::string& parent = *parentValue->stringValue();
            VSLErrorRef parentError;
            auto parentEntry = _onQueue_codeSigningEntryForIdentifier(parent, &parentError);
            if (!parentEntry && parentError && !isNotFound(parentError))
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

        newEntry.registeredByCaller = propertyListTruthValue(option(options, kVSLOptionRegisteredByCaller));
        newEntry.placeholder = propertyListTruthValue(option(options, kVSLOptionPlaceholder));
        newEntry.advanceCopy = propertyListTruthValue(option(options, kVSLOptionAdvanceCopy));
        if (const Value* info = presentValue(codeSigningInfo)) newEntry.codeSigningInfo = *info;

        if (!(oldEntry && *oldEntry == newEntry)) {
            const Value* oldEnts = presentValue(oldEntitlements);
            const Value* newEnts = newEntry.entitlements();
            _onQueue_stageSystemContainerIfLost(*identifier, oldEnts, newEnts, commandQueue);

            // Computed before anything is written, so the counts still hold this identifier's old references.
            auto newAppGroups = _copyApplicationGroupEntitlementForIdentifier(*identifier, newEnts,
                                                                              kVSLApplicationGroupsEntitlement);
            auto oldAppGroups = _copyApplicationGroupEntitlementForIdentifier(*identifier, oldEnts,
                                                                              kVSLApplicationGroupsEntitlement);
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
        return codeForError(errorForCaughtException(__func__, __LINE__), kVSLErrorException);
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

VSLErrorRef VSLCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(const std::vector<VSLCodeSigningEntry>& values,
                                                                           const std::vector<std::string>& identifiers) {
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
        if (!stored && readError && !isNotFound(readError)) {
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
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to delete code signing info from DB for %@ : %@",
                      identifier, writeError);
                return writeError;
            }
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Deleted Code Signing Mapping for ID: %@", identifier);
        } else {
            if (!codeSigningMappingDB_->addCodeSigningEntry(&value, identifier, &writeError)) {
                osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to write code signing info to DB for %@ : %@",
                      identifier, writeError);
                return writeError;
            }
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "Set Code Signing Mapping for ID: %@ : %@", identifier,
                  value);
        }
    }
    return nullptr;
}

uint64_t VSLCodeSigningMapping::processCallerRegisteredEntitlements(const std::optional<Value>& entitlements,
                                                                    const std::optional<std::string>& identifier,
                                                                    const std::shared_ptr<VSLCommandQueue>& commandQueue) {
    if (!identifier || identifier->empty()) return kVSLErrorMissingIdentifier;
    const Value* given = presentValue(entitlements);
    uint64_t result = kVSLSuccess;
    bool reRegister = false;
    queue_->sync([&] {
        VSLErrorRef error;
        auto entry = _onQueue_codeSigningEntryForIdentifier(*identifier, &error);
        if (!entry && error && !isNotFound(error)) {
            result = codeForError(error, kVSLErrorDatabase);
            return;
        }
        if (entry && entry->codeSigningInfo) {
            if (!entry->registeredByCaller) return;  // installer-registered information wins
            const Value* stored = entry->entitlements();
            bool same = stored && given ? propertyListValuesEqual(*stored, *given) : !stored && !given;
            if (same) return;
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Default, "%@ has changed entitlements. Re-registering.",
                  *identifier);
        }
        reRegister = true;
    });
    if (!reRegister) return result;
    Dictionary info;
    if (given) info[kVSLEntitlementsKey] = *given;
    GlobalWriteLock lock;
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
            osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "Failed to clear entitlements for %@ : %llu", item, code);
    }
}

}  // namespace vsl
