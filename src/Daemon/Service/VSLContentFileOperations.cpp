#include "Daemon/Service/VSLContentFileOperations.h"

#include <mutex>

#include "Daemon/Storage/VSLFileManager.h"

namespace vsl {

namespace {

std::mutex& operationsMutex() {
    static std::mutex m;
    return m;
}

std::optional<VSLContentFileOperations>& installed() {
    static std::optional<VSLContentFileOperations> operations;
    return operations;
}

}  // namespace

VSLContentFileOperations defaultContentFileOperations() {
    VSLContentFileOperations operations;
    operations.realPath = [](const std::string& url) {
        return VSLFileManager::defaultManager()._realPathForURL(url, false);
    };
    operations.removeItemBelowDirectory = [](const std::string& directory, const std::string& relativePath,
                                             VSLErrorRef* error) {
        return VSLFileManager::defaultManager().removeItemBelowDirectoryAtURL(directory, relativePath, error);
    };
    return operations;
}

VSLContentFileOperations currentContentFileOperations() {
    std::lock_guard<std::mutex> lock(operationsMutex());
    return installed() ? *installed() : defaultContentFileOperations();
}

void setContentFileOperationsForTesting(std::optional<VSLContentFileOperations> operations) {
    std::lock_guard<std::mutex> lock(operationsMutex());
    installed() = std::move(operations);
}

}  // namespace vsl
