#include "Daemon/Storage/VSLContainerCache.h"

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLInvariant.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/SystemRoot.h"
#include "Platform/WorkQueue.h"

#include <string_view>

namespace vsl {

// Keyed by a view of each record's own identifier: the key costs no copy of the string.
// A record handed out is never changed, so the view lives as long as its entry, as
// long as every insertion goes through putRecord.
using RecordMap = std::unordered_map<std::string_view, VSLMetadataRef>;

struct VSLContainerCache::ClassIndex {
    std::mutex mutex;
    bool built = false;
    RecordMap records;
};

namespace {

// The code-signing mapping's queue calls into this cache, so the cache must never
// wait on its own lock from that queue.
const char* const kCodeSigningQueueLabel = "com.tarrow.Vesselry.EntitlementQueue";

void assertNotOnCodeSigningQueue() { VSL_INVARIANT(WorkQueue::currentLabel() != kCodeSigningQueueLabel); }

// Replaces the entry of the record's identifier, its key then viewing the new record.
void putRecord(RecordMap& records, VSLMetadataRef record) {
    records.erase(record->identifier());
    std::string_view key = record->identifier();
    records.emplace(key, std::move(record));
}

const char* transientMarker(bool transient) { return transient ? "(transient)" : ""; }

std::string identifierOf(const VSLUserIdentityRef& userIdentity) {
    return userIdentity ? userIdentity->identifier() : std::string("(null)");
}

VSLErrorRef rebuildError(const char* function, int line, const VSLUserIdentityRef& userIdentity,
                         VSLContainerClass containerClass, bool transient, VSLErrorRef underlying) {
    return createVSLError(function, line, kVSLErrorCacheRebuild, std::move(underlying), true,
                          "Cache: [%@]-%@%@: Failed to rebuild", identifierOf(userIdentity),
                          containerClassDirectoryName(containerClass), transientMarker(transient));
}

// Records are shared as they are: one placed elsewhere is a new record.
VSLMetadataRef recordAt(const VSLMetadataRef& metadata, const std::string& url) {
    if (metadata->url() == url) return metadata;
    auto moved = metadata->mutableCopy();
    moved->setUrl(url);
    return moved;
}

}  // namespace

// ---- life cycle ----

const std::shared_ptr<VSLContainerCache>& VSLContainerCache::sharedInstance() {
    static const std::shared_ptr<VSLContainerCache> instance = initWithUserIdentityCache(
        VSLUserIdentitySharedCache::sharedInstance(), VSLCodeSigningMapping::sharedInstance());
    return instance;
}

std::shared_ptr<VSLContainerCache> VSLContainerCache::initWithUserIdentityCache(
    std::shared_ptr<VSLUserIdentityCache> userIdentityCache, std::shared_ptr<VSLCodeSigningMapping> codeSigningMapping,
    Hooks hooks) {
    auto cache = std::make_shared<VSLContainerCache>(Passkey{}, std::move(userIdentityCache),
                                                     std::move(codeSigningMapping), std::move(hooks));
    if (cache->userIdentityCache_) cache->userIdentityCache_->addObserver(cache);
    return cache;
}

VSLContainerCache::VSLContainerCache(Passkey, std::shared_ptr<VSLUserIdentityCache> userIdentityCache,
                                     std::shared_ptr<VSLCodeSigningMapping> codeSigningMapping, Hooks hooks)
    : userIdentityCache_(std::move(userIdentityCache)),
      codeSigningMapping_(std::move(codeSigningMapping)),
      hooks_(std::move(hooks)) {}

VSLContainerCache::~VSLContainerCache() = default;

std::string VSLContainerCache::_cacheKeyForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                        VSLContainerClass containerClass) {
    const char* shortName = containerClassShortName(containerClass);
    std::string name = shortName ? shortName : "(null)";
    if (!VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) return name;
    return "[" + identifierOf(userIdentity) + "]-" + name;
}

std::shared_ptr<VSLContainerCache::ClassIndex> VSLContainerCache::indexForKey(const std::string& key, bool transient) {
    std::lock_guard<std::mutex> lock(cacheLock_);
    auto& slot = (transient ? transientContainerCache_ : liveContainerCache_)[key];
    if (!slot) slot = std::make_shared<ClassIndex>();
    return slot;
}

// ---- building an index ----

bool VSLContainerCache::containerURLIsValidForContainerClass(const std::string& url,
                                                             VSLContainerClass containerClass) const {
    std::string name = lastPathComponent(url);
    if (Uuid::parse(name)) return true;
    if (!isSystemContainerClass(containerClass)) return false;
    if (hooks_.isWellKnownContainerName) return hooks_.isWellKnownContainerName(containerClass, name);
    auto whitelist = VSLWhitelist::sharedWhitelist();
    return whitelist && whitelist->containerIdIsWellknown(name, containerClass);
}

bool VSLContainerCache::_lock_getCache(ClassIndex& index, const std::string& key,
                                       const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass,
                                       bool transient, bool populateSandboxCache, bool buildCache,
                                       VSLErrorRef* error) {
    if (index.built) return true;
    if (!buildCache) return false;
    osLog(LogCategory::Cache, OSLogLevel::Default, "Rebuilding container class cache: %@%@", key,
          transientMarker(transient));
    SignpostInterval signpost(LogCategory::Cache, "RebuildingCache",
                              " class=%{public, signpost.description:attribute}llu ", containerClass);

    auto directory = VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(
        userIdentity, containerClass, transient);
    if (!directory) {
        if (error) *error = VSL_POSIX_ERROR(ENOENT, "No class directory for %@", key);
        return false;
    }
    if (hooks_.willScanClassDirectory) hooks_.willScanClassDirectory(key, transient, *directory);
    auto entries = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, error);
    if (!entries) return false;

    RecordMap records;
    records.reserve(entries->size());
    for (const VSLItemURL& entry : *entries) {
        if (!containerURLIsValidForContainerClass(entry.path, containerClass)) continue;
        // Damaged files are skipped, so the rest of the class still loads. A failed
        // read says nothing about the file: taking it for absent would let the next
        // create make a second container, so the index stays unbuilt instead.
        VSLErrorRef readError;
        auto metadata = VSLMetadata::readAndValidateMetadataAtUrl(entry.path, userIdentity, true, &readError,
                                                                  userIdentityCache_.get());
        if (metadata)
            putRecord(records, std::move(metadata));
        else if (isReadFailure(readError)) {
            if (error) *error = std::move(readError);
            return false;
        }
    }
    index.records = std::move(records);
    index.built = true;

    if (populateSandboxCache && !transient) {
        std::vector<VSLMetadataRef> registered;
        for (const auto& [identifier, metadata] : index.records)
            if (shouldRegisterSandboxMappingWithUserIdentity(userIdentity, metadata->identifier(), containerClass))
                registered.push_back(metadata);
        pushSandboxItems(userIdentity, containerClass, registered);
    }
    return true;
}

// ---- lookups ----

VSLMetadataRef VSLContainerCache::containerForContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                bool transient, bool updateSandbox,
                                                                VSLErrorRef* error) {
    return containerForContainerIdentity(identity, transient, updateSandbox, true, error);
}

VSLMetadataRef VSLContainerCache::containerForContainerIdentity(const VSLContainerIdentityRef& identity,
                                                                bool transient, bool updateSandbox,
                                                                bool allowKernelLookup, VSLErrorRef* error) {
    VSLMetadataRef result;
    const char* const writer = VSL_FUNCTION;  // the lambda below writes in this method's name
    VSL_GUARD_EXCEPTIONS(error, [&] {
        assertNotOnCodeSigningQueue();
        if (!identity) {
            auto e = createVSLError(writer, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                    "Cannot lookup a nil container identity.");
            if (error) *error = e;
            return false;
        }
        const VSLUserIdentityRef& userIdentity = identity->userIdentity();
        const VSLContainerClass containerClass = identity->containerClass();
        const std::string key = _cacheKeyForUserIdentity(userIdentity, containerClass);
        auto index = indexForKey(key, transient);
        VSLMetadataRef record;
        {
            std::lock_guard<std::mutex> lock(index->mutex);
            if (!index->built && allowKernelLookup && !transient)
                record = _lock_metadataFromSandboxForContainerIdentity(*identity);
            if (!record) {
                VSLErrorRef buildError;
                if (!_lock_getCache(*index, key, userIdentity, containerClass, transient, updateSandbox, true,
                                    &buildError)) {
                    auto e = rebuildError(writer, __LINE__, userIdentity, containerClass, transient, buildError);
                    if (error) *error = e;
                    return false;
                }
                auto it = index->records.find(identity->identifier());
                if (it == index->records.end()) {
                    auto e = createVSLError(writer, __LINE__, kVSLErrorNotFound, nullptr, true,
                                            "Cache: %@%@: Container Not Found with ID: %@",
                                            containerClassDirectoryName(containerClass), transientMarker(transient),
                                            identity->identifier());
                    if (error) *error = e;
                    return false;
                }
                record = it->second;
            }
        }
        result = checkedRecord(record, containerClass, transient, "Cache: %@%@: Found Identifier: %@", error);
        return result != nullptr;
    });
    return result;
}

VSLMetadataRef VSLContainerCache::checkedRecord(const VSLMetadataRef& record, VSLContainerClass containerClass,
                                                bool transient, const char* foundFormat, VSLErrorRef* error) {
    const char* className = containerClassDirectoryName(containerClass);
    const char* marker = transientMarker(transient);
    VSLErrorRef e;
    if (record->url().empty()) {
        e = VSL_ERROR(kVSLErrorCacheInvalidInput, nullptr, true, "Cache: %@%@: Invalid URL path string: %@", className,
                      marker, record->url());
    } else if (record->url().front() != '/') {
        e = VSL_ERROR(kVSLErrorCacheInvalidInput, nullptr, true, "Cache: %@%@: nil URL from %@", className, marker,
                      record->url());
    } else {
        std::string metadataURL = joinPath(record->url(), kVSLMetadataFileName);
        if (VSLFileManager::defaultManager().itemExistsAtURL(metadataURL)) {
            LogWrite(kLogLevelDebug, __func__, foundFormat, className, marker, record->identifier());
            return record;
        }
        e = VSL_ERROR(kVSLErrorCacheInconsistent, nullptr, true,
                      "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", className, marker,
                      metadataURL, record->identifier(), containerClass);
        removeStaleRecord(record, transient);
    }
    if (error) *error = e;
    return nullptr;
}

void VSLContainerCache::removeStaleRecord(const VSLMetadataRef& record, bool transient) {
    const VSLUserIdentityRef& userIdentity = record->userIdentity();
    const VSLContainerClass containerClass = record->containerClass();
    const std::string key = _cacheKeyForUserIdentity(userIdentity, containerClass);
    auto index = indexForKey(key, transient);
    // The stale record may have come from the kernel state rather than the index: only
    // an entry at the same place goes, and the kernel is left pointing at what stays.
    std::optional<std::string> survivor;
    bool registers = false;
    {
        std::lock_guard<std::mutex> lock(index->mutex);
        VSLErrorRef buildError;
        if (!_lock_getCache(*index, key, userIdentity, containerClass, transient, true, true, &buildError)) {
            LogWrite(kLogLevelError, __func__,
                     "Failed to remove from cache user: %@, id: %@, class: %llu, transient: %d : %@",
                     identifierOf(userIdentity), record->identifier(), containerClass, transient, buildError);
            return;
        }
        auto it = index->records.find(record->identifier());
        if (it != index->records.end()) {
            if (it->second->url() == record->url())
                index->records.erase(it);
            else
                survivor = it->second->url();
        }
        registers = shouldRegisterSandboxMappingWithUserIdentity(userIdentity, record->identifier(), containerClass);
    }
    if (registers && !transient &&
        !setSandboxContainerMappingForUserIdentity(userIdentity, record->identifier(), containerClass, survivor))
        LogWrite(kLogLevelError, __func__, "Failed to remove container mapping of %@, %llu", record->identifier(),
                 containerClass);
}

VSLMetadataRef VSLContainerCache::containerForContainerIdentity(const VSLConcreteContainerIdentityRef& identity) {
    if (!identity) return nullptr;
    for (bool transient : {false, true}) {
        auto metadata = containerForContainerIdentity(identity, transient, true, nullptr);
        if (metadata && metadata->uuid() == identity->uuid()) {
            if (metadata->transient() == transient) return metadata;
            auto marked = metadata->mutableCopy();
            marked->setTransient(transient);
            return marked;
        }
    }
    return nullptr;
}

std::optional<std::vector<VSLMetadataRef>> VSLContainerCache::allContainersForUserIdentity(
    const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass, bool transient, VSLErrorRef* error) {
    return allContainersForUserIdentity(userIdentity, containerClass, transient, true, error);
}

std::optional<std::vector<VSLMetadataRef>> VSLContainerCache::allContainersForUserIdentity(
    const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass, bool transient,
    bool populateSandboxCache, VSLErrorRef* error) {
    std::optional<std::vector<VSLMetadataRef>> result;
    const char* const writer = VSL_FUNCTION;  // the lambda below writes in this method's name
    VSL_GUARD_EXCEPTIONS(error, [&] {
        if (!isValidContainerClass(containerClass)) {
            auto e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Content Class: %ld", static_cast<int64_t>(containerClass));
            if (error) *error = e;
            return false;
        }
        assertNotOnCodeSigningQueue();
        std::vector<VSLUserIdentityRef> identities;
        if (userIdentity && userIdentity->isNoSpecificPersona() && userIdentityCache_)
            userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
                [&](const VSLUserIdentityRef& identity) { identities.push_back(identity); });
        else
            identities.push_back(userIdentity);

        std::vector<VSLMetadataRef> gathered;
        for (const auto& identity : identities) {
            const std::string key = _cacheKeyForUserIdentity(identity, containerClass);
            auto index = indexForKey(key, transient);
            std::lock_guard<std::mutex> lock(index->mutex);
            VSLErrorRef buildError;
            if (!_lock_getCache(*index, key, identity, containerClass, transient, populateSandboxCache, true,
                                &buildError)) {
                auto e = rebuildError(writer, __LINE__, identity, containerClass, transient, buildError);
                if (error) *error = e;
                return false;
            }
            for (const auto& [identifier, metadata] : index->records) gathered.push_back(metadata);
        }
        std::vector<VSLMetadataRef> present;
        present.reserve(gathered.size());
        for (const auto& metadata : gathered)
            if (checkedRecord(metadata, containerClass, transient, "Cache: %@%@: ALL Found Identifier: %@", nullptr))
                present.push_back(metadata);
        result = std::move(present);
        return true;
    });
    return result;
}

// ---- add and remove ----

bool VSLContainerCache::addContainerMetadata(const VSLMetadataRef& metadata, const std::string& url, bool transient,
                                             bool updateSandbox, VSLErrorRef* error) {
    const char* const writer = VSL_FUNCTION;  // the lambda below writes in this method's name
    return VSL_GUARD_EXCEPTIONS(error, [&] {
        VSLErrorRef e;
        const VSLContainerClass containerClass = metadata ? metadata->containerClass() : kVSLClassUndefined;
        if (!isValidContainerClass(containerClass))
            e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true,
                               "Invalid Metadata Content Class: %lld", static_cast<int64_t>(containerClass));
        else if (metadata->identifier().empty())
            e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true,
                               "Invalid metadata Identifier: %@", nullptr);
        else if (url.empty())
            e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true, "Invalid input: URL: %@",
                               nullptr);
        if (e) {
            if (error) *error = e;
            return false;
        }
        assertNotOnCodeSigningQueue();
        const VSLUserIdentityRef& userIdentity = metadata->userIdentity();
        const std::string key = _cacheKeyForUserIdentity(userIdentity, containerClass);
        auto index = indexForKey(key, transient);
        bool registers = false;
        {
            std::lock_guard<std::mutex> lock(index->mutex);
            VSLErrorRef buildError;
            if (!_lock_getCache(*index, key, userIdentity, containerClass, transient, updateSandbox, updateSandbox,
                                &buildError)) {
                if (!updateSandbox) return true;  // the next lookup reads it from disk
                e = rebuildError(writer, __LINE__, userIdentity, containerClass, transient, buildError);
                if (error) *error = e;
                return false;
            }
            putRecord(index->records, recordAt(metadata, url));
            if (updateSandbox)
                registers =
                    shouldRegisterSandboxMappingWithUserIdentity(userIdentity, metadata->identifier(), containerClass);
        }
        if (updateSandbox && !transient && registers &&
            !setSandboxContainerMappingForUserIdentity(userIdentity, metadata->identifier(), containerClass, url))
            LogWrite(kLogLevelError, writer, "Failed to set container mapping of %@, %llu", metadata->identifier(),
                     containerClass);
        LogWrite(kLogLevelDebug, writer, "Cache: %@%@: Added Identifier: %@",
                 containerClassDirectoryName(containerClass), transientMarker(transient), metadata->identifier());
        return true;
    });
}

bool VSLContainerCache::removeContainerForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                       VSLContainerClass containerClass, const std::string& identifier,
                                                       bool transient, VSLErrorRef* error) {
    const char* const writer = VSL_FUNCTION;  // the lambda below writes in this method's name
    return VSL_GUARD_EXCEPTIONS(error, [&] {
        VSLErrorRef e;
        if (!isValidContainerClass(containerClass))
            e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true,
                               "Invalid Content Class: %ld", static_cast<int64_t>(containerClass));
        else if (identifier.empty())
            e = createVSLError(writer, __LINE__, kVSLErrorCacheInvalidInput, nullptr, true, "Invalid Identifier: %@",
                               nullptr);
        if (e) {
            if (error) *error = e;
            return false;
        }
        assertNotOnCodeSigningQueue();
        const std::string key = _cacheKeyForUserIdentity(userIdentity, containerClass);
        auto index = indexForKey(key, transient);
        bool registers = false;
        {
            std::lock_guard<std::mutex> lock(index->mutex);
            VSLErrorRef buildError;
            if (!_lock_getCache(*index, key, userIdentity, containerClass, transient, true, true, &buildError)) {
                e = rebuildError(writer, __LINE__, userIdentity, containerClass, transient, buildError);
                if (error) *error = e;
                return false;
            }
            index->records.erase(identifier);
            registers = shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, containerClass);
        }
        if (registers && !transient &&
            !setSandboxContainerMappingForUserIdentity(userIdentity, identifier, containerClass, std::nullopt))
            LogWrite(kLogLevelError, writer, "Failed to remove container mapping of %@, %llu", identifier,
                     containerClass);
        LogWrite(kLogLevelDebug, writer, "Cache: %@%@: Removed Identifier: %@",
                 containerClassDirectoryName(containerClass), transientMarker(transient), identifier);
        return true;
    });
}

// ---- invalidation ----

void VSLContainerCache::invalidateUserIdentity(const VSLUserIdentityRef& userIdentity) {
    assertNotOnCodeSigningQueue();
    std::vector<std::pair<VSLContainerClass, std::shared_ptr<ClassIndex>>> live;
    {
        std::lock_guard<std::mutex> lock(cacheLock_);
        for (VSLContainerClass c = 1; c <= 13; c++) {
            const std::string key = _cacheKeyForUserIdentity(userIdentity, c);
            if (auto it = liveContainerCache_.find(key); it != liveContainerCache_.end())
                live.emplace_back(c, it->second);
            transientContainerCache_.erase(key);
        }
    }
    // A live index is emptied in place, its sandbox items removed under its mutex: a
    // rebuild of the key (running now, or the next one) holds that mutex too, so the
    // items it pushes can never be removed by this invalidation afterwards.
    for (const auto& [containerClass, index] : live) {
        std::lock_guard<std::mutex> lock(index->mutex);
        for (const auto& [identifier, metadata] : index->records)
            if (!setSandboxContainerMappingForUserIdentity(userIdentity, metadata->identifier(), containerClass,
                                                           std::nullopt))
                LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to remove container mapping of [%@], class: %llu",
                         metadata->identifier(), containerClass);
        index->records.clear();
        index->built = false;
    }
    uint32_t status = hooks_.postUserInvalidatedNotification ? hooks_.postUserInvalidatedNotification() : 0;
    if (status != 0)
        osLog(LogCategory::Cache, OSLogLevel::Error, "Could not post user-invalidated notification: %u", status);
}

void VSLContainerCache::userIdentityCache(VSLUserIdentityCache& cache, const VSLUserIdentityRef& invalidatedIdentity) {
    (void)cache;
    invalidateUserIdentity(invalidatedIdentity);
}

}  // namespace vsl
