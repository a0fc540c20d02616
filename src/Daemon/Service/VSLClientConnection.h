// What one caller may do in one request, and the client-facing container
// operations. One per message (or per piece of the daemon's own work).
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"
#include "Daemon/Service/VSLClientIdentity.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class VSLUserIdentityCache;
class VSLMetadata;
using VSLMetadataRef = std::shared_ptr<const VSLMetadata>;
class VSLReply;

// "com.tarrow.vesseld.deathrow": serial, background priority.
const std::shared_ptr<WorkQueue>& deathRowQueue();
class VSLClientConnection;
using VSLClientConnectionRef = std::shared_ptr<VSLClientConnection>;

class VSLClientConnection : public std::enable_shared_from_this<VSLClientConnection> {
public:
    static VSLClientConnectionRef create(VSLClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
                                         bool unrestricted, std::optional<Value> lookup,
                                         std::optional<std::vector<std::string>> entitledWipeIdentifiers,
                                         std::shared_ptr<VSLCommandQueue> commandQueue);
    // The daemon's own connection: anonymous privileged identity, entitled and unrestricted.
    static VSLClientConnectionRef createPrivileged();
    static VSLClientConnectionRef privilegedClientConnectionWithUserIdentity(VSLUserIdentityRef userIdentity,
                                                                             bool kernel = false);
    static VSLClientConnectionRef sharedClientConnection();

    const VSLClientIdentityRef& clientIdentity() const { return clientIdentity_; }
    std::string clientBundleIdentifier() const;
    const std::shared_ptr<VSLCommandQueue>& commandQueue() const { return commandQueue_; }
    const std::optional<Value>& lookup() const { return lookup_; }
    const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const { return wipeIdentifiers_; }
    std::shared_ptr<VSLUserIdentityCache> userIdentityCache() const;
    static const std::shared_ptr<WorkQueue>& backgroundQueue();

    bool entitled() const { return entitled_; }
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    bool unrestricted() const { return unrestricted_; }
    void setEntitled(bool v) { entitled_ = v; }
    void setAllowOtherIdLookup(bool v) { allowOtherIdLookup_ = v; }
    void setAllowGroupIdLookup(bool v) { allowGroupIdLookup_ = v; }
    void setUnrestricted(bool v) { unrestricted_ = v; }

    bool isEntitledForLookupWithClass(VSLContainerClass c, const std::string& identifier);
    // The checked lookup set of a class; none for a class without a short name.
    std::optional<std::set<std::string>> lookupForContainerClass(VSLContainerClass c);

    // Runs the queued commands until the queue is empty or one fails.
    bool completeWithError(uint64_t* code);

    // Containers. Create-or-lookup takes the global read lock to look up and the write
    // lock to create, unless `useLocking` is false (the caller holds the write lock).
    VSLMetadataRef createOrLookupContainerWithContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                bool createIfNecessary, bool transient,
                                                                bool useLocking, uint64_t* code);
    std::optional<std::vector<VSLMetadataRef>> containersWithClass(VSLContainerClass containerClass, bool transient,
                                                                   uint64_t* code);
    // Queues the deletion on this request's command queue.
    bool deleteContainerWithContainerIdentity(const VSLContainerIdentityRef& identity, bool transient,
                                              uint64_t* code);
    bool _createTopLevelContainerDirectory(const std::string& url, VSLContainerClass containerClass, uid_t owner,
                                           VSLErrorRef* error);
    // With `onlyMissing`, an entry that exists (whatever it is) is left as it is.
    bool _createSubDirectories(const std::string& url, const VSLMetadata& metadata, VSLErrorRef* error,
                               bool onlyMissing = false);
    int32_t _dataProtectionClassForContainerMetadata(const VSLMetadata& metadata);

    // Every group the owner's entitlements name for the class (7 or 13), created when
    // missing, under one global write lock (VSLClientConnectionGroups.cpp). A group
    // that cannot be made is logged and left out without failing the call.
    std::optional<std::map<std::string, VSLMetadataRef>> groupContainersForOwnerIdentifier(
        const std::string& ownerIdentifier, const VSLUserIdentityRef& userIdentity,
        VSLContainerClass groupContainerClass, uint64_t* code);

    // Info values, metadata, skeleton, directory name and disk usage of one existing
    // container (VSLClientConnectionInfo.cpp). Reads take its identifier read lock,
    // writes its write lock; the renaming takes the global write lock.
    bool setInfoValue(const std::optional<Value>& value, const Value& key,
                      const VSLConcreteContainerIdentityRef& identity, bool useLocking, uint64_t* code);
    std::optional<Value> infoValueForKey(const Value& key, const VSLConcreteContainerIdentityRef& identity,
                                         bool useLocking, uint64_t* code);
    VSLMetadataRef metadataWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity, uint64_t* code);
    bool recreateDefaultStructureWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                       uint64_t* code);
    bool regenerateDirectoryUUIDWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                      uint64_t* code);
    std::optional<uint64_t> diskUsageWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                           uint64_t* code);
    // Content operations on paths that clients name (VSLClientConnectionContent.cpp).
    // Every client path is resolved once and only the resolved result is used.
    // Wipe: the container keeps identity, UUID and place; its content becomes a fresh
    // skeleton, the old content goes through death row.
    bool deleteDataContainerContentWithContainerIdentity(const VSLContainerIdentityRef& identity, uint64_t* code);
    // Moves a tree inside a system group container; returns the destination.
    std::optional<std::string> stageSharedContentForIdentifier(const Value& identifier, const Value& sourceRelativePath,
                                                               const Value& destRelativePath, uint64_t* code);
    // "Library/<name>" or the absolute path of the container's assets directory.
    std::optional<std::string> userManagedAssetsPathWithContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                          bool isRelative, bool createIfNecessary,
                                                                          bool* existed, uint64_t* code);
    bool deleteUserManagedAssetWithContainerIdentity(const VSLContainerIdentityRef& identity,
                                                     const std::optional<std::string>& relativePath, uint64_t* code);

    // Exits the process while crashes remain (VSLRetryTest.cpp).
    bool retryTestWithNumCrashes(uint64_t numCrashes, uint64_t* code);

    // Puts the new container in the old one's place (an application update), under the
    // global write lock and a journal, so that a crash leaves one of the two in place.
    // An old identity without a UUID promotes the new container to its class's
    // permanent place. `code` is written only on failure.
    void replaceContainerIdentity(const VSLContainerIdentityRef& oldIdentity,
                                  const VSLContainerIdentityRef& newIdentity, bool preserveOldUUID,
                                  bool startDeletionThread, uint64_t* code);
    // Every start: rolls back the replacements a crash left half-done, drops the rest.
    bool _recoverFromReplaceOperationsWithError(VSLErrorRef* error);

    // Death row. Destruction runs later on the death-row queue inside a keep-alive
    // transaction; the completion gets 1, or the code of the last failure.
    void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);
    // True when the item is on death row or no longer exists.
    bool _moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread, VSLErrorRef* error);
    // Start-up clean-ups (VSLClientConnectionCleanup.cpp). Both return at once; the work
    // and the completion run on the background queue. Every start: staging items of the
    // last process go to death row, then death row is destroyed.
    void vesselCleanupWithCompletion(std::function<void()> completion);
    // True when the item is gone from its place (removed, or moved to /tmp).
    bool _removeItemOrMoveToTempAtURL(const std::string& url, VSLErrorRef* error);

private:
    VSLClientConnection() = default;
    bool mayAccess(const VSLContainerIdentity& identity, uint64_t* code);
    VSLMetadataRef createContainer(const VSLContainerIdentityRef& identity, bool transient, VSLErrorRef* error);
    std::optional<std::string> makeUserManagedAssetsDirectory(const std::string& parent, const VSLMetadata& container,
                                                              VSLErrorRef* error);
    bool _lock_setInfoValue(const std::optional<Value>& value, const std::string& key,
                            const VSLConcreteContainerIdentityRef& identity, VSLErrorRef* error);

    VSLClientIdentityRef clientIdentity_;
    std::shared_ptr<VSLCommandQueue> commandQueue_;
    std::optional<Value> lookup_;
    std::optional<std::vector<std::string>> wipeIdentifiers_;
    bool entitled_ = false;
    bool allowOtherIdLookup_ = false;
    bool allowGroupIdLookup_ = false;
    bool unrestricted_ = false;

    std::mutex mutex_;  // creates the sanitized lookup
    std::shared_ptr<std::pair<std::mutex, std::map<std::string, std::set<std::string>>>> sanitizedLookup_;
};

// Adds a sandbox token for the container to the reply when the rules allow one.
void issueSandboxExtension(VSLReply& reply, const char* replyKey, const VSLMetadata& metadata,
                           const VSLClientIdentityRef& client);
// The token itself; none where the rules give none.
std::optional<std::string> sandboxExtensionForContainer(const VSLMetadata& metadata,
                                                        const VSLClientIdentityRef& client);

}  // namespace vsl
