#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"

#include <mutex>

#include "Daemon/CodeSigning/VSLCodeSigningMappingHelpers.h"
#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
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

}  // namespace

// ---- life cycle ----

std::shared_ptr<VSLCodeSigningMapping> VSLCodeSigningMapping::sharedInstance() {
    std::lock_guard g(gSharedMutex);
    if (gShared) return gShared;
    auto database =
        VSLSQLiteDB::initWithParentDirectoryURL(VSLGlobalConfiguration::sharedInstance()->libraryDirectory());
    if (!database) {
        LogWrite(kLogLevelError, "+[VSLCodeSigningMapping sharedInstance]", "Failed to initialize database.");
        return nullptr;
    }
    gShared = create(std::move(database), VSLUserIdentitySharedCache::sharedInstance());
    gShared->migrateFromMappingFileToDBIfNecessary();
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

void VSLCodeSigningMapping::assertOnQueue() const {
    VSL_INVARIANT(queue_->isCurrent());
}

// ---- reading ----

std::optional<VSLCodeSigningEntry> VSLCodeSigningMapping::_onQueue_codeSigningEntryForIdentifier(
    const std::string& identifier, VSLErrorRef* error, bool withChildren) {
    assertOnQueue();
    VSLErrorRef e;
    auto entry = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier, &e, withChildren);
    if (!entry && e && !isNotInDatabase(e))
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
    auto container =
        VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false, &lookupError);
    const Value* cached =
        container && container->info() ? container->info()->find(kVSLCachedCodeSigningInfoKey) : nullptr;
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
    VSLGlobalWriteLock lock;
    std::optional<VSLCodeSigningEntry> entry;
    // Only the stored information is answered: the children are not read.
    queue_->sync([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier, nullptr, false); });
    // Stored entitlements mean there is nothing to import; otherwise look at the bundle
    // container first, then read what that may have stored.
    if (!entry || !entry->entitlements()) {
        entitlementsForIdentifier(identifier);
        queue_->sync([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier, nullptr, false); });
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
        if (!children && !isNotInDatabase(e))
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
        if (!parent && !isNotInDatabase(e))
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

}  // namespace vsl
