// Replacing a container by a prepared one (an application update), and settling at
// start the replacements a crash interrupted. The steps run in an order that a
// crash can always be settled from: the journal is on disk before anything moves,
// the old container leaves its place before the new one arrives, and the
// destination exists only once the replacement has succeeded.
#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLReplaceJournal.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReplaceFileOperations.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

const char* const kReplaceFn =
    "-[VSLClientConnection replaceContainerIdentity:withContainerIdentity:preserveOldUUID:startDeletionThread:"
    "withError:]";
const char* const kRecoverFn = "-[VSLClientConnection _recoverFromReplaceOperationsWithError:]";

VSLConcreteContainerIdentityRef concreteOf(const VSLContainerIdentityRef& identity) {
    if (!identity || !identity->isConcrete()) return nullptr;
    return std::static_pointer_cast<const VSLConcreteContainerIdentity>(identity);
}

// What one replacement has done so far, for settling a failure and cleaning up.
struct ReplaceRun {
    VSLMetadataRef oldContainer;
    VSLMetadataRef newContainer;
    std::string journal;      // set once a journal may exist
    std::string staging;
    std::string destination;
    bool staged = false;      // the old container left its place
};

VSLErrorRef argumentError(const VSLContainerIdentityRef& oldIdentity, const VSLContainerIdentityRef& newIdentity,
                          bool preserveOldUUID) {
    auto newConcrete = concreteOf(newIdentity);
    if (!newConcrete || !isValidContainerClass(newConcrete->containerClass()))
        return createVSLError(kReplaceFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                              "Can't act on an invalid object: newUUID: %@, Class: %ld",
                              newConcrete ? newConcrete->uuid().string() : std::string("(null)"),
                              newIdentity ? newIdentity->containerClass() : 0);
    if (auto oldConcrete = concreteOf(oldIdentity)) {
        if (oldConcrete->containerClass() != newConcrete->containerClass())
            return createVSLError(kReplaceFn, __LINE__, kVSLErrorReplaceClassMismatch, nullptr, true,
                                  "Can't replace containers of different class types: %ld and %ld",
                                  oldConcrete->containerClass(), newConcrete->containerClass());
        const auto& a = oldConcrete->userIdentity();
        const auto& b = newConcrete->userIdentity();
        if (!a || !b || !a->isEqual(*b))
            return createVSLError(kReplaceFn, __LINE__, kVSLErrorWrongPersona, nullptr, true,
                                  "Can't replace containers of different personas: %@ and %@",
                                  a ? a->identifier() : std::string("(null)"),
                                  b ? b->identifier() : std::string("(null)"));
    } else if (preserveOldUUID) {
        return createVSLError(kReplaceFn, __LINE__, kVSLErrorInvalidObject, nullptr, true,
                              "Can't have a nil oldContainerUUID when preserving the UUID");
    }
    return nullptr;
}

// The steps under the global write lock, up to the new container's record.
bool replaceSteps(VSLClientConnection& connection, const VSLContainerIdentityRef& oldIdentity,
                  const VSLContainerIdentityRef& newIdentity, bool preserveOldUUID,
                  const VSLReplaceFileOperations& ops, ReplaceRun& run, VSLErrorRef* error) {
    (void)connection;
    auto cache = VSLContainerCache::sharedInstance();
    auto configuration = VSLGlobalConfiguration::sharedInstance();
    auto oldConcrete = concreteOf(oldIdentity);
    auto newConcrete = concreteOf(newIdentity);
    if (oldConcrete) {
        run.oldContainer = cache->containerForContainerIdentity(oldConcrete);
        if (!run.oldContainer) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorNotFound, nullptr, true,
                                    "No Container with identity: %@", oldConcrete->description());
            return false;
        }
    }
    run.newContainer = cache->containerForContainerIdentity(newConcrete);
    if (!run.newContainer) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorNotFound, nullptr, true,
                                "No Container with identity: %@", newConcrete->description());
        return false;
    }
    const VSLMetadataRef& old = run.oldContainer;
    const VSLMetadataRef& fresh = run.newContainer;
    if (old && old->url() == fresh->url()) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorReplaceSelf, nullptr, true,
                                "Can't replace the same container at %@", fresh->url());
        return false;
    }
    auto directoryUUID = Uuid::parse(lastPathComponent(fresh->url()));
    if (!directoryUUID) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorInvalidPath, nullptr, true,
                                "Invalid URL (last path component not UUID): %@", fresh->url());
        return false;
    }

    const auto& user = newConcrete->userIdentity();
    VSLContainerClass c = newConcrete->containerClass();
    bool transient = old ? old->transient() : false;
    if (preserveOldUUID) {
        run.destination = old->url();
    } else {
        auto classDirectory = configuration->containerDirectoryURLForUserIdentity(user, c, transient);
        if (!classDirectory) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorUnexpectedClass, nullptr, true,
                                    "Passed an unexpected container type: %llu", c);
            return false;
        }
        run.destination = joinPath(*classDirectory, directoryUUID->string());
        if (ops.itemExists(run.destination)) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorAlreadyExists, nullptr, true,
                                    "Container already exists at %@", run.destination);
            return false;
        }
    }

    VSLErrorRef underlying;
    if (!old) {
        // Promotion: there must be no permanent container of this identity yet.
        VSLErrorRef lookupError;
        if (cache->containerForContainerIdentity(newIdentity, false, true, &lookupError)) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorAlreadyExists, nullptr, true,
                                    "Container with identifier: %@, class: %ld, transient: %d already exists",
                                    newConcrete->identifier(), c, false);
            return false;
        }
        if (!errorHasCode(lookupError, kVSLErrorNotFound)) {
            *error = lookupError;
            return false;
        }
    } else {
        std::string name = Uuid::random().string();
        run.journal = joinPath(configuration->replaceDirectory(), name + ".plist");
        auto stagingBase = configuration->stagingDirectoryURLForUserIdentity(user, c);
        run.staging = joinPath(stagingBase.value_or(configuration->stagingDirectory()), name);
        if (!_writeToDiskReplaceAt(run.journal, old->url(), fresh->url(), run.staging, run.destination,
                                   &underlying)) {
            LogWrite(kLogLevelError, kReplaceFn, "Failed to write replace file: %@", underlying);
            *error = underlying;
            return false;
        }
        if (!ops.moveItem(old->url(), run.staging, &underlying)) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorReplaceMoveOld, underlying, true,
                                    "Failed to move old %@ to staging %@", old->url(), run.staging);
            return false;
        }
        run.staged = true;
        VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kReplaceGate);
        if (!cache->removeContainerForUserIdentity(old->userIdentity(), old->containerClass(), old->identifier(),
                                                   old->transient(), &underlying)) {
            *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorCacheRemove, underlying, true,
                                    "Failed to remove from cache id: %@, class: %ld, transient: %d",
                                    old->identifier(), old->containerClass(), old->transient());
            return false;
        }
        if (isBundleContainerClass(c)) {
            auto mapping = VSLCodeSigningMapping::sharedInstance();
            if (mapping && !mapping->invalidateCodeSigningInfoForIdentifierAndItsChildren(old->identifier(),
                                                                                          &underlying)) {
                LogWrite(kLogLevelError, kReplaceFn, "Failed to invalidate code signing info for %@",
                         old->identifier());
                *error = underlying;
                return false;
            }
        }
    }

    // The new container takes the old UUID before it moves: once it is at the
    // destination the replacement counts as done, and a crash must not leave it there
    // answering to its own UUID.
    if (preserveOldUUID) {
        auto renamed = fresh->mutableCopy();
        renamed->setUuid(old->uuid());
        if (!renamed->writeMetadataToDiskWithError(&underlying)) {
            *error = underlying;
            return false;
        }
    }
    if (!ops.moveItem(fresh->url(), run.destination, &underlying)) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorReplaceFailed, underlying, true,
                                "Failed to replace: %@ with: %@ at: %@", old ? old->url() : std::string("(null)"),
                                fresh->url(), run.destination);
        return false;
    }
    if (!cache->removeContainerForUserIdentity(fresh->userIdentity(), fresh->containerClass(), fresh->identifier(),
                                               fresh->transient(), &underlying)) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorCacheRemove, underlying, true,
                                "Failed to remove from cache id: %@, class: %ld, transient: %d", fresh->identifier(),
                                fresh->containerClass(), fresh->transient());
        return false;
    }
    // The record handed out keeps its URL and UUID: the moved container gets a new one.
    auto record = fresh->mutableCopy();
    record->setUrl(run.destination);
    record->setTransient(transient);
    record->setExisted(true);
    if (preserveOldUUID) record->setUuid(old->uuid());
    if (!cache->addContainerMetadata(record, run.destination, transient, true, &underlying)) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorCacheAdd, underlying, true,
                                "Failed to add to cache: %@, url: %@, transient: %d", run.destination,
                                run.destination, transient);
        return false;
    }
    return !*error;
}

// After a failure once the old container was staged: it goes back when neither its
// place nor the destination holds anything, the rule boot recovery applies. False
// when it should have gone back and could not: it then stays in staging, under its
// journal, for the next start.
bool settleFailedReplace(const ReplaceRun& run, bool afterException, const VSLReplaceFileOperations& ops,
                         VSLErrorRef* error) {
    const auto& old = run.oldContainer;
    if (ops.itemExists(old->url()) || ops.itemExists(run.destination)) return true;
    if (afterException)
        LogWrite(kLogLevelError, kReplaceFn, "Recovering from exception by moving: %@ to %@", run.staging, old->url());
    else
        LogWrite(kLogLevelDebug, kReplaceFn, "Recovering from failed replace by moving: %@ to %@", run.staging,
                 old->url());
    VSLErrorRef underlying;
    if (!ops.moveItem(run.staging, old->url(), &underlying)) {
        *error = createVSLError(kReplaceFn, __LINE__, kVSLErrorReadReplaceRecord, underlying, true,
                                "Failed to recover replace move: %@ to %@", run.staging, old->url());
        return false;
    }
    // The record was taken out of the cache when the container left; the container is
    // back unchanged, so the same record is.
    if (!VSLContainerCache::sharedInstance()->addContainerMetadata(old, old->url(), old->transient(), true,
                                                                   &underlying))
        LogWrite(kLogLevelError, kReplaceFn, "Failed to add restored container to cache: %@ : %@", old->url(),
                 underlying);
    return true;
}

}  // namespace

void VSLClientConnection::replaceContainerIdentity(const VSLContainerIdentityRef& oldIdentity,
                                                   const VSLContainerIdentityRef& newIdentity, bool preserveOldUUID,
                                                   bool startDeletionThread, uint64_t* code) {
    if (auto refused = argumentError(oldIdentity, newIdentity, preserveOldUUID)) {
        if (code) *code = codeForError(refused, kVSLErrorInvalidObject);
        return;
    }
    const VSLReplaceFileOperations ops = currentReplaceFileOperations();
    VSLGlobalLockGuard lock;
    lock.write();
    ReplaceRun run;
    VSLErrorRef error;
    bool threw = false;
    bool ok = guardExceptions(kReplaceFn, __LINE__, &error, [&] {
        try {
            return replaceSteps(*this, oldIdentity, newIdentity, preserveOldUUID, ops, run, &error);
        } catch (...) {
            threw = true;
            throw;
        }
    });

    bool settled = true;
    if (!ok && run.staged) settled = settleFailedReplace(run, threw, ops, &error);
    if (!run.journal.empty() && settled) {
        VSLErrorRef underlying;
        if (ops.itemExists(run.staging) && !ops.moveToDeathRow(*this, run.staging, true, false, &underlying))
            error = createVSLError(kReplaceFn, __LINE__, kVSLErrorRemoveFile, underlying, true,
                                   "Failed to remove staging dir: %@", run.staging);
        if (ops.itemExists(run.journal) &&
            !ops.moveToDeathRow(*this, run.journal, false, startDeletionThread, &underlying))
            error = createVSLError(kReplaceFn, __LINE__, kVSLErrorRemoveFile, underlying, true,
                                   "Failed to remove replace file: %@", run.journal);
    }
    lock.release();
    if (error && code) *code = codeForError(error, kVSLErrorException);
}

bool VSLClientConnection::_recoverFromReplaceOperationsWithError(VSLErrorRef* error) {
    const VSLReplaceFileOperations ops = currentReplaceFileOperations();
    std::string directory = VSLGlobalConfiguration::sharedInstance()->replaceDirectory();
    VSLErrorRef listError;
    auto items = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &listError);
    if (!items) {
        if (isPOSIXError(listError, ENOENT)) return true;
        LogWrite(kLogLevelError, kRecoverFn, "Failed to get items at replace URL %@ : %@", directory, listError);
        if (error) *error = listError;
        return true;
    }
    for (const auto& item : *items) {
        VSLErrorRef readError;
        if (auto journal = _readAndValidateReplaceFileAtUrl(item.path, &readError)) {
            LogWrite(kLogLevelDebug, kRecoverFn,
                     "Doing a replace of %@ with info: old: %@, new: %@, staging: %@, dest: %@", item.path,
                     journal->oldURL, journal->newURL, journal->stagingURL, journal->destURL);
            // Something at the old place: the old container never left. Something at
            // the destination: the new one arrived. Either way nothing is half-done.
            // Nothing anywhere is a container lost before this start: no move can help,
            // and a journal kept would stop every later recovery.
            if (!ops.itemExists(journal->oldURL) && !ops.itemExists(journal->destURL) &&
                ops.itemExists(journal->stagingURL)) {
                LogWrite(kLogLevelDebug, kRecoverFn, "Recovering from failed replace by moving: %@ to %@",
                         journal->stagingURL, journal->oldURL);
                VSLErrorRef moveError;
                if (!ops.moveItem(journal->stagingURL, journal->oldURL, &moveError)) {
                    auto e = createVSLError(kRecoverFn, __LINE__, kVSLErrorReadReplaceRecord, moveError, true,
                                            "Failed to recover replace move: %@ to %@", journal->stagingURL,
                                            journal->oldURL);
                    if (error) *error = e;
                    return false;
                }
            }
        }
        VSLErrorRef removeError;
        if (!ops.moveToDeathRow(*this, item.path, false, false, &removeError)) {
            auto e = createVSLError(kRecoverFn, __LINE__, kVSLErrorRemoveFile, removeError, true,
                                    "Failed to remove replace file at %@", item.path);
            if (error) *error = e;
            return false;
        }
    }
    return true;
}

}  // namespace vsl
