// Info values, metadata, default structure, directory renaming and disk usage of one
// existing container, on behalf of one client.
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

const char* const kSetFn = "-[VSLClientConnection setInfoValue:forKey:containerIdentity:useLocking:withError:]";
const char* const kGetFn = "-[VSLClientConnection infoValueForKey:containerIdentity:useLocking:withError:]";
const char* const kMetadataFn = "-[VSLClientConnection metadataWithContainerIdentity:withError:]";
const char* const kRecreateFn = "-[VSLClientConnection recreateDefaultStructureWithContainerIdentity:withError:]";
const char* const kRegenerateFn = "-[VSLClientConnection regenerateDirectoryUUIDWithContainerIdentity:withError:]";
const char* const kDiskUsageFn = "-[VSLClientConnection diskUsageWithContainerIdentity:withError:]";
const char* const kStaticDiskUsageKey = "StaticDiskUsage";

std::vector<std::string> lockKey(const VSLConcreteContainerIdentityRef& identity) {
    return {identity->uuid().string()};
}

VSLMetadataRef findContainer(const char* function, int line, const VSLConcreteContainerIdentityRef& identity,
                             VSLErrorRef* error, const char* format = "No Container with identity: %@") {
    auto found = VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity);
    if (!found) *error = createVSLError(function, line, kVSLErrorNotFound, nullptr, true, format, identity);
    return found;
}

bool fail(uint64_t* code, const VSLErrorRef& error) {
    if (code) *code = codeForError(error, kVSLErrorException);
    return false;
}

}  // namespace

// With the container's write lock held (or the caller's global write lock).
bool VSLClientConnection::_lock_setInfoValue(const std::optional<Value>& value, const std::string& key,
                                             const VSLConcreteContainerIdentityRef& identity, VSLErrorRef* error) {
    auto found = findContainer(kSetFn, __LINE__, identity, error);
    if (!found) return false;
    Dictionary info;
    if (found->info() && found->info()->dictionaryValue()) info = *found->info()->dictionaryValue();
    if (value)
        info.insert_or_assign(key, *value);
    else
        info.erase(key);
    // The record handed out stays as it is; the change is a new record.
    auto changed = found->mutableCopy();
    changed->setInfo(Value::dictionary(std::move(info)));
    if (!changed->writeMetadataToDiskWithError(error)) return false;
    VSLErrorRef underlying;
    if (!VSLContainerCache::sharedInstance()->addContainerMetadata(changed, changed->url(), changed->transient(), false,
                                                                   &underlying)) {
        *error = createVSLError(kSetFn, __LINE__, kVSLErrorCacheAdd, underlying, true,
                                "Failed to add to cache: %@, url: %@, transient: %d", changed, changed->url(),
                                changed->transient());
        return false;
    }
    return true;
}

bool VSLClientConnection::setInfoValue(const std::optional<Value>& value, const Value& key,
                                       const VSLConcreteContainerIdentityRef& identity, bool useLocking,
                                       uint64_t* code) {
    VSLErrorRef error;
    bool ok = guardExceptions(kSetFn, __LINE__, &error, [&]() -> bool {
        if (!key.stringValue()) {
            error = createVSLError(kSetFn, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                   "Can't set nil or non-NSString key: %@", key);
            return false;
        }
        VSLIdentifierLockGuard lock(lockKey(identity), true, useLocking);
        return _lock_setInfoValue(value, *key.stringValue(), identity, &error);
    });
    return ok || fail(code, error);
}

std::optional<Value> VSLClientConnection::infoValueForKey(const Value& key,
                                                          const VSLConcreteContainerIdentityRef& identity,
                                                          bool useLocking, uint64_t* code) {
    std::optional<Value> result;
    VSLErrorRef error;
    bool ok = guardExceptions(kGetFn, __LINE__, &error, [&]() -> bool {
        if (!key.stringValue()) {
            error = createVSLError(kGetFn, __LINE__, kVSLErrorInvalidArgument, nullptr, true,
                                   "Can't get nil or non-NSString key: %@", key);
            return false;
        }
        VSLIdentifierLockGuard lock(lockKey(identity), false, useLocking);
        auto found = findContainer(kGetFn, __LINE__, identity, &error);
        if (!found) return false;
        const Value* v = found->info() ? found->info()->find(*key.stringValue()) : nullptr;
        if (!v) {
            error = createVSLError(kGetFn, __LINE__, kVSLErrorNoInfoValue, nullptr, false,
                                   "Didn't find info value for key: %@", key);
            return false;
        }
        result = *v;
        return true;
    });
    if (!ok) fail(code, error);
    return ok ? result : std::nullopt;
}

VSLMetadataRef VSLClientConnection::metadataWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                                  uint64_t* code) {
    VSLMetadataRef result;
    VSLErrorRef error;
    bool ok = guardExceptions(kMetadataFn, __LINE__, &error, [&]() -> bool {
        VSLIdentifierLockGuard lock(lockKey(identity), false);
        result = findContainer(kMetadataFn, __LINE__, identity, &error, "No Container with user identity: %@");
        return result != nullptr;
    });
    if (!ok) fail(code, error);
    return ok ? result : nullptr;
}

bool VSLClientConnection::recreateDefaultStructureWithContainerIdentity(
    const VSLConcreteContainerIdentityRef& identity, uint64_t* code) {
    VSLErrorRef error;
    bool ok = guardExceptions(kRecreateFn, __LINE__, &error, [&]() -> bool {
        VSLIdentifierLockGuard lock(lockKey(identity), true);
        auto found = findContainer(kRecreateFn, __LINE__, identity, &error);
        if (!found) return false;
        if (!_createSubDirectories(found->url(), *found, &error, true)) return false;
        if (isSystemContainerClass(found->containerClass()))
            return VSLFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(found->url(), &error);
        return true;
    });
    return ok || fail(code, error);
}

bool VSLClientConnection::regenerateDirectoryUUIDWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                                      uint64_t* code) {
    VSLErrorRef error;
    bool ok = guardExceptions(kRegenerateFn, __LINE__, &error, [&]() -> bool {
        auto found = findContainer(kRegenerateFn, __LINE__, identity, &error);
        if (!found) return false;
        VSLGlobalLockGuard lock;
        lock.write();
        const std::string& url = found->url();
        if (!Uuid::parse(lastPathComponent(url))) {
            error = createVSLError(kRegenerateFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                                   "Non-UUID last path component: %@ for %@", lastPathComponent(url), identity);
            return false;
        }
        std::string moved = joinPath(parentPath(url), Uuid::random().string());
        VSLErrorRef underlying;
        if (!VSLFileManager::defaultManager().moveItemAtURL(url, moved, &underlying)) {
            error = createVSLError(kRegenerateFn, __LINE__, kVSLErrorMoveToNewUUIDDir, underlying, true,
                                   "Failed to move dir: %@ to new UUID dir: %@", url, moved);
            return false;
        }
        auto changed = found->mutableCopy();
        changed->setUrl(moved);
        if (!VSLContainerCache::sharedInstance()->addContainerMetadata(changed, moved, changed->transient(), true,
                                                                       &underlying)) {
            error = createVSLError(kRegenerateFn, __LINE__, kVSLErrorCacheAdd, underlying, true,
                                   "Failed to add to cache: %@, url: %@, transient: %d", changed, moved,
                                   changed->transient());
            return false;
        }
        return true;
    });
    return ok || fail(code, error);
}

std::optional<uint64_t> VSLClientConnection::diskUsageWithContainerIdentity(
    const VSLConcreteContainerIdentityRef& identity, uint64_t* code) {
    std::optional<uint64_t> result;
    VSLErrorRef error;
    bool ok = guardExceptions(kDiskUsageFn, __LINE__, &error, [&]() -> bool {
        const bool fastSizing = deviceFacts().featureEnabled("fast_container_sizing");
        VSLMetadataRef found;
        std::optional<uint64_t> cached;
        {
            VSLIdentifierLockGuard lock(lockKey(identity), false);
            found = findContainer(kDiskUsageFn, __LINE__, identity, &error);
            if (!found) return false;
            if (isBundleContainerClass(found->containerClass())) {
                uint64_t infoCode = kVSLSuccess;
                auto v = infoValueForKey(Value::string(kStaticDiskUsageKey), identity, false, &infoCode);
                if (v) cached = v->uint64Value();
                if (infoCode != kVSLSuccess && infoCode != kVSLErrorNoInfoValue)
                    LogWrite(kLogLevelError, kDiskUsageFn, "Error looking up info value for identity: %@: %llu",
                             identity, infoCode);
            }
        }
        if (cached) {
            result = cached;
            return true;
        }
        VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kDiskUsageGate);
        result = VSLFileManager::defaultManager().fastDiskUsageForURL(found->url());
        if (!fastSizing && isBundleContainerClass(found->containerClass())) {
            uint64_t setCode = kVSLSuccess;
            if (!setInfoValue(Value::uint64(*result), Value::string(kStaticDiskUsageKey), identity, true, &setCode))
                LogWrite(kLogLevelError, kDiskUsageFn, "Error setting info value for identity: %@: %llu", identity,
                         setCode);
        }
        return true;
    });
    if (!ok) fail(code, error);
    return ok ? result : std::nullopt;
}

}  // namespace vsl
