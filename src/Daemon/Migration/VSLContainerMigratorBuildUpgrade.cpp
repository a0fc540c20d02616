// The migration run at the first boot of a new build, before any client is served.
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Migration/VSLContainerMigrator.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Service/VSLStartup.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Daemon/Storage/VSLPerUserConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

constexpr const char* kBuildUpgradeFn = "-[VSLContainerMigrator performSynchronousBuildUpgradeMigration:withError:]";
constexpr const char* kWhitelistFn = "-[VSLContainerMigrator _performWhitelistMigrationWithError:]";

// "vesseld.log.2" -> 2; none for a name without a numeric extension.
std::optional<long> numericExtension(const std::string& name) {
    size_t dot = name.rfind('.');
    if (dot == std::string::npos || dot + 1 == name.size()) return std::nullopt;
    char* end = nullptr;
    long n = std::strtol(name.c_str() + dot + 1, &end, 10);
    if (*end) return std::nullopt;
    return n;
}

// Rotated logs of older builds lived in the mobile user's home; they join the current
// log's rotation, each one step older.
void moveOldLogFiles() {
    auto& fm = VSLFileManager::defaultManager();
    auto perUser = VSLGlobalConfiguration::sharedInstance()->getPerUserConfigurationForUserIdentity(
        VSLUserIdentityCache::defaultUserIdentity());
    auto oldPath = perUser ? perUser->oldLoggingPath() : std::nullopt;
    if (!oldPath) return;
    const std::string logDirectory = VSLGlobalConfiguration::sharedInstance()->logDirectory();
    // Both may name one directory (a root whose mobile user lives at the daemon's home):
    // then nothing moves and nothing is removed.
    if (*oldPath == logDirectory) return;
    VSLErrorRef error;
    // Below the mobile user's home: a link on the way must not make the daemon move
    // files out of some other directory.
    UniqueFd checked;
    if (int rc = durable::openDirectoryNoFollow(*oldPath, checked.out()); rc && rc != ENOENT) {
        LogWrite(kLogLevelError, kBuildUpgradeFn, "Failed to get items for deletion: %@ : %s", *oldPath,
                 std::strerror(rc));
    } else if (auto items = fm.urlsForItemsInDirectoryAtURL(*oldPath, &error)) {
        for (const auto& item : *items) {
            std::string name = lastPathComponent(item.path);
            auto n = numericExtension(name);
            if (!n || *n < 0 || *n + 1 > diskLoggingParameter()) continue;
            std::string moved = joinPath(logDirectory, name.substr(0, name.rfind('.') + 1) + std::to_string(*n + 1));
            VSLErrorRef moveError;
            if (!fm.moveItemAtURL(item.path, moved, &moveError))
                LogWrite(kLogLevelError, kBuildUpgradeFn, "Failed to move to new logging directory from %@ : %@",
                         item.path, moveError);
        }
        LogWrite(kLogLevelNotice, kBuildUpgradeFn, "Migrated log files on %@", VSLMigrationStatus::currentBuildVersion());
    } else if (!isPOSIXError(error, ENOENT)) {
        LogWrite(kLogLevelError, kBuildUpgradeFn, "Failed to get items for deletion: %@ : %@", *oldPath, error);
    }
    if (!fm.removeItemAtURL(*oldPath, &error))
        LogWrite(kLogLevelError, kBuildUpgradeFn, "Failed to remove old Log directory: %@", error);
}

}  // namespace

bool VSLContainerMigrator::performSynchronousBuildUpgradeMigration(VSLMigrationStatus& status, VSLErrorRef* error) {
    auto& fm = VSLFileManager::defaultManager();
    if (!deviceFacts().multiUser) moveOldLogFiles();

    const std::string legacyBundles = rootedPath("/private/var/mobile/Containers/Bundle");
    if (fm.itemExistsAtURL(legacyBundles)) {
        LogWrite(kLogLevelNotice, kBuildUpgradeFn, "Moving bundle containers from user to system location");
        VSLErrorRef moveError;
        if (!fm.moveItemAtURL(legacyBundles, VSLGlobalConfiguration::sharedInstance()->bundleDirectory(),
                              &moveError)) {
            LogWrite(kLogLevelError, kBuildUpgradeFn,
                     "Failed to migrate to new bundle containers location : %@.  This is terrible.", moveError);
            if (error) *error = moveError;
            return false;
        }
    }
    _checkIfDeviceMayNeedSystemContainerACLMigration(status);
    VSLErrorRef whitelistError;
    if (!_performWhitelistMigrationWithError(&whitelistError)) {
        LogWrite(kLogLevelError, kBuildUpgradeFn, "Failed to migrate whitelisted bundle containers : %@",
                 whitelistError);
        if (error) *error = whitelistError;
        return false;
    }
    return true;
}

void VSLContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(VSLMigrationStatus& status) {
    if (status.hasMigrationOccurredForType(kVSLMigrationACL)) return;
    auto base = VSLGlobalConfiguration::sharedInstance()->globalContainerBaseURLWithContentClass(kVSLClassSystemData,
                                                                                               false);
    if (base && VSLFileManager::defaultManager().itemExistsAtURL(*base)) return;
    LogWrite(kLogLevelNotice, "-[VSLContainerMigrator _checkIfDeviceMayNeedSystemContainerACLMigration:]",
             "No system containers requiring ACL migration");
    status.setMigrationCompleteForType(kVSLMigrationACL);
}

bool VSLContainerMigrator::_performWhitelistMigrationWithError(VSLErrorRef* error) {
    auto cache = VSLContainerCache::sharedInstance();
    auto whitelist = VSLWhitelist::sharedWhitelist();
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto fail = [&](VSLErrorRef e) {
        if (error) *error = std::move(e);
        return false;
    };
    for (VSLContainerClass containerClass : {kVSLClassSystemData, kVSLClassSystemGroup}) {
        VSLErrorRef listError;
        auto containers = cache->allContainersForUserIdentity(user, containerClass, false, &listError);
        if (!containers) {
            LogWrite(kLogLevelError, kWhitelistFn, "Failed to get list of system containers for migration: (error= %@ : %lld)",
                     listError, static_cast<long long>(listError ? listError->code : 0));
            return fail(listError);
        }
        auto classDirectory =
            VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(user, containerClass, false);
        for (const auto& container : *containers) {
            const std::string& identifier = container->identifier();
            if (!classDirectory || !whitelist->containerIdIsWellknown(identifier, containerClass)) continue;
            auto name = whitelist->wellknownContainerForId(identifier, containerClass);
            if (!name) continue;
            const std::string wellKnown = joinPath(*classDirectory, *name);
            if (container->url() == wellKnown) continue;
            LogWrite(kLogLevelError, kWhitelistFn, "Migrating well-known container %@ from %@ to %@", identifier,
                     container->url(), wellKnown);
            VSLGlobalLockGuard lock;
            lock.write();
            VSLErrorRef e;
            if (!cache->removeContainerForUserIdentity(user, containerClass, identifier, false, &e)) {
                LogWrite(kLogLevelError, kWhitelistFn, "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
                         kWhitelistFn, identifier, e, static_cast<long long>(e ? e->code : 0));
                return fail(e);
            }
            if (!VSLFileManager::defaultManager().moveItemAtURL(container->url(), wellKnown, &e)) {
                LogWrite(kLogLevelError, kWhitelistFn,
                         "%s: Failed to move system container %@ from %@ to whitelisted location %@: (error= %@: %lld)",
                         kWhitelistFn, identifier, container->url(), wellKnown, e, static_cast<long long>(e ? e->code : 0));
                return fail(e);
            }
            auto moved = container->mutableCopy();
            moved->setUrl(wellKnown);
            if (!cache->addContainerMetadata(moved, wellKnown, false, true, &e)) {
                LogWrite(kLogLevelError, kWhitelistFn, "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
                         kWhitelistFn, identifier, e, static_cast<long long>(e ? e->code : 0));
                return fail(e);
            }
        }
    }
    return true;
}

}  // namespace vsl
