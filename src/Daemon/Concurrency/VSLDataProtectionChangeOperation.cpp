#include "Daemon/Concurrency/VSLDataProtectionChangeOperation.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLDispatch.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLStartup.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/PinnedNode.h"
#include "Platform/ProtectionClass.h"
#include "Platform/SystemRoot.h"
#include "Platform/TreeWalk.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

constexpr const char* kIdentifierKey = "VSLDataOperationIdentifier";
constexpr const char* kContainerClassKey = "VSLDataOperationContainerClass";
constexpr const char* kProtectionClassKey = "VSLDataOperationProtectionClass";
constexpr const char* kChangeTypeKey = "VSLDataOperationChangeType";
constexpr const char* kRetryKey = "VSLDataOperationRetryIfLocked";
constexpr const char* kInternalIDKey = "VSLDataOperationInternalID";
constexpr const char* kUserIdentityKey = "VSLDataOperationUserIdentity";
constexpr const char* kUserIdKey = "VSLDataOperationUserId";

constexpr int32_t kClassCompleteUnlessOpen = 2;
constexpr int32_t kClassFirstUnlock = 3;


std::string userDescription(const VSLMetadataRef& metadata) {
    return metadata && metadata->userIdentity() ? metadata->userIdentity()->description() : std::string("(null)");
}

}  // namespace

// ---- construction ----

VSLDataProtectionChangeOperation::Ref VSLDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    VSLMetadataRef metadata, int32_t newClass, bool retryIfLocked, uint32_t changeType,
    std::shared_ptr<WorkQueue> queue) {
    return initWithContainerMetadata(std::move(metadata), newClass, retryIfLocked, changeType, std::nullopt,
                                     std::move(queue), VSLUserIdentitySharedCache::sharedInstance());
}

VSLDataProtectionChangeOperation::Ref VSLDataProtectionChangeOperation::initWithContainerMetadata(
    VSLMetadataRef metadata, int32_t newClass, bool retryIfLocked, uint32_t changeType,
    std::optional<Uuid> internalChangeID, std::shared_ptr<WorkQueue> queue,
    std::shared_ptr<VSLUserIdentityResolver> userIdentityCache) {
    auto op = std::make_shared<VSLDataProtectionChangeOperation>(Passkey{});
    op->retryIfLocked_ = retryIfLocked;
    op->newDataProtectionClass_ = newClass;
    op->changeType_ = changeType;
    op->dataContainerMetadata_ = std::move(metadata);
    op->internalChangeID_ = internalChangeID ? *internalChangeID : Uuid::random();
    op->queue_ = std::move(queue);
    op->userIdentityCache_ = std::move(userIdentityCache);
    return op;
}

VSLDataProtectionChangeOperation::Ref VSLDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
    const std::string& url, std::shared_ptr<WorkQueue> queue, VSLErrorRef* error) {
    constexpr const char* fn = "+[VSLDataProtectionChangeOperation dataProtectionChangeOperationAtURL:queue:error:]";
    std::optional<VSLDataProtectionUpdate> update;
    VSLErrorRef readError;
    auto read = [&] {
        update = _readAndValidateDataProtectionUpdateAtURL(url, *VSLUserIdentitySharedCache::sharedInstance(),
                                                           &readError);
    };
    if (queue->isCurrent())
        read();
    else
        queue->sync(read);
    if (!update) {
        LogWrite(kLogLevelError, fn, "Failed to read data protection update at %@", url);
        if (error) *error = readError;
        return nullptr;
    }
    VSLUserIdentityRef user = update->userIdentity ? update->userIdentity : defaultUserIdentity();
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, update->identifier,
                                                                           update->containerClass, &code);
    if (!identity) {
        if (error) *error = createVSLError(fn, __LINE__, code, nullptr, true, "Could not create user identity.");
        return nullptr;
    }
    auto connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(user);
    auto metadata = connection->createOrLookupContainerWithContainerIdentity(identity, false, false, true, &code);
    if (!metadata) {
        if (error)
            *error = createVSLError(fn, __LINE__, kVSLErrorNotFound, nullptr, true,
                                    "Failed to lookup container metadata from file userId: %u, identifier: %@, "
                                    "Class: %llu : %llu",
                                    static_cast<unsigned>(user ? user->posixUID() : 0), update->identifier,
                                    static_cast<unsigned long long>(update->containerClass),
                                    static_cast<unsigned long long>(code));
        return nullptr;
    }
    return initWithContainerMetadata(metadata, update->protectionClass, update->retryIfLocked, update->changeType,
                                     update->internalID, std::move(queue),
                                     VSLUserIdentitySharedCache::sharedInstance());
}

// ---- the pending-update file ----

std::optional<VSLDataProtectionUpdate> VSLDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
    const std::optional<std::string>& url, VSLUserIdentityResolver& userIdentityCache, VSLErrorRef* error) {
    auto fail = [&](VSLErrorRef e) {
        if (error) *error = std::move(e);
        return std::nullopt;
    };
    if (!url) return fail(VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true, "URL cannot be nil"));
    VSLErrorRef readError;
    auto dictionary = VSL_dictionaryWithContentsOfURL(*url, kVSLWriteNone, &readError);
    if (!dictionary)
        return fail(VSL_ERROR(kVSLErrorReadFile, readError, true, "Failed to read update info at URL %@", *url));
    VSLDataProtectionUpdate update;
    const Value* identifier = dictionary->find(kIdentifierKey);
    if (!identifier || !identifier->stringValue())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info Identifier: %@ at %@",
                              identifier, *url));
    update.identifier = *identifier->stringValue();
    const Value* containerClass = dictionary->find(kContainerClassKey);
    uint64_t cls = containerClass && containerClass->isNumber() ? containerClass->unsignedNumber().value_or(0) : 0;
    if (cls < 1 || cls > 13)
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info container class: %ld at %@",
                              static_cast<long>(cls), *url));
    update.containerClass = cls;
    if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(cls)) {
        const Value* plist = dictionary->find(kUserIdentityKey);
        const Value* uid = dictionary->find(kUserIdKey);
        bool usable = plist && plist->isDictionary();
        if (!usable && !(uid && uid->isNumber()))
            return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info user id: %@ at %@",
                                  plist ? plist : uid, *url));
        uint64_t code = kVSLSuccess;
        if (usable) {
            update.userIdentity = VSLUserIdentity::userIdentityWithPlist(*plist, userIdentityCache, &code);
        } else {
            auto id = static_cast<uid_t>(uid->unsignedNumber().value_or(0));
            update.userIdentity = userIdentityCache.userIdentityForPersonalPersona(id, id);
        }
        if (!update.userIdentity)
            return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true,
                                  "Invalid update info user identity: %@ at %@: %llu", usable ? plist : uid, *url,
                                  static_cast<unsigned long long>(code)));
    }
    const Value* protectionClass = dictionary->find(kProtectionClassKey);
    if (!protectionClass || !protectionClass->isNumber())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info protection class: %@ at %@",
                              protectionClass, *url));
    update.protectionClass = static_cast<int32_t>(protectionClass->signedNumber().value_or(0));
    const Value* changeType = dictionary->find(kChangeTypeKey);
    if (!changeType || !changeType->isNumber())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info change type: %@ at %@",
                              changeType, *url));
    update.changeType = static_cast<uint32_t>(changeType->unsignedNumber().value_or(0));
    const Value* retry = dictionary->find(kRetryKey);
    if (!retry || !(retry->isNumber() || retry->boolValue()))
        return fail(
            VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info retry: %@ at %@", retry, *url));
    update.retryIfLocked = retry->boolValue() ? *retry->boolValue() : retry->unsignedNumber().value_or(0) != 0;
    const Value* internalID = dictionary->find(kInternalIDKey);
    if (!internalID || !internalID->stringValue())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info UUID String: %@ at %@",
                              internalID, *url));
    auto uuid = Uuid::parse(*internalID->stringValue());
    if (!uuid)
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid update info UUID: %@ at %@",
                              internalID, *url));
    update.internalID = *uuid;
    return update;
}

std::optional<std::string> VSLDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
    const VSLContainerIdentity& identity) {
    const auto& user = identity.userIdentity();
    std::string name = formatLog("%@-%llu-%@.plist", identity.identifier(),
                                 static_cast<unsigned long long>(identity.containerClass()),
                                 user ? user->identifier() : std::string("(null)"));
    if (!isPlainPathComponent(identity.identifier()) || !isPlainPathComponent(name)) return std::nullopt;
    return joinPath(VSLGlobalConfiguration::sharedInstance()->pendingUpdatesDirectory(), name);
}

bool VSLDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(const VSLContainerIdentity& identity,
                                                                           VSLErrorRef* error) {
    auto url = urlForProtectionOperationWithContainerIdentity(identity);
    if (!url) {
        if (error)
            *error = VSL_ERROR(kVSLErrorInvalidObject, nullptr, true, "Can't act on an invalid object: identity: %@",
                               identity.description());
        return false;
    }
    VSLErrorRef removeError;
    if (!VSLFileManager::defaultManager().removeItemAtURL(*url, &removeError)) {
        LogWrite(kLogLevelError, "+[VSLDataProtectionChangeOperation deleteUpdateFileWithContainerIdentity:error:]",
                 "Failed to remove data protection file at %@ : %@", *url, removeError);
        if (error) *error = removeError;
        return false;
    }
    return true;
}

std::optional<std::string> VSLDataProtectionChangeOperation::url() const {
    if (!dataContainerMetadata_) return std::nullopt;
    auto identity = dataContainerMetadata_->containerIdentity();
    return identity ? urlForProtectionOperationWithContainerIdentity(*identity) : std::nullopt;
}

bool VSLDataProtectionChangeOperation::writeToDiskWithError(VSLErrorRef* error) {
    bool ok = false;
    queue_->sync([&] { ok = _onQueue_writeToDiskWithError(error); });
    return ok;
}

bool VSLDataProtectionChangeOperation::_stillMostCurrentUpdate() {
    bool current = false;
    queue_->sync([&] { current = _onQueue_stillMostCurrentUpdate(); });
    return current;
}

bool VSLDataProtectionChangeOperation::_deleteUpdateFileWithError(VSLErrorRef* error) {
    bool ok = false;
    queue_->sync([&] { ok = _onQueue_deleteUpdateFileWithError(error); });
    return ok;
}

bool VSLDataProtectionChangeOperation::_onQueue_writeToDiskWithError(VSLErrorRef* error) {
    auto path = url();
    if (!dataContainerMetadata_ || !changeType_ || !path) {
        if (error)
            *error = VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true, "Invalid Update Info: metadata: %@, changeType: %u",
                               dataContainerMetadata_, changeType_);
        return false;
    }
    const VSLMetadata& m = *dataContainerMetadata_;
    Dictionary d{{kIdentifierKey, Value::string(m.identifier())},
                 {kContainerClassKey, Value::uint64(m.containerClass())},
                 {kProtectionClassKey, Value::int64(newDataProtectionClass_)},
                 {kChangeTypeKey, Value::uint64(changeType_)},
                 {kRetryKey, Value::boolean(retryIfLocked_)},
                 {kInternalIDKey, Value::string(internalChangeID_.string())}};
    if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(m.containerClass()) && m.userIdentity())
        d.emplace(kUserIdentityKey, m.userIdentity()->plist());
    VSLErrorRef underlying;
    if (!VSLFileManager::defaultManager().removeItemAtURL(*path, &underlying)) {
        if (error)
            *error = VSL_ERROR(kVSLErrorRemoveFile, underlying, true, "Failed to remove pending data protection file at %@",
                               *path);
        return false;
    }
    // Readable before the first unlock after a boot: no protection class of its own.
    if (!VSL_writeToURL(Value::dictionary(std::move(d)), *path, kVSLWriteAtomic | kVSLWriteNoFileProtection,
                        &underlying)) {
        if (error)
            *error = VSL_ERROR(kVSLErrorWriteFile, underlying, true,
                               "Failed to write data protection update dictionary to URL %@", *path);
        return false;
    }
    return true;
}

bool VSLDataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
    auto path = url();
    VSLErrorRef error;
    auto update = _readAndValidateDataProtectionUpdateAtURL(path, *userIdentityCache_, &error);
    if (!update) {
        LogWrite(kLogLevelError, "-[VSLDataProtectionChangeOperation _onQueue_stillMostCurrentUpdate]",
                 "Failed to read data protection update from %@", path);
        return false;
    }
    return update->internalID == internalChangeID_;
}

bool VSLDataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError(VSLErrorRef* error) {
    const VSLMetadata& m = *dataContainerMetadata_;
    if (!_onQueue_stillMostCurrentUpdate()) {
        LogWrite(kLogLevelNotice, "-[VSLDataProtectionChangeOperation _onQueue_deleteUpdateFileWithError:]",
                 "Nothing to delete because there is a newer update for user: %@, id: %@, containerClass: %llu",
                 m.userIdentity(), m.identifier(), static_cast<unsigned long long>(m.containerClass()));
        return true;
    }
    auto identity = m.containerIdentity();
    return identity && deleteUpdateFileWithContainerIdentity(*identity, error);
}

// ---- the change ----

void VSLDataProtectionChangeOperation::performChangeOperation() {
    constexpr const char* fn = "-[VSLDataProtectionChangeOperation performChangeOperation]";
    const VSLMetadata& m = *dataContainerMetadata_;
    const auto containerClass = static_cast<unsigned long long>(m.containerClass());
    bool needRetry = false;
    VSLErrorRef error;
    if (!_runChangeOperationNeedToRetry(&needRetry, &error))
        LogWrite(kLogLevelNotice, fn,
                 "Operation to update protection classes for user: %@, id: %@, containerClass: %llu to class %d "
                 "failed with error %@",
                 userDescription(dataContainerMetadata_), m.identifier(), containerClass, newDataProtectionClass_,
                 error);
    if (needRetry) {
        if (retryIfLocked_) {
            LogWrite(kLogLevelNotice, fn,
                     "Retrying container protection update to %d on next unlock for user: %@, id: %@, "
                     "containerClass: %llu",
                     newDataProtectionClass_, userDescription(dataContainerMetadata_), m.identifier(),
                     containerClass);
            auto self = shared_from_this();
            dispatchAsyncWithTransaction(lockStateQueue(), [self] {
                if (!self->retried_ && self->retryStartBlock_) self->retryStartBlock_();
                self->retried_ = true;
                self->performChangeOperation();
            });
            return;
        }
        error = createVSLError(fn, __LINE__, kVSLErrorLockedNoRetry, nullptr, true,
                               "Tried to update user: %@, id: %@, containerClass: %llu to protection class %d, but "
                               "was locked and didn't retry",
                               userDescription(dataContainerMetadata_), m.identifier(), containerClass,
                               newDataProtectionClass_);
    }
    VSLErrorRef deleteError;
    if (!_deleteUpdateFileWithError(&deleteError))
        LogWrite(kLogLevelError, fn,
                 "Failed to delete update file for user: %@, id: %@, containerClass: %llu, protection class %d",
                 userDescription(dataContainerMetadata_), m.identifier(), containerClass, newDataProtectionClass_);
    if (completionBlock_) completionBlock_(needRetry, error);
}

bool VSLDataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needRetry, VSLErrorRef* error) {
    constexpr const char* fn = "-[VSLDataProtectionChangeOperation _runChangeOperationNeedToRetry:withError:]";
    *needRetry = false;
    const VSLMetadata& m = *dataContainerMetadata_;
    VSLErrorRef walkError;
    bool ok = guardExceptions(fn, __LINE__, &walkError, [&]() -> bool {
        VSLIdentifierLockGuard lock({m.uuid().string()}, false);
        uint64_t code = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(m.userIdentity(), m.identifier(),
                                                                               m.containerClass(), &code);
        VSLMetadataRef found =
            identity ? VSLClientConnection::sharedClientConnection()->createOrLookupContainerWithContainerIdentity(
                           identity, false, false, false, &code)
                     : nullptr;
        if (!found) {
            walkError = createVSLError(fn, __LINE__, kVSLErrorNotFound, nullptr, true,
                                       "Failed to lookup container to set data protection for user identity: %@, "
                                       "identifier: %@, Class: %llu",
                                       m.userIdentity(), m.identifier(),
                                       static_cast<unsigned long long>(m.containerClass()));
            return false;
        }
        if (found->url() != m.url()) {
            walkError = createVSLError(fn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                       "Cancelling data protection operation because container path changed on "
                                       "disk. This indicates the app may have been updated and changed its "
                                       "protection level.");
            return false;
        }
        if (!_stillMostCurrentUpdate()) {
            walkError = createVSLError(fn, __LINE__, kVSLErrorProtectionSuperseded, nullptr, true,
                                       "Cancelling data protection operation because another more current operation "
                                       "on this container has taken precedence");
            return false;
        }
        std::vector<std::string> roots;
        for (const auto& name : VSLGlobalConfiguration::appUserDataItemNames()) {
            if (name.empty() || m.url().empty()) {
                LogWrite(kLogLevelError, fn, "itemURL is nil for item: %@", name);
                continue;
            }
            std::string root = joinPath(m.url(), name);
            struct stat st;
            if (::lstat(root.c_str(), &st) == 0) roots.push_back(root);
        }
        if (roots.empty()) return true;
        VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kProtectionClassGate);
        for (const auto& root : roots)
            if (!walkRoot(root, &walkError)) return false;
        return true;
    });
    if (ok) return true;
    if (isPOSIXError(walkError, EPERM)) {
        *needRetry = true;
        return true;
    }
    if (error) *error = walkError;
    return false;
}

bool VSLDataProtectionChangeOperation::walkRoot(const std::string& root, VSLErrorRef* error) {
    constexpr const char* fn = "-[VSLDataProtectionChangeOperation _runChangeOperationNeedToRetry:withError:]";
    NodePinner pinner(root);
    VSLErrorRef failure;
    const int32_t newClass = newDataProtectionClass_;
    const int32_t fileTarget = newClass == 0 ? kClassFirstUnlock : newClass;

    // Reached through a descriptor that no link below the root can redirect, read
    // first, written only when the class differs.
    auto setClass = [&](FTSENT* e, int32_t target, bool isFile) -> bool {
        UniqueFd fd(pinner.open(e->fts_path, *e->fts_statp, O_PATH));
        if (fd.get() < 0) {
            int err = errno;
            if (err == ENOENT || err == ESTALE || err == ELOOP) {
                LogWrite(kLogLevelError, "walkRoot", "FTS returned error for %s : %s", e->fts_path,
                         std::strerror(err));
                return true;
            }
            failure = createPOSIXError("walkRoot", __LINE__, err, "Failed to open %s : %s", e->fts_path,
                                       std::strerror(err));
            return false;
        }
        int current = 0;
        int rc = getProtectionClass(fd.get(), &current);
        if (!rc) {
            if (current == kClassCompleteUnlessOpen) return true;
            if (isFile && (current == target ||
                           ((changeType_ & kVSLChangeNeverRaiseFiles) && current < target)))
                return true;
            LogWrite(kLogLevelDebug, "walkRoot", "Setting protection class of %s to %d", e->fts_path, target);
            rc = setProtectionClass(fd.get(), e->fts_path, target);
        }
        if (!rc) return true;
        if (rc == EBADF) {
            LogWrite(kLogLevelError, "walkRoot", "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@",
                     target, std::string(e->fts_path), static_cast<unsigned>(e->fts_statp->st_mode),
                     std::string(std::strerror(rc)));
            return true;
        }
        failure = createPOSIXError("walkRoot", __LINE__, rc, "Failed to set protection class %d on %s: %s", target,
                                   e->fts_path, std::strerror(rc));
        return false;
    };

    TreeWalkFailure where = TreeWalkFailure::None;
    int rc = walkTree(root, [&](FTSENT* e) -> bool {
        switch (e->fts_info) {
            case FTS_D:
            case FTS_DEFAULT:
            case FTS_SL:
            case FTS_SLNONE:
                return true;
            case FTS_DP:
                return !(changeType_ & kVSLChangeDirectories) || setClass(e, newClass, false);
            case FTS_F:
                return !(changeType_ & kVSLChangeFiles) || setClass(e, fileTarget, true);
            default:
                LogWrite(kLogLevelError, "walkRoot", "FTS returned error for %s : %s", e->fts_path,
                         std::strerror(e->fts_errno));
                return true;
        }
    }, &where);
    if (failure) {
        if (error) *error = failure;
        return false;
    }
    if (rc) {
        if (error)
            *error = where == TreeWalkFailure::Open
                         ? createPOSIXError(fn, __LINE__, rc, "fts_open failed for %@ : %s", root, std::strerror(rc))
                         : createPOSIXError(fn, __LINE__, rc, "Walking %@ failed: %s", root, std::strerror(rc));
        return false;
    }
    return true;
}

}  // namespace vsl
