// The device's persona list as user identities: which identity a caller, a persona
// unique string, a kernel persona ID or a bundle identifier maps to. Built lazily from
// the user-management service and flushed when the persona list changes.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/UserManagement.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class VSLUserIdentityCache;

using VSLUserIdentitySet = std::unordered_set<VSLUserIdentityRef, VSLUserIdentityHash, VSLUserIdentityEqual>;

// Told about enterprise identities that are no longer valid. Called after the
// cache's lock is released, so an observer may take its own lock and call back in.
class VSLUserIdentityCacheObserver {
public:
    virtual ~VSLUserIdentityCacheObserver() = default;
    virtual void userIdentityCache(VSLUserIdentityCache& cache, const VSLUserIdentityRef& invalidatedIdentity) = 0;
};

class VSLUserIdentityCache : public VSLUserIdentityResolver,
                             public PersonaListObserver,
                             public std::enable_shared_from_this<VSLUserIdentityCache> {
protected:
    struct Passkey {};

public:
    struct Options {
        std::shared_ptr<UserManagement> userManagement;  // default: the device's personas.plist service
        std::optional<bool> personasSupported;           // default: personasAreSupported()
        std::function<void(std::chrono::seconds)> sleep;  // between resync attempts; default: really sleep
    };

    // An independent cache (the daemon uses VSLUserIdentitySharedCache::sharedInstance()).
    static std::shared_ptr<VSLUserIdentityCache> create(Options options = {});

    VSLUserIdentityCache(Passkey, Options options);
    ~VSLUserIdentityCache() override;
    VSLUserIdentityCache(const VSLUserIdentityCache&) = delete;
    VSLUserIdentityCache& operator=(const VSLUserIdentityCache&) = delete;

    // Made once per process: the user "mobile", personal, no unique string.
    static VSLUserIdentityRef defaultUserIdentity();
    static VSLUserIdentityRef userIdentityForLegacyMobileUser();
    // Computed once from the device facts.
    static bool personasAreSupported();
    // Identity of a persona; no attributes gives the unspecific kind of the uid.
    static VSLUserIdentityRef userIdentityWithPersonaAttributes(const PersonaAttributes* attributes, uid_t uid,
                                                                gid_t gid, bool forceUnspecific);

    VSLUserIdentityRef userIdentityForPersonalPersona();
    VSLUserIdentityRef userIdentityForPersonalPersona(uid_t uid, gid_t gid) override;
    VSLUserIdentityRef unspecificUserIdentity();
    VSLUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& personaUniqueString,
                                                          uid_t uid, gid_t gid) override;
    VSLUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(
        const std::optional<std::string>& personaUniqueString);
    VSLUserIdentityRef userIdentityWithPersonaID(uint32_t personaID);
    VSLUserIdentitySet userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
    bool isBundleIdentifier(const std::string& bundleIdentifier, const VSLUserIdentityRef& userIdentity);

    // The identity of the calling context's persona. Without arguments the caller is
    // the mobile user; the dispatcher passes the peer's uid and gid, which also tell
    // the user-management service whose current persona it is.
    VSLUserIdentityRef userIdentityForCurrentContext();
    VSLUserIdentityRef userIdentityForCurrentContext(uid_t uid, gid_t gid);

    // Once per distinct identity, on the calling thread, outside the lock.
    void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        const std::function<void(const VSLUserIdentityRef&)>& block);

    void flush();
    // Replaces the persona maps with these identities; the last personal and the last
    // unspecific one win. No observer is told.
    void flushAndRepopulateWithUserIdentities(const std::vector<VSLUserIdentityRef>& userIdentities);

    void addObserver(const std::shared_ptr<VSLUserIdentityCacheObserver>& observer);
    void removeObserver(const std::shared_ptr<VSLUserIdentityCacheObserver>& observer);

    void personaListDidUpdate() override;
    void unregister();

    bool isRegistered();

protected:
    // Registers for persona-list updates; the last step of construction.
    void start();

private:
    using IdentityByString = std::unordered_map<std::string, VSLUserIdentityRef>;
    using IdentityByPersonaID = std::unordered_map<uint32_t, VSLUserIdentityRef>;
    using IdentitiesByBundle = std::unordered_map<std::string, VSLUserIdentitySet>;

    static VSLUserIdentityRef updateUserIdentity(const VSLUserIdentityRef& identity, uid_t uid, gid_t gid);
    static void mobileUIDAndGID(uid_t* uid, gid_t* gid);

    std::vector<VSLUserIdentityRef> lock_flush();
    void lock_resyncIfInvalid();
    void lock_resync();
    bool lock_resyncFromUserPersonaAttributes(const PersonaAttributesList& attributes);
    void lock_flushAndRepopulateWithUserIdentities(const std::vector<VSLUserIdentityRef>& userIdentities);
    void notifyObservers(const std::vector<VSLUserIdentityRef>& invalidated);

    const std::shared_ptr<UserManagement> userManagement_;
    const bool personasSupported_;
    const std::function<void(std::chrono::seconds)> sleep_;

    // Lock order: the container cache takes its own mutex before this one, never the
    // other way round; so observers are called only after this lock is released.
    std::mutex lock_;
    std::shared_ptr<WorkQueue> flushQueue_;
    bool registered_ = false;
    bool cacheInvalid_ = false;
    IdentitiesByBundle lock_bundleToEnterpriseIdentitiesMap_;
    IdentityByString lock_personaUniqueStringToUserIdentityMap_;
    IdentityByPersonaID lock_personaIDToUserIdentityMap_;
    VSLUserIdentityRef lock_userIdentityForPersonalPersona_;
    VSLUserIdentityRef lock_userIdentityForUnspecificPersona_;

    std::mutex observersMonitor_;
    std::vector<std::weak_ptr<VSLUserIdentityCacheObserver>> observers_;
};

// The process-wide cache.
class VSLUserIdentitySharedCache : public VSLUserIdentityCache {
public:
    VSLUserIdentitySharedCache(Passkey p, Options options) : VSLUserIdentityCache(p, std::move(options)) {}
    static const std::shared_ptr<VSLUserIdentitySharedCache>& sharedInstance();
};

}  // namespace vsl
