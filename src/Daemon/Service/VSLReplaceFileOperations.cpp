#include "Daemon/Service/VSLReplaceFileOperations.h"

#include <mutex>

#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLFileManager.h"

namespace vsl {

namespace {

std::mutex& operationsMutex() {
    static std::mutex m;
    return m;
}

std::optional<VSLReplaceFileOperations>& installed() {
    static std::optional<VSLReplaceFileOperations> operations;
    return operations;
}

}  // namespace

VSLReplaceFileOperations defaultReplaceFileOperations() {
    VSLReplaceFileOperations operations;
    operations.moveItem = [](const std::string& from, const std::string& to, VSLErrorRef* error) {
        return VSLFileManager::defaultManager().moveItemAtURL(from, to, error);
    };
    operations.itemExists = [](const std::string& url) { return VSLFileManager::defaultManager().itemExistsAtURL(url); };
    operations.moveToDeathRow = [](VSLClientConnection& connection, const std::string& url, bool isDir,
                                   bool startDeletionThread, VSLErrorRef* error) {
        return connection._moveItemAtURLToDeathRow(url, isDir, startDeletionThread, error);
    };
    return operations;
}

VSLReplaceFileOperations currentReplaceFileOperations() {
    std::lock_guard<std::mutex> lock(operationsMutex());
    return installed() ? *installed() : defaultReplaceFileOperations();
}

void setReplaceFileOperationsForTesting(std::optional<VSLReplaceFileOperations> operations) {
    std::lock_guard<std::mutex> lock(operationsMutex());
    installed() = std::move(operations);
}

}  // namespace vsl
