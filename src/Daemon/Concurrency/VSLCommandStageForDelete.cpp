#include "Daemon/Concurrency/VSLCommandStageForDelete.h"

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

std::string lastPathComponent(const std::string& path) {
    std::string p = path;
    while (p.size() > 1 && p.back() == '/') p.pop_back();
    size_t slash = p.rfind('/');
    return slash == std::string::npos ? p : p.substr(slash + 1);
}

// Whether the code-signing records go with the container: not when a transient
// container is staged while its permanent twin stays.
bool shouldRemoveCodeSigningRecords(const VSLMetadata& container, const VSLErrorRef& pending) {
    if (!container.transient()) return true;
    uint64_t code = kVSLSuccess;
    auto plain = VSLContainerIdentity::containerIdentityWithIdentifier(container.identifier(),
                                                                       container.containerClass(), &code);
    if (!plain) {
        LogWrite(kLogLevelError, "-[VSLCommandStageForDelete fromQueue:executeWithError:]",
                 "Could not construct container identity from %@ to check for permanent copy: %llu", container, code);
        return true;
    }
    VSLErrorRef ignored;
    if (VSLContainerCache::sharedInstance()->containerForContainerIdentity(plain, false, false, &ignored)) {
        osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
              "Skipping removal of code sign mapping since container to be deleted [%@] is transient and there's a "
              "permanent one; error = %@",
              container.identifier(), pending);
        return false;
    }
    return true;
}

}  // namespace

std::shared_ptr<VSLCommandStageForDelete> VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<VSLContainerIdentityRef> containerIdentities, bool useLocking, OnError onError) {
    return std::make_shared<VSLCommandStageForDelete>(std::move(containerIdentities), useLocking, std::move(onError));
}

std::shared_ptr<VSLCommandStageForDelete> VSLCommandStageForDelete::commandForStageForDeleteOfUnreferencedGroups(
    std::vector<VSLContainerIdentityRef> containerIdentities, bool useLocking, OnError onError) {
    return std::make_shared<VSLCommandStageForDelete>(std::move(containerIdentities), useLocking, std::move(onError),
                                                      true);
}

VSLCommandStageForDelete::VSLCommandStageForDelete(std::vector<VSLContainerIdentityRef> containerIdentities,
                                                   bool useLocking, OnError onError, bool onlyUnreferencedGroups)
    : useLocking_(useLocking),
      onlyUnreferencedGroups_(onlyUnreferencedGroups),
      containerIdentities_(std::move(containerIdentities)),
      onError_(std::move(onError)) {}

// Runs under the global write lock, which registrations do not take: one that lands
// after this count is ordered after the staging, since nothing can look the group
// up before the lock is released.
bool VSLCommandStageForDelete::groupIsNamedAgain(const VSLMetadata& container) const {
    if (!onlyUnreferencedGroups_ || !isGroupContainerClass(container.containerClass())) return false;
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    if (!mapping) return false;
    const VSLCountedSet counts =
        mapping->copyReferenceCountSetOfType(containerClassTraits(container.containerClass()).groupType);
    auto counted = counts.find(container.identifier());
    if (counted == counts.end() || counted->second == 0) return false;
    osLog(LogCategory::CodeSignMapping, OSLogLevel::Default,
          "Keeping group container %@ for %@: named again since it was queued for deletion", container.identifier(),
          container.userIdentity());
    return true;
}

bool VSLCommandStageForDelete::stageAll(const std::shared_ptr<VSLCommandQueue>& queue, VSLErrorRef* pending) {
    const auto& cache = VSLContainerCache::sharedInstance();
    const VSLFileManager& fm = VSLFileManager::defaultManager();
    std::string deathrow = VSLGlobalConfiguration::sharedInstance()->deathrowDirectory();
    for (const auto& identity : containerIdentities_) {
        if (!identity) continue;
        VSLMetadataRef container;
        if (identity->isConcrete()) {
            // This lookup reports no error of its own.
            container = cache->containerForContainerIdentity(
                std::static_pointer_cast<const VSLConcreteContainerIdentity>(identity));
        } else {
            VSLErrorRef lookupError;
            container = cache->containerForContainerIdentity(identity, false, true, &lookupError);
            if (!container) *pending = lookupError;
        }
        if (!container || groupIsNamedAgain(*container)) continue;

        std::string destination = deathrow + "/" + lastPathComponent(container->url());
        if (isBundleContainerClass(container->containerClass()) &&
            shouldRemoveCodeSigningRecords(*container, *pending)) {
            if (auto mapping = VSLCodeSigningMapping::sharedInstance())
                mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(container->identifier(), queue);
        }

        VSLErrorRef moveError;
        if (!fm.moveItemAtURL(container->url(), destination, &moveError)) {
            LogWrite(kLogLevelDebug, "-[VSLCommandStageForDelete fromQueue:executeWithError:]",
                     "Couldn't stage for deletion from %@ to %@: %@", container->url(), destination, moveError);
            VSLErrorRef removeError;
            if (!fm.removeItemAtURL(container->url(), &removeError)) {
                VSL_ERROR(kVSLErrorDeleteContainer, removeError, true, "Failed to delete container at %@: %@",
                          container->url(), removeError);
                *pending = nullptr;
                continue;
            }
        }

        VSLErrorRef removeError;
        if (!cache->removeContainerForUserIdentity(container->userIdentity(), container->containerClass(),
                                                   container->identifier(), container->transient(), &removeError)) {
            *pending =
                VSL_ERROR(kVSLErrorCacheRemove, removeError, true,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d", container->identifier(),
                          static_cast<long>(container->containerClass()), container->transient());
            return false;
        }
    }
    return true;
}

bool VSLCommandStageForDelete::fromQueue(const std::shared_ptr<VSLCommandQueue>& queue, uint64_t* code) {
    VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kDeathRowGate);
    VSLErrorRef pending;
    bool ok = false;
    {
        VSLGlobalLockGuard lock(useLocking_);
        try {
            lock.write();
            ok = stageAll(queue, &pending);
        } catch (...) {
            pending = errorForCaughtException("-[VSLCommandStageForDelete fromQueue:executeWithError:]", __LINE__);
            ok = false;
        }
    }
    if (pending) {
        uint64_t failure = codeForError(pending, kVSLErrorDeleteContainer);
        if (onError_) onError_(failure);
        if (code) *code = failure;
    }
    return ok;
}

}  // namespace vsl
