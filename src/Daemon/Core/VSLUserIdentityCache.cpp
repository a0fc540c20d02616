#include "Daemon/Core/VSLUserIdentityCache.h"

#include <algorithm>
#include <thread>
#include <unordered_set>

#include "Daemon/Core/VSLInvariant.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"
#include "Platform/Transaction.h"

namespace vsl {

namespace {

const char* const kFlushQueueLabel = "com.tarrow.vesseld.VSLUserIdentityCache.flushQueue";
const char* const kPersonaObserverServiceName = "com.tarrow.vesseld.personaobserver";
const char* const kPersonaListTransactionName = "com.tarrow.vesseld.personaListDidUpdate";
const char* const kResyncFunction = "-[VSLUserIdentityCache _lock_resync]";
const char* const kRebuildFunction = "-[VSLUserIdentityCache _lock_resync_fromUserPersonaAttributes:]";
// Attempts after the first; one second apart.
constexpr unsigned long kResyncRetries = 60;

std::string shortDescriptionOf(const VSLUserIdentityRef& identity) {
    return identity ? identity->shortDescription() : std::string("(null)");
}

std::string joined(const std::vector<std::string>& items) {
    std::string s = "(";
    for (const auto& item : items) s += (s.size() > 1 ? ", " : "") + item;
    return s + ")";
}

// Logged to both logs: these mean the persona list is not what the device needs.
template <class... Args>
void logErrorAndFault(const char* function, std::string_view format, const Args&... args) {
    LogWrite(kLogLevelError, function, format, args...);
    osLog(LogCategory::Unspecified, OSLogLevel::Fault, format, args...);
}

}  // namespace

// ---- class operations ----

std::shared_ptr<VSLUserIdentityCache> VSLUserIdentityCache::create(Options options) {
    auto cache = std::make_shared<VSLUserIdentityCache>(Passkey{}, std::move(options));
    cache->start();
    return cache;
}

VSLUserIdentityRef VSLUserIdentityCache::defaultUserIdentity() { return ::vsl::defaultUserIdentity(); }

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForLegacyMobileUser() {
    static const VSLUserIdentityRef identity = VSLUserIdentity::legacyMobile();
    return identity;
}

bool VSLUserIdentityCache::personasAreSupported() {
    // Multi-user devices and ephemeral storage rule personas out; otherwise the
    // device's configuration switch decides.
    static const bool supported = [] {
        const DeviceFacts& facts = deviceFacts();
        if (facts.multiUser) return false;
        if (!facts.personasSupported) return false;
        return !facts.ephemeralStorage;
    }();
    return supported;
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityWithPersonaAttributes(const PersonaAttributes* attributes,
                                                                           uid_t uid, gid_t gid,
                                                                           bool forceUnspecific) {
    std::optional<std::string> unique = attributes ? attributes->uniqueString : std::nullopt;
    int32_t personaID = static_cast<int32_t>(attributes ? attributes->kernelPersonaID : uid);
    std::string home = attributes && attributes->isEnterprise && attributes->layoutPath
                           ? *attributes->layoutPath
                           : VSLFileManager::homeDirectoryURLForPOSIXUID(uid);
    uint32_t type = kVSLPersonaTypeUnspecific;
    if (!forceUnspecific && attributes && attributes->isPersonal) type = kVSLPersonaTypePersonal;
    if (!forceUnspecific && attributes && attributes->isEnterprise) type = kVSLPersonaTypeEnterprise;
    return VSLUserIdentity::create(uid, gid, std::move(home), std::move(unique), type, personaID);
}

VSLUserIdentityRef VSLUserIdentityCache::updateUserIdentity(const VSLUserIdentityRef& identity, uid_t uid,
                                                            gid_t gid) {
    if (!identity) return nullptr;
    // An enterprise home belongs to the persona, every other home to the uid.
    std::string home = identity->isEnterprise() ? identity->homeDirectoryURL()
                                                : VSLFileManager::homeDirectoryURLForPOSIXUID(uid);
    return VSLUserIdentity::create(uid, gid, std::move(home), identity->personaUniqueString(),
                                   identity->personaType(), identity->kernelPersonaID());
}

void VSLUserIdentityCache::mobileUIDAndGID(uid_t* uid, gid_t* gid) {
    VSLUserIdentityRef mobile = defaultUserIdentity();
    *uid = mobile ? mobile->posixUID() : kVSLFirstRegularUID;
    *gid = mobile ? mobile->posixGID() : kVSLFirstRegularUID;
}

// ---- life cycle ----

VSLUserIdentityCache::VSLUserIdentityCache(Passkey, Options options)
    : userManagement_(options.userManagement ? std::move(options.userManagement) : UserManagement::create()),
      personasSupported_(options.personasSupported ? *options.personasSupported : personasAreSupported()),
      sleep_(options.sleep ? std::move(options.sleep)
                           : std::function<void(std::chrono::seconds)>(
                                 [](std::chrono::seconds s) { std::this_thread::sleep_for(s); })) {
    flush();
    flushQueue_ = WorkQueue::serial(kFlushQueueLabel);
}

VSLUserIdentityCache::~VSLUserIdentityCache() { unregister(); }

void VSLUserIdentityCache::start() {
    auto error = userManagement_->registerPersonaListObserver(weak_from_this(), kPersonaObserverServiceName);
    if (error) {
        logErrorAndFault("-[VSLUserIdentityCache init]", "Failed to register for persona list updates: %@", *error);
        return;
    }
    {
        std::lock_guard g(lock_);
        registered_ = true;
    }
    osLog(LogCategory::Unspecified, OSLogLevel::Default, "Registered for persona list updates.");
}

void VSLUserIdentityCache::unregister() {
    std::lock_guard g(lock_);
    registered_ = false;
}

bool VSLUserIdentityCache::isRegistered() {
    std::lock_guard g(lock_);
    return registered_;
}

void VSLUserIdentityCache::personaListDidUpdate() {
    osLog(LogCategory::Unspecified, OSLogLevel::Default, "Received persona list update notification");
    auto transaction = std::make_shared<Transaction>(kPersonaListTransactionName);
    std::weak_ptr<VSLUserIdentityCache> weakSelf = weak_from_this();
    flushQueue_->async([weakSelf, transaction] {
        if (auto self = weakSelf.lock()) {
            osLog(LogCategory::Unspecified, OSLogLevel::Default, "Flushing user identity cache after persona list update");
            self->flush();
        }
        transaction->close();
    });
}

// ---- lookups ----

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForPersonalPersona() {
    uid_t uid;
    gid_t gid;
    mobileUIDAndGID(&uid, &gid);
    return userIdentityForPersonalPersona(uid, gid);
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForPersonalPersona(uid_t uid, gid_t gid) {
    if (uid < kVSLFirstRegularUID) mobileUIDAndGID(&uid, &gid);
    VSLUserIdentityRef personal;
    {
        std::lock_guard g(lock_);
        lock_resyncIfInvalid();
        personal = lock_userIdentityForPersonalPersona_;
    }
    if (!personal || (personal->posixUID() == uid && personal->posixGID() == gid)) return personal;
    return updateUserIdentity(personal, uid, gid);
}

VSLUserIdentityRef VSLUserIdentityCache::unspecificUserIdentity() {
    std::lock_guard g(lock_);
    lock_resyncIfInvalid();
    return lock_userIdentityForUnspecificPersona_;
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForPersonaUniqueString(
    const std::optional<std::string>& personaUniqueString, uid_t uid, gid_t gid) {
    if (uid < kVSLFirstRegularUID) mobileUIDAndGID(&uid, &gid);
    if (!personasSupported_) return userIdentityForPersonalPersona(uid, gid);
    VSLUserIdentityRef found;
    {
        std::lock_guard g(lock_);
        lock_resyncIfInvalid();
        if (!personaUniqueString) {
            found = lock_userIdentityForUnspecificPersona_;
        } else if (auto it = lock_personaUniqueStringToUserIdentityMap_.find(*personaUniqueString);
                   it != lock_personaUniqueStringToUserIdentityMap_.end()) {
            found = it->second;
        }
    }
    if (!found || (found->posixUID() == uid && found->posixGID() == gid)) return found;
    return updateUserIdentity(found, uid, gid);
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    const std::optional<std::string>& personaUniqueString) {
    if (!personasSupported_) return userIdentityForPersonalPersona();
    if (!personaUniqueString) return unspecificUserIdentity();
    VSLUserIdentityRef found;
    {
        std::lock_guard g(lock_);
        lock_resyncIfInvalid();
        auto it = lock_personaUniqueStringToUserIdentityMap_.find(*personaUniqueString);
        if (it != lock_personaUniqueStringToUserIdentityMap_.end()) found = it->second;
    }
    if (found)
        osLog(LogCategory::Cache, OSLogLevel::Info, "Found %@ for %@", found->shortDescription(), *personaUniqueString);
    return found;
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityWithPersonaID(uint32_t personaID) {
    std::lock_guard g(lock_);
    lock_resyncIfInvalid();
    auto it = lock_personaIDToUserIdentityMap_.find(personaID);
    return it == lock_personaIDToUserIdentityMap_.end() ? nullptr : it->second;
}

VSLUserIdentitySet VSLUserIdentityCache::userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier) {
    std::lock_guard g(lock_);
    lock_resyncIfInvalid();
    auto it = lock_bundleToEnterpriseIdentitiesMap_.find(bundleIdentifier);
    if (it != lock_bundleToEnterpriseIdentitiesMap_.end()) return it->second;
    // Listed nowhere: the bundle runs in the personal persona only.
    VSLUserIdentitySet personalOnly;
    if (lock_userIdentityForPersonalPersona_) personalOnly.insert(lock_userIdentityForPersonalPersona_);
    return personalOnly;
}

bool VSLUserIdentityCache::isBundleIdentifier(const std::string& bundleIdentifier,
                                              const VSLUserIdentityRef& userIdentity) {
    if (!personasSupported_) return true;
    return userIdentitiesForBundleIdentifier(bundleIdentifier).count(userIdentity) > 0;
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForCurrentContext() {
    uid_t uid;
    gid_t gid;
    mobileUIDAndGID(&uid, &gid);
    return userIdentityForCurrentContext(uid, gid);
}

VSLUserIdentityRef VSLUserIdentityCache::userIdentityForCurrentContext(uid_t uid, gid_t gid) {
    // The service is asked about the real caller: a role user has no persona of its
    // own, and the identity it gets is then the unspecific one.
    const PersonaContext caller{uid, gid, std::nullopt};
    if (uid < kVSLFirstRegularUID) mobileUIDAndGID(&uid, &gid);
    VSLUserIdentityRef result;
    if (!personasSupported_) {
        result = userIdentityForPersonalPersona(uid, gid);
        osLog(LogCategory::Ipc, OSLogLevel::Info, "(%d/%d) Personas not supported, using: %@", uid, gid,
              shortDescriptionOf(result));
        return result;
    }
    std::optional<PersonaAttributes> persona = userManagement_->currentPersona(caller);
    if (persona && persona->isPersonal) {
        result = userIdentityForPersonalPersona(uid, gid);
        osLog(LogCategory::Ipc, OSLogLevel::Info, "(%d/%d) Explicit personal persona, using: %@", uid, gid,
              shortDescriptionOf(result));
    } else if (persona && persona->isEnterprise && persona->uniqueString) {
        result = userIdentityForPersonaUniqueString(persona->uniqueString, uid, gid);
        osLog(LogCategory::Ipc, OSLogLevel::Info, "(%d/%d) Looked up user identity for [%@]: %@", uid, gid,
              *persona->uniqueString, shortDescriptionOf(result));
    } else {
        result = userIdentityForPersonaUniqueString(std::nullopt, uid, gid);
        osLog(LogCategory::Ipc, OSLogLevel::Info, "(%d/%d) No persona (<%p>) or no unique string [%@], using: %@",
              uid, gid, static_cast<const void*>(persona ? &*persona : nullptr),
              persona ? persona->uniqueString : std::nullopt, shortDescriptionOf(result));
    }
    return result;
}

void VSLUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const VSLUserIdentityRef&)>& block) {
    if (!personasSupported_) {
        block(defaultUserIdentity());
        return;
    }
    VSLUserIdentitySet identities;
    {
        std::lock_guard g(lock_);
        lock_resyncIfInvalid();
        for (const auto& [unique, identity] : lock_personaUniqueStringToUserIdentityMap_)
            if (identity) identities.insert(identity);
    }
    if (identities.empty()) {
        LogWrite(kLogLevelError, "-[VSLUserIdentityCache forEachAccessibleUserIdentitySynchronouslyExecuteBlock:]",
                 "Expected to find at least one persona; self = %@, personaAttributeList = %@",
                 formatLog("<VSLUserIdentityCache: %p>", static_cast<const void*>(this)),
                 describePersonaList(userManagement_->allPersonas()));
        block(defaultUserIdentity());
        return;
    }
    for (const auto& identity : identities) block(identity);
}

// ---- flushing and rebuilding ----

void VSLUserIdentityCache::flush() {
    std::vector<VSLUserIdentityRef> invalidated;
    {
        std::lock_guard g(lock_);
        invalidated = lock_flush();
    }
    notifyObservers(invalidated);
}

void VSLUserIdentityCache::flushAndRepopulateWithUserIdentities(const std::vector<VSLUserIdentityRef>& userIdentities) {
    std::lock_guard g(lock_);
    lock_flushAndRepopulateWithUserIdentities(userIdentities);
}

std::vector<VSLUserIdentityRef> VSLUserIdentityCache::lock_flush() {
    VSLUserIdentitySet enterprise;
    for (const auto& [unique, identity] : lock_personaUniqueStringToUserIdentityMap_)
        if (identity && identity->isEnterprise()) enterprise.insert(identity);
    cacheInvalid_ = true;
    lock_bundleToEnterpriseIdentitiesMap_ = {};
    lock_personaUniqueStringToUserIdentityMap_ = {};
    lock_personaIDToUserIdentityMap_ = {};
    lock_userIdentityForPersonalPersona_ = defaultUserIdentity();
    lock_userIdentityForUnspecificPersona_ = defaultUserIdentity();
    return {enterprise.begin(), enterprise.end()};
}

void VSLUserIdentityCache::notifyObservers(const std::vector<VSLUserIdentityRef>& invalidated) {
    for (const auto& identity : invalidated) {
        std::vector<std::shared_ptr<VSLUserIdentityCacheObserver>> snapshot;
        {
            std::lock_guard g(observersMonitor_);
            for (const auto& weak : observers_)
                if (auto observer = weak.lock()) snapshot.push_back(std::move(observer));
        }
        for (const auto& observer : snapshot) observer->userIdentityCache(*this, identity);
    }
}

void VSLUserIdentityCache::lock_resyncIfInvalid() {
    if (cacheInvalid_) lock_resync();
}

void VSLUserIdentityCache::lock_resync() {
    if (!personasSupported_) {
        cacheInvalid_ = false;
        return;
    }
    // Readers wait on the lock meanwhile: answering from a half-known list would
    // put containers under the wrong persona.
    for (unsigned long attempt = 0;; attempt++) {
        PersonaAttributesList attributes = userManagement_->allPersonas();
        osLog(LogCategory::Unspecified, OSLogLevel::Default, "Got userPersonaAttributes: %@ on try: %lu",
              describePersonaList(attributes), attempt);
        if (!attributes.empty() && lock_resyncFromUserPersonaAttributes(attributes)) break;
        if (attributes.empty() && attempt == 0) {
            LogWrite(kLogLevelError, kResyncFunction, "Did not receive any persona attributes: %@",
                     describePersonaList(attributes));
            osLog(LogCategory::Unspecified, OSLogLevel::Fault, "Did not receive any persona attributes.");
        } else if (attempt == kResyncRetries) {
            LogWrite(kLogLevelError, kResyncFunction,
                     "Could not obtain persona attributes after exhausting retries, crashing");
            VSLFatalError(kResyncFunction, "Could not obtain persona attributes after exhausting retries.");
        }
        sleep_(std::chrono::seconds(1));
    }
    cacheInvalid_ = false;
}

bool VSLUserIdentityCache::lock_resyncFromUserPersonaAttributes(const PersonaAttributesList& attributes) {
    IdentitiesByBundle bundleMap;
    std::unordered_set<std::string> universalBundles;
    IdentityByString byUniqueString;
    IdentityByPersonaID byPersonaID;

    auto personalIt = std::find_if(attributes.begin(), attributes.end(), [](const auto& p) { return p.isPersonal; });
    if (personalIt == attributes.end()) {
        logErrorAndFault(kRebuildFunction, "Expected to find a personal persona in %@", describePersonaList(attributes));
        return false;
    }
    const PersonaAttributes& personalAttributes = *personalIt;
    if (!personalAttributes.uniqueString) {
        logErrorAndFault(kRebuildFunction, "Invalid persona unique string for personal %@", personalAttributes);
        return false;
    }
    uid_t uid;
    gid_t gid;
    mobileUIDAndGID(&uid, &gid);
    VSLUserIdentityRef personal = userIdentityWithPersonaAttributes(&personalAttributes, uid, gid, false);
    VSLUserIdentityRef unspecific = userIdentityWithPersonaAttributes(&personalAttributes, uid, gid, true);
    osLog(LogCategory::Unspecified, OSLogLevel::Default, "Found personal persona %@: created personal %@, unspecific %@",
          personalAttributes, personal, unspecific);
    if (!personal || !unspecific) {
        logErrorAndFault(kRebuildFunction, "Expected to find a personal persona in %@", describePersonaList(attributes));
        return false;
    }
    byUniqueString[*personalAttributes.uniqueString] = personal;
    byPersonaID[personalAttributes.kernelPersonaID] = personal;

    // Universal and system personas first, so that the universal bundle set is complete
    // when the enterprise personas are entered.
    for (const auto& p : attributes) {
        if (!p.isUniversal && !p.isSystem) continue;
        osLog(LogCategory::Unspecified, OSLogLevel::Debug, "Looking at universal=%d system=%d attributes: %@",
              p.isUniversal, p.isSystem, p);
        osLog(LogCategory::Unspecified, OSLogLevel::Default, "Fetched bundle ID list for universal/system %@: %@",
              p.uniqueString, joined(p.bundleIdentifiers));
        universalBundles.insert(p.bundleIdentifiers.begin(), p.bundleIdentifiers.end());
        if (p.uniqueString) byUniqueString[*p.uniqueString] = unspecific;
        byPersonaID[p.kernelPersonaID] = unspecific;
    }

    for (const auto& p : attributes) {
        if (!p.isEnterprise) continue;
        osLog(LogCategory::Unspecified, OSLogLevel::Debug, "Looking at universal=%d system=%d attributes: %@",
              p.isUniversal, p.isSystem, p);
        if (!p.uniqueString) {
            logErrorAndFault(kRebuildFunction, "Invalid persona unique string for %@", p);
            continue;
        }
        VSLUserIdentityRef identity = userIdentityWithPersonaAttributes(&p, uid, gid, false);
        osLog(LogCategory::Unspecified, OSLogLevel::Default, "Creating user identity for %@: %@", p, identity);
        if (!identity) continue;
        byUniqueString[*p.uniqueString] = identity;
        byPersonaID[p.kernelPersonaID] = identity;
        osLog(LogCategory::Unspecified, OSLogLevel::Default, "Fetched bundle ID list for enterprise %@: %@",
              *p.uniqueString, joined(p.bundleIdentifiers));
        for (const auto& bundle : p.bundleIdentifiers) bundleMap[bundle].insert(identity);
        for (const auto& bundle : universalBundles) bundleMap[bundle].insert(identity);
    }
    for (const auto& bundle : universalBundles) bundleMap[bundle].insert(personal);

    lock_bundleToEnterpriseIdentitiesMap_ = std::move(bundleMap);
    lock_personaUniqueStringToUserIdentityMap_ = std::move(byUniqueString);
    lock_personaIDToUserIdentityMap_ = std::move(byPersonaID);
    lock_userIdentityForPersonalPersona_ = std::move(personal);
    lock_userIdentityForUnspecificPersona_ = std::move(unspecific);
    return true;
}

void VSLUserIdentityCache::lock_flushAndRepopulateWithUserIdentities(
    const std::vector<VSLUserIdentityRef>& userIdentities) {
    IdentityByString byUniqueString;
    IdentityByPersonaID byPersonaID;
    VSLUserIdentityRef personal;
    VSLUserIdentityRef unspecific;
    for (const auto& identity : userIdentities) {
        if (!identity) continue;
        if (identity->personaUniqueString()) byUniqueString[*identity->personaUniqueString()] = identity;
        byPersonaID[static_cast<uint32_t>(identity->kernelPersonaID())] = identity;
        if (identity->isNoSpecificPersona())
            unspecific = identity;
        else if (!identity->isEnterprise())
            personal = identity;
    }
    if (!unspecific && personal)
        unspecific = VSLUserIdentity::create(personal->posixUID(), personal->posixGID(), personal->homeDirectoryURL(),
                                             personal->personaUniqueString(), kVSLPersonaTypeUnspecific,
                                             personal->kernelPersonaID());
    lock_bundleToEnterpriseIdentitiesMap_ = {};
    lock_personaUniqueStringToUserIdentityMap_ = std::move(byUniqueString);
    lock_personaIDToUserIdentityMap_ = std::move(byPersonaID);
    lock_userIdentityForPersonalPersona_ = std::move(personal);
    lock_userIdentityForUnspecificPersona_ = std::move(unspecific);
    cacheInvalid_ = false;
}

// ---- observers ----

void VSLUserIdentityCache::addObserver(const std::shared_ptr<VSLUserIdentityCacheObserver>& observer) {
    if (!observer) return;
    std::lock_guard g(observersMonitor_);
    std::erase_if(observers_, [](const auto& weak) { return weak.expired(); });
    for (const auto& weak : observers_)
        if (!weak.owner_before(observer) && !observer.owner_before(weak)) return;
    observers_.push_back(observer);
}

void VSLUserIdentityCache::removeObserver(const std::shared_ptr<VSLUserIdentityCacheObserver>& observer) {
    std::lock_guard g(observersMonitor_);
    std::erase_if(observers_, [&](const auto& weak) {
        return weak.expired() || (!weak.owner_before(observer) && !observer.owner_before(weak));
    });
}

// ---- the process-wide instance ----

const std::shared_ptr<VSLUserIdentitySharedCache>& VSLUserIdentitySharedCache::sharedInstance() {
    // Never destroyed: worker threads may still use it while the process exits.
    static const auto* instance = [] {
        auto cache = std::make_shared<VSLUserIdentitySharedCache>(Passkey{}, Options{});
        cache->start();
        return new std::shared_ptr<VSLUserIdentitySharedCache>(std::move(cache));
    }();
    return *instance;
}

}  // namespace vsl
