#include "Daemon/Service/VSLSystemContainerRestore.h"

#include <cerrno>
#include <optional>

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Daemon/Storage/VSLPerUserConfiguration.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

constexpr const char* kMoveIntoPlace = "VSLMoveSystemContainersIntoPlace";
constexpr const char* kMoveOne = "_moveSystemContainerIntoPlace";

// The backup lives in the mobile user's home: a link put on the way must not lead the
// daemon to install (or list) some other directory.
bool isPlainDirectory(const std::string& path) {
    UniqueFd fd;
    return durable::openDirectoryNoFollow(path, fd.out()) == 0;
}

std::string withExtension(const std::string& path, const char* extension) {
    return path + "." + extension;
}

// A child that cannot be placed is kept, not lost: under "<dir>.failed/<identifier>".
void putAside(const std::string& child, const std::string& failureDirectory) {
    auto& fm = VSLFileManager::defaultManager();
    VSLErrorRef error;
    if (!fm.createDirectoryAtURL(failureDirectory, true, 0777, &error)) {
        LogWrite(kLogLevelError, kMoveOne, "Failed to create %@: %@", failureDirectory, error);
        return;
    }
    std::string destination = joinPath(failureDirectory, lastPathComponent(child));
    if (!fm.moveItemAtURL(child, destination, &error))
        LogWrite(kLogLevelError, kMoveOne, "Failed to move %@ to %@: %@", child, destination, error);
}

struct BackupKind {
    std::optional<std::string> directory;
    VSLContainerClass containerClass;
    const char* moveFailure;
    const char* installing;
    const char* listFailure;
};

void installBackup(const BackupKind& kind, const VSLClientConnectionRef& connection) {
    auto& fm = VSLFileManager::defaultManager();
    if (!kind.directory || !fm.itemExistsAtURL(*kind.directory)) return;
    std::string inProgress = withExtension(*kind.directory, "inprogress");
    VSLErrorRef error;
    if (!isPlainDirectory(*kind.directory)) {
        LogWrite(kLogLevelError, kMoveIntoPlace, kind.listFailure, *kind.directory, "not a directory reached without links");
        return;
    }
    if (!fm.removeItemAtURL(inProgress, &error))
        LogWrite(kLogLevelError, kMoveIntoPlace, "Failed to remove existing inprogress system containers: %@", error);
    if (!fm.moveItemAtURL(*kind.directory, inProgress, &error)) {
        LogWrite(kLogLevelError, kMoveIntoPlace, kind.moveFailure, error);
        return;
    }
    LogWrite(kLogLevelNotice, kMoveIntoPlace, kind.installing);
    auto items = fm.urlsForItemsInDirectoryAtURL(inProgress, &error);
    if (!items) {
        LogWrite(kLogLevelError, kMoveIntoPlace, kind.listFailure, inProgress, error);
        return;
    }
    for (const auto& item : *items) _moveSystemContainerIntoPlace(item.path, kind.containerClass, connection);
}

}  // namespace

void _moveSystemContainerIntoPlace(const std::string& item, VSLContainerClass containerClass,
                                   const VSLClientConnectionRef& connection) {
    auto& fm = VSLFileManager::defaultManager();
    const std::string identifier = lastPathComponent(item);
    const std::string failureDirectory = joinPath(withExtension(parentPath(item), "failed"), identifier);
    if (!isPlainDirectory(item)) {
        LogWrite(kLogLevelError, kMoveOne, "Failed to enumerate contents of restored system container %@ at %@: %@",
                 identifier, item, "not a directory reached without links");
        return;
    }
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithIdentifier(identifier, containerClass, &code);
    if (!identity) {
        LogWrite(kLogLevelError, kMoveOne, "Failed to create container identity %@: %llu", identifier,
                 static_cast<unsigned long long>(code));
        return;
    }
    auto container = connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true, &code);
    if (!container || code != kVSLSuccess) {
        LogWrite(kLogLevelError, kMoveOne, "Failed to create system container %@: %llu", identifier,
                 static_cast<unsigned long long>(code));
        return;
    }
    LogWrite(kLogLevelError, kMoveOne, "Restoring container for %@ at %@ to %@", identifier, item, container->url());
    VSLErrorRef error;
    if (auto children = fm.urlsForItemsInDirectoryAtURL(item, &error)) {
        for (const auto& child : *children) {
            std::string destination = joinPath(container->url(), lastPathComponent(child.path));
            VSLErrorRef childError;
            if (!fm.removeItemAtURL(destination, &childError)) {
                LogWrite(kLogLevelError, kMoveOne, "Failed to remove destination %@:%@: %@", identifier, destination,
                         childError);
                putAside(child.path, failureDirectory);
            } else if (!fm.moveItemAtURL(child.path, destination, &childError)) {
                LogWrite(kLogLevelError, kMoveOne,
                         "Failed to move file in restored system container %@:%@ to destination %@: %@", identifier,
                         child.path, destination, childError);
                putAside(child.path, failureDirectory);
            }
        }
    } else {
        LogWrite(kLogLevelError, kMoveOne, "Failed to enumerate contents of restored system container %@ at %@: %@",
                 identifier, item, error);
    }
    code = kVSLSuccess;
    if (auto concrete = container->containerIdentity();
        !concrete || !connection->recreateDefaultStructureWithContainerIdentity(concrete, &code))
        LogWrite(kLogLevelError, kMoveOne, "Error processing restored system container %@: %llu", identifier,
                 static_cast<unsigned long long>(code));
}

void VSLMoveSystemContainersIntoPlace(const VSLClientConnectionRef& connection) {
    auto user = connection->userIdentityCache()->userIdentityForCurrentContext();
    auto configuration = VSLGlobalConfiguration::sharedInstance()->getPerUserConfigurationForUserIdentity(user);
    if (!configuration) return;
    installBackup({configuration->systemContainerBackupDirectory(), kVSLClassSystemData,
                   "Failed to move system containers to inprogress: %@", "Installing system containers",
                   "Couldn't find any system containers at %@: %@"},
                  connection);
    installBackup({configuration->systemGroupContainerBackupDirectory(), kVSLClassSystemGroup,
                   "Failed to move shared system containers to inprogress: %@", "Installing system group containers",
                   "Couldn't find any system group containers at %@: %@"},
                  connection);
    if (VSLGlobalConfiguration::sharedInstance()->isInternalImage()) return;
    auto base = configuration->systemContainerBackupBaseDirectory();
    VSLErrorRef error;
    if (base && !VSLFileManager::defaultManager().removeItemAtURL(*base, &error))
        LogWrite(kLogLevelError, kMoveIntoPlace, "Failed to remove system container backup directory %@: %@", *base,
                 error);
}

}  // namespace vsl
