// Death row: deleting is a rename into "Dead" while a client waits; the removal
// itself happens later, in the background, without any container lock.
#include <cerrno>
#include <cstring>

#include "Daemon/Core/VSLDispatch.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

bool isNoSuchFile(const VSLErrorRef& error) {
    for (VSLErrorRef e = error; e; e = e->underlyingError)
        if (isPOSIXError(e, ENOENT)) return true;
    return false;
}

}  // namespace

const std::shared_ptr<WorkQueue>& deathRowQueue() {
    static const auto queue = WorkQueue::serial("com.tarrow.vesseld.deathrow", QueuePriority::Background);
    return queue;
}

bool VSLClientConnection::_moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread,
                                                   VSLErrorRef* error) {
    auto& fm = VSLFileManager::defaultManager();
    std::string deathRow = VSLGlobalConfiguration::sharedInstance()->deathrowDirectory();
    VSLErrorRef underlying;
    auto unique = fm.createTemporaryDirectoryInDirectoryURL(deathRow, "temp.", &underlying);
    // The new directory's entry must be on disk before the item moves into it: the move
    // syncs only the directory it lands in and the one it left.
    if (unique)
        if (int rc = durable::fsyncParent(*unique)) {
            underlying = VSL_POSIX_ERROR(rc, "fsync of %@ failed: %s", deathRow, std::strerror(rc));
            unique.reset();
        }
    if (!unique) {
        if (error) *error = VSL_ERROR(kVSLErrorMoveToDeathRow, underlying, true, "Failed to create unique directory at: %@", url);
        return false;
    }
    std::string destination = joinPath(*unique, lastPathComponent(url));
    (void)isDir;  // paths carry no directory flag here
    if (!fm.moveItemAtURL(url, destination, &underlying)) {
        if (isNoSuchFile(underlying)) {
            if (error) *error = underlying;
            return true;
        }
        if (error) *error = VSL_ERROR(kVSLErrorMoveToDeathRow, underlying, true, "Failed to move item at: %@ to: %@", url, destination);
        return false;
    }
    if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
    return true;
}

bool VSLClientConnection::_removeItemOrMoveToTempAtURL(const std::string& url, VSLErrorRef* error) {
    auto& fm = VSLFileManager::defaultManager();
    VSLErrorRef removeError;
    if (fm.removeItemAtURL(url, &removeError) || isNoSuchFile(removeError)) return true;
    LogWrite(kLogLevelDebug, "-[VSLClientConnection _removeItemOrMoveToTempAtURL:error:]",
             "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
    std::string tmp = rootedPath("/tmp");
    VSLErrorRef moveError;
    if (fm.moveItemAtURL(url, joinPath(tmp, lastPathComponent(url)), &moveError)) return true;
    if (error) *error = VSL_ERROR(kVSLErrorMoveDir, moveError, true, "Failed to move dir: %@ to: %@", url, tmp);
    return false;
}

void VSLClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion) {
    // Each pass lists the directory afresh, so overlapping requests only find leftovers.
    auto self = shared_from_this();
    const char* const writer = VSL_FUNCTION;  // the work below writes in this method's name
    dispatchAsyncWithTransaction(deathRowQueue(), [self, writer, completion = std::move(completion)] {
        auto& fm = VSLFileManager::defaultManager();
        std::string deathRow = VSLGlobalConfiguration::sharedInstance()->deathrowDirectory();
        VSLErrorRef recorded;
        VSLErrorRef listError;
        auto items = fm.urlsForItemsInDirectoryAtURL(deathRow, &listError);
        if (!items) {
            if (!isNoSuchFile(listError))
                recorded = createVSLError(writer, __LINE__, kVSLErrorDeleteContainer, listError, true,
                                          "Failed to get items for deletion: %@ : %@", deathRow, listError);
        } else {
            for (const auto& item : *items) {
                VSLTestLocks::sharedInstance().waitOnLock(VSLTestLocks::kDeathRowGate);
                VSLErrorRef itemError;
                if (!self->_removeItemOrMoveToTempAtURL(item.path, &itemError))
                    recorded = createVSLError(writer, __LINE__, kVSLErrorDestroyDeathRowItem, itemError, true,
                                              "Failed to destroy item at: %@", item.path);
            }
        }
        if (completion) completion(recorded ? codeForError(recorded, kVSLErrorDestroyDeathRowItem) : kVSLSuccess);
    });
}

}  // namespace vsl
