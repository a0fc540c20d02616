// The single owner of the code-signing database. Installers register each
// identifier's code-signing information here; the mapping answers questions about
// it (entitlements, data container class, parent and child bundles, group
// identifiers) and reacts to changes: an identifier that loses its system-container
// entitlement gets that container staged for deletion, and an application group
// that nobody names any more gets its containers staged too.
//
// Every database access runs on the serial queue "com.tarrow.Vesselry.EntitlementQueue".
// Public operations hop onto it synchronously and must never be called from it;
// the `_onQueue_` twins assert that they run there. Operations that need the global
// write lock take it before entering the queue, and the container cache is only
// consulted off the queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/CodeSigning/VSLCallerEntitlementsCache.h"
#include "Daemon/CodeSigning/VSLCodeSigningEntry.h"
#include "Daemon/CodeSigning/VSLSQLiteDB.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLError.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/Value.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class VSLUserIdentityCache;
class VSLMetadata;

// Entitlement keys read from an identifier's entitlements.
extern const char* const kVSLApplicationGroupsEntitlement;      // "com.tarrow.security.application-groups"
extern const char* const kVSLSystemGroupsEntitlement;           // "com.tarrow.security.system-groups"
extern const char* const kVSLSystemGroupContainersEntitlement;  // "com.tarrow.security.system-group-containers"
extern const char* const kVSLSystemContainerEntitlement;        // "com.tarrow.security.system-container"
// Keys of the options of processCodeSigningInfo.
extern const char* const kVSLOptionDataContainerClass;  // "com.tarrow.Vesselry.DataContainerClass"
extern const char* const kVSLOptionParentBundleID;      // "com.tarrow.Vesselry.ParentBundleID"
extern const char* const kVSLOptionRegisteredByCaller;  // "RegByCaller"
extern const char* const kVSLOptionPlaceholder;         // "com.tarrow.Vesselry.PlaceholderEntitlements"
extern const char* const kVSLOptionAdvanceCopy;         // "com.tarrow.Vesselry.AdvanceCopy"
// The code-signing information a bundle container's metadata caches.
extern const char* const kVSLCachedCodeSigningInfoKey;  // "com.tarrow.Stowage.CachedCodeSigningInfo"

// Group identifier -> number of stored identifiers that name it.
using VSLCountedSet = std::unordered_map<std::string, uint64_t>;

class VSLCodeSigningMapping : public std::enable_shared_from_this<VSLCodeSigningMapping> {
    struct Passkey {};

public:
    // Made once per process over the database in the library directory. None (and
    // tried again on the next call) when the database location cannot be built.
    static std::shared_ptr<VSLCodeSigningMapping> sharedInstance();
    // Tests: the instance sharedInstance() answers (none: open afresh next time).
    static void setSharedInstanceForTesting(std::shared_ptr<VSLCodeSigningMapping> mapping);

    static std::shared_ptr<VSLCodeSigningMapping> create(std::unique_ptr<VSLSQLiteDB> database,
                                                         std::shared_ptr<VSLUserIdentityCache> userIdentityCache);
    VSLCodeSigningMapping(Passkey, std::unique_ptr<VSLSQLiteDB> database,
                          std::shared_ptr<VSLUserIdentityCache> userIdentityCache);

    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // ---- registration ----

    // Registers, replaces or (with no info) removes an identifier's entry; stages
    // what the change makes obsolete on `commandQueue`. Returns a result code.
    uint64_t processCodeSigningInfo(const std::optional<Value>& codeSigningInfo,
                                    const std::optional<std::string>& identifier, const std::optional<Value>& options,
                                    const std::shared_ptr<VSLCommandQueue>& commandQueue);
    // A running client's own entitlements; installer-registered information wins.
    // An empty identifier counts as missing.
    uint64_t processCallerRegisteredEntitlements(const std::optional<Value>& entitlements,
                                                 const std::optional<std::string>& identifier,
                                                 const std::shared_ptr<VSLCommandQueue>& commandQueue);
    // Removes the children's entries, then the identifier's.
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                  const std::shared_ptr<VSLCommandQueue>& commandQueue);

    // ---- queries ----

    // For an external caller: none for placeholder, advance-copy and invalid entries.
    std::optional<Value> getCodeSigningInfoForIdentifier(const std::string& identifier);
    // Imports them from the bundle container's metadata when nothing is stored.
    std::optional<Value> entitlementsForIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> systemGroupIdentifiersForIdentifier(const std::string& identifier);
    bool identifierHasSystemContainer(const std::string& identifier);
    uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
    bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
    std::optional<std::vector<std::string>> childBundleIdentifiersForParentIdentifier(const std::string& identifier);
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
    std::optional<VSLCodeSigningEntry> codeSigningEntryForIdentifier(const std::string& identifier, VSLErrorRef* error);
    std::optional<std::set<std::string>> identifiersWithError(VSLErrorRef* error);

    // ---- maintenance ----

    bool invalidateCodeSigningInfoForIdentifier(const std::string& identifier, VSLErrorRef* error);
    bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier, VSLErrorRef* error);
    // Marks invalid every entry whose bundle container is gone (caller-registered
    // entries and plug-ins with a parent stay). Returns a result code.
    uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
    bool removeAllAdvanceCopiesWithError(VSLErrorRef* error);

    // ---- imports of what older builds kept outside the database ----

    // The file-based store, on the queue; made by sharedInstance when it opens the
    // database. The file goes once at least one entry was stored.
    void migrateFromMappingFileToDBIfNecessary();
    // Takes the global write lock: the group identifiers of the legacy mobile user's
    // data containers and the reconciliation of application groups (both not in
    // multi-user mode), the legacy entitlements file and the bundle containers'
    // cached information. Stagings are queued on `commandQueue` with locking, for the
    // caller to drain after the lock is released.
    void performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
        const std::shared_ptr<VSLCommandQueue>& commandQueue);
    void migrateAppGroupIdsFromDataContainersToFile();
    void migrateCachedCodeSigningInfoFromBundleContainersToMapping();

    // ---- group references ----

    VSLCountedSet copyReferenceCountSetOfType(VSLGroupType type);

    // The group rules, on an entitlements dictionary (null: none). Duplicates are
    // dropped; unsupported value shapes give none.
    static std::optional<std::vector<std::string>> _copyApplicationGroupEntitlementForIdentifier(
        const std::string& identifier, const Value* entitlements, const char* groupKey);
    // Primary key, then the fallback; identifiers without "systemgroup." are dropped.
    static std::optional<std::vector<std::string>> _systemGroupIdentifiersForIdentifier(const std::string& identifier,
                                                                                        const Value* entitlements);

private:
    void assertOnQueue() const;
    std::optional<std::vector<std::pair<std::string, VSLCodeSigningEntry>>> _readCodeSigningMappingFromDiskAtURL(
        const std::string& path);
    void _onQueue_migrateFromMappingFileToDBIfNecessary();
    void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    void _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
        const std::vector<std::shared_ptr<const VSLMetadata>>& containers);
    void _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
        const std::vector<std::shared_ptr<const VSLMetadata>>& containers, VSLContainerClass containerClass);
    // Stored entry; not found is none without a log, other errors are logged.
    std::optional<VSLCodeSigningEntry> _onQueue_codeSigningEntryForIdentifier(const std::string& identifier,
                                                                              VSLErrorRef* error,
                                                                              bool withChildren = true);
    std::optional<Value> _onQueue_entitlementsForIdentifier(const std::string& identifier);
    uint64_t _onQueue_processCodeSigningInfo(const std::optional<Value>& codeSigningInfo,
                                             const std::optional<std::string>& identifier,
                                             const std::optional<Value>& options,
                                             const std::optional<Value>& oldEntitlements,
                                             const std::shared_ptr<VSLCommandQueue>& commandQueue);
    void _onQueue_stageSystemContainerIfLost(const std::string& identifier, const Value* oldEntitlements,
                                             const Value* newEntitlements,
                                             const std::shared_ptr<VSLCommandQueue>& commandQueue);
    VSLErrorRef _onQueue_setCodeSigningDictionaryValues(const std::vector<VSLCodeSigningEntry>& values,
                                                        const std::vector<std::string>& identifiers);

    VSLCountedSet _onQueue_copyReferenceCountSetOfType(VSLGroupType type);
    using GroupIdsBlock = std::function<void(const std::string& identifier, const std::vector<std::string>& groups)>;
    void _onQueue_iterateGroupIdsWithKey(const char* key, const char* fallBackKey, const GroupIdsBlock& block);
    void _onQueue_handleChangeFromOldGroupContainerIds(const std::optional<std::vector<std::string>>& oldIds,
                                                       const std::optional<std::vector<std::string>>& newIds,
                                                       VSLGroupType type,
                                                       const std::shared_ptr<VSLCommandQueue>& commandQueue);
    void _onQueue_removeReferenceForGroupIdentifiers(const std::vector<std::string>& groupIdentifiers,
                                                     VSLGroupType type,
                                                     const std::shared_ptr<VSLCommandQueue>& commandQueue);
    void _onQueue_removeGroupContainersIfNeededforUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                               uint64_t groupContainerClass,
                                                               const std::vector<std::string>& groupIdentifiers,
                                                               VSLCountedSet referenceCounts,
                                                               const std::shared_ptr<VSLCommandQueue>& commandQueue);

    std::shared_ptr<WorkQueue> queue_;
    std::unique_ptr<VSLSQLiteDB> codeSigningMappingDB_;
    std::shared_ptr<VSLUserIdentityCache> userIdentityCache_;
    VSLCallerEntitlementsCache callerEntitlements_;
};

}  // namespace vsl
