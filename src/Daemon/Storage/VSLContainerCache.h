// The in-memory index of every container on disk: user identity x class ->
// identifier -> VSLMetadata. An index of one key is built from its class directory on
// first use and then kept current by add and remove; the cache mirrors containers
// into the kernel sandbox's per-user state and can read that state back to answer a
// lookup without a scan.
//
// Locking: `cacheLock_` guards only the two maps of keys to indexes and is held
// briefly; each index has its own mutex, taken after `cacheLock_` is released, under
// which it is built (directory scan and metadata reads) and read. So a rebuild
// blocks only lookups of its own key. Both are taken before the user identity
// cache's lock, never the other way round. No operation may run on the code-signing
// mapping's queue.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLMetadata.h"

namespace vsl {

class VSLCodeSigningMapping;

class VSLContainerCache : public VSLUserIdentityCacheObserver, public std::enable_shared_from_this<VSLContainerCache> {
    struct Passkey {};

public:
    // Points where other parts of the daemon, and tests, plug in.
    struct Hooks {
        // Called by a rebuild just before it lists its class directory (where a held
        // test lock makes rebuilds wait).
        std::function<void(const std::string& cacheKey, bool transient, const std::string& classDirectory)>
            willScanClassDirectory;
        // Whether a class 12 or 13 directory entry bears a well-known container name
        // (default: the shared whitelist).
        std::function<bool(VSLContainerClass containerClass, const std::string& name)> isWellKnownContainerName;
        // Posts CONTAINER_NOTIFY_USER_INVALIDATED; returns 0 or the failure status.
        std::function<uint32_t()> postUserInvalidatedNotification;
    };

    static const std::shared_ptr<VSLContainerCache>& sharedInstance();
    // Registers the new cache as an observer of `userIdentityCache`.
    static std::shared_ptr<VSLContainerCache> initWithUserIdentityCache(
        std::shared_ptr<VSLUserIdentityCache> userIdentityCache,
        std::shared_ptr<VSLCodeSigningMapping> codeSigningMapping, Hooks hooks = {});
    VSLContainerCache(Passkey, std::shared_ptr<VSLUserIdentityCache> userIdentityCache,
                      std::shared_ptr<VSLCodeSigningMapping> codeSigningMapping, Hooks hooks);
    ~VSLContainerCache() override;
    VSLContainerCache(const VSLContainerCache&) = delete;
    VSLContainerCache& operator=(const VSLContainerCache&) = delete;

    VSLMetadataRef containerForContainerIdentity(const VSLContainerIdentityRef& identity, bool transient,
                                                 bool updateSandbox, bool allowKernelLookup, VSLErrorRef* error);
    VSLMetadataRef containerForContainerIdentity(const VSLContainerIdentityRef& identity, bool transient,
                                                 bool updateSandbox, VSLErrorRef* error);
    // The live container, else the transient one, whose UUID is the identity's.
    VSLMetadataRef containerForContainerIdentity(const VSLConcreteContainerIdentityRef& identity);

    std::optional<std::vector<VSLMetadataRef>> allContainersForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                            VSLContainerClass containerClass,
                                                                            bool transient, bool populateSandboxCache,
                                                                            VSLErrorRef* error);
    std::optional<std::vector<VSLMetadataRef>> allContainersForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                            VSLContainerClass containerClass,
                                                                            bool transient, VSLErrorRef* error);

    bool addContainerMetadata(const VSLMetadataRef& metadata, const std::string& url, bool transient,
                              bool updateSandbox, VSLErrorRef* error);
    bool removeContainerForUserIdentity(const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass,
                                        const std::string& identifier, bool transient, VSLErrorRef* error);

    // Pushes one item into the kernel sandbox state; no url removes it.
    bool setSandboxContainerMappingForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                   const std::string& identifier, VSLContainerClass containerClass,
                                                   const std::optional<std::string>& url);
    bool shouldRegisterSandboxMappingWithUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                      const std::string& identifier, VSLContainerClass containerClass);
    // Whether a class directory entry can be a container.
    bool containerURLIsValidForContainerClass(const std::string& url, VSLContainerClass containerClass) const;

    // Drops every index of that identity (and so the shared global-class indexes) and
    // its sandbox items.
    void invalidateUserIdentity(const VSLUserIdentityRef& userIdentity);
    void userIdentityCache(VSLUserIdentityCache& cache, const VSLUserIdentityRef& invalidatedIdentity) override;

    const std::shared_ptr<VSLUserIdentityCache>& userIdentityCache() const { return userIdentityCache_; }
    const std::shared_ptr<VSLCodeSigningMapping>& codeSigningMapping() const { return codeSigningMapping_; }

    static std::string _cacheKeyForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                VSLContainerClass containerClass);

private:
    struct ClassIndex;
    using IndexMap = std::unordered_map<std::string, std::shared_ptr<ClassIndex>>;

    std::shared_ptr<ClassIndex> indexForKey(const std::string& key, bool transient);
    // With the index's mutex held: builds it unless built (or `buildCache` is false);
    // true when the index is there afterwards.
    bool _lock_getCache(ClassIndex& index, const std::string& key, const VSLUserIdentityRef& userIdentity,
                        VSLContainerClass containerClass, bool transient, bool populateSandboxCache, bool buildCache,
                        VSLErrorRef* error);
    VSLMetadataRef _lock_metadataFromSandboxForContainerIdentity(const VSLContainerIdentity& identity);
    // Lookup step after the locks: the record's metadata file must still be there.
    VSLMetadataRef checkedRecord(const VSLMetadataRef& record, VSLContainerClass containerClass, bool transient,
                                 const char* foundFormat, VSLErrorRef* error);
    // Forgets a record whose metadata file vanished, unless a newer one took its place.
    void removeStaleRecord(const VSLMetadataRef& record, bool transient);
    void pushSandboxItems(const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass,
                          const std::vector<VSLMetadataRef>& records);

    const std::shared_ptr<VSLUserIdentityCache> userIdentityCache_;
    const std::shared_ptr<VSLCodeSigningMapping> codeSigningMapping_;
    const Hooks hooks_;

    std::mutex cacheLock_;
    IndexMap liveContainerCache_;
    IndexMap transientContainerCache_;
};

}  // namespace vsl
