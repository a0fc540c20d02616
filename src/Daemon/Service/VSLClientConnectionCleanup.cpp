// The start-up clean-ups: they return at once and finish on the background queue,
// each holding a keep-alive transaction until its completion has run.
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <set>
#include <string>
#include <vector>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLPerUserConfiguration.h"
#include "Platform/Log.h"
#include "Platform/Transaction.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

constexpr const char* kVesselCleanup = "-[VSLClientConnection vesselCleanupWithCompletion:]";
constexpr const char* kRebootCleanup = "-[VSLClientConnection rebootVesselCleanupWithCompletion:]";
constexpr const char* kOrphanCleanup = "-[VSLClientConnection _cleanupOrphanedDataForDirectories:containerClass:]";

enum class Entry { Gone, HasMetadata, NoMetadata, Unknown };

// Read through a descriptor that follows no link: a container is user-writable. Only
// a metadata file known to be missing makes an orphan; a failure to look is not that.
Entry inspectEntry(const std::string& item) {
    UniqueFd dir(::open(item.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!dir) {
        if (errno == ENOENT) return Entry::Gone;
        struct stat st;
        if (errno == ENOTDIR || errno == ELOOP) return ::lstat(item.c_str(), &st) == 0 ? Entry::NoMetadata : Entry::Gone;
        return Entry::Unknown;
    }
    struct stat st;
    if (::fstatat(dir.get(), kVSLMetadataFileName, &st, AT_SYMLINK_NOFOLLOW) == 0) return Entry::HasMetadata;
    return errno == ENOENT ? Entry::NoMetadata : Entry::Unknown;
}

void moveToDeathRow(const VSLClientConnectionRef& self, const std::optional<std::string>& directory,
                    const char* failureFormat) {
    if (!directory) return;
    VSLErrorRef error;
    if (!self->_moveItemAtURLToDeathRow(*directory, true, false, &error))
        LogWrite(kLogLevelError, kRebootCleanup, failureFormat, *directory, error);
}

// Appends the items of `directory`; a missing directory holds none.
// Personas of one uid share a home: each directory is listed once.
void appendItemsOf(const std::optional<std::string>& directory, const char* failureFormat,
                   std::set<std::string>& listedDirectories, std::vector<std::string>& items) {
    if (!directory || !listedDirectories.insert(*directory).second) return;
    VSLErrorRef error;
    auto listed = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, &error);
    if (!listed) {
        if (!isPOSIXError(error, ENOENT)) LogWrite(kLogLevelError, kVesselCleanup, failureFormat, *directory, error);
        return;
    }
    for (const auto& item : *listed) items.push_back(item.path);
}

}  // namespace

void VSLClientConnection::_cleanupOrphanedDataForDirectories(const std::vector<std::string>& directories,
                                                             VSLContainerClass containerClass) {
    auto& fm = VSLFileManager::defaultManager();
    for (const auto& directory : directories) {
        VSLErrorRef error;
        auto items = fm.urlsForItemsInDirectoryAtURL(directory, &error);
        if (!items) {
            if (!isPOSIXError(error, ENOENT)) LogWrite(kLogLevelError, kOrphanCleanup, "Failed to get items : %@", error);
            continue;
        }
        for (const auto& item : *items) {
            Entry entry = inspectEntry(item.path);
            if (entry == Entry::Gone) {
                LogWrite(kLogLevelDebug, kOrphanCleanup, "Ignoring deleted container path during cleanup: [%@]",
                         item.path);
                continue;
            }
            if (entry != Entry::NoMetadata ||
                !VSLContainerCache::sharedInstance()->containerURLIsValidForContainerClass(item.path, containerClass))
                continue;
            LogWrite(kLogLevelError, kOrphanCleanup, "Deleting orphaned data missing a metadata file at: %@", item.path);
            if (VSLGlobalConfiguration::sharedInstance()->isInternalImage()) {
                LogWrite(kLogLevelError, kOrphanCleanup,
                         "********************************************************************************\n"
                         "Please file a bug: %@ is invalid data that someone wrote into a container's place\n"
                         "without a metadata file. Its structure follows.\n"
                         "********************************************************************************",
                         item.path);
                fm.printDirectoryStructureAtURL(item.path);
            }
            VSLErrorRef moveError;  // logged where it was made
            _moveItemAtURLToDeathRow(item.path, true, false, &moveError);
        }
    }
}

void VSLClientConnection::_cleanupOprhanedCodeSigningMappingData() {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    VSLErrorRef error;
    if (mapping && !mapping->removeAllAdvanceCopiesWithError(&error))
        LogWrite(kLogLevelError, "-[VSLClientConnection _cleanupOprhanedCodeSigningMappingData]",
                 "Could not remove advance copies of code sign data: %@", error);
}

void VSLClientConnection::rebootVesselCleanupWithCompletion(std::function<void()> completion) {
    auto transaction = std::make_shared<Transaction>("com.tarrow.vesseld.reboot-cleanup");
    auto self = shared_from_this();
    auto config = VSLGlobalConfiguration::sharedInstance();
    // What transient containers lived in ends with the boot.
    moveToDeathRow(self, config->transientDirectory(), "Failed to delete shared transient URL %@ : %@");
    if (auto legacy = config->legacyTransientBundleDirectory()) {
        LogWrite(kLogLevelError, kRebootCleanup, "Sentencing legacy transient bundle directory [%@] to final deletion",
                 *legacy);
        moveToDeathRow(self, legacy, "Failed to delete legacy shared transient bundle URL %@ : %@");
    }
    moveToDeathRow(self, config->transientBundleDirectory(), "Failed to delete shared transient bundle URL %@ : %@");

    auto& queue = backgroundQueue();
    userIdentityCache()->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        auto perUser = config->getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        moveToDeathRow(self, perUser->transientDirectory(), "Failed to delete per-user transient URL %@ : %@");
        forEachPerUserContainerClass([&](VSLContainerClass containerClass) {
            auto directory = config->containerDirectoryURLForUserIdentity(user, containerClass, false);
            if (!directory) return;
            queue->async([self, directory = *directory, containerClass] {
                self->_cleanupOrphanedDataForDirectories({directory}, containerClass);
            });
        });
    });
    auto defaultUser = VSLUserIdentityCache::defaultUserIdentity();
    for (VSLContainerClass containerClass : {kVSLClassApplication, kVSLClassPlugin, kVSLClassVPNPlugin,
                                             kVSLClassFramework, kVSLClassSystemData, kVSLClassSystemGroup}) {
        auto directory = config->containerDirectoryURLForUserIdentity(defaultUser, containerClass, false);
        if (!directory) continue;
        queue->async([self, directory = *directory, containerClass] {
            self->_cleanupOrphanedDataForDirectories({directory}, containerClass);
        });
    }
    queue->async([self] { self->_cleanupOprhanedCodeSigningMappingData(); });
    // The queue is serial: the completion runs after every clean-up submitted above.
    queue->async([transaction, completion = std::move(completion)] {
        if (completion) completion();
        transaction->close();
    });
}

void VSLClientConnection::vesselCleanupWithCompletion(std::function<void()> completion) {
    auto transaction = std::make_shared<Transaction>("com.tarrow.vesseld.cleanup");
    auto config = VSLGlobalConfiguration::sharedInstance();
    // Whatever is in staging now was being built when the last process ended: no
    // request of this process has started yet.
    std::set<std::string> listed;
    std::vector<std::string> items;
    appendItemsOf(config->stagingDirectory(), "Failed to get items at global staging URL: %@ : %@", listed, items);
    userIdentityCache()->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        // A user without a home has no staging, and none is made for it here.
        auto perUser = config->getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        appendItemsOf(config->stagingDirectoryURLForUserIdentity(user, kVSLClassApplicationData),
                      "Failed to get items at per-user staging URL: %@ : %@", listed, items);
    });
    auto self = shared_from_this();
    backgroundQueue()->async([self, items = std::move(items), transaction, completion = std::move(completion)] {
        for (const auto& item : items) {
            VSLErrorRef error;  // logged where it was made
            self->_moveItemAtURLToDeathRow(item, true, false, &error);
        }
        self->deleteContainersOnDeathRowWithCompletion([transaction, completion](uint64_t) {
            backgroundQueue()->async([transaction, completion] {
                if (completion) completion();
                transaction->close();
            });
        });
    });
}

}  // namespace vsl
