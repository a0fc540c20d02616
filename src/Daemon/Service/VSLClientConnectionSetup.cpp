// Start-up setup on the listener queue: the first start after boot, then every start.
#include <string>

#include "Daemon/CodeSigning/VSLGroupManager.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Concurrency/VSLDataProtectionManager.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Migration/VSLContainerMigrator.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLSystemContainerRestore.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// Keeps its name across builds, as clients find it by path.
constexpr const char* kPinnedSystemGroup = "systemgroup.com.tarrow.wrenfield";

}  // namespace

void VSLClientConnection::_regenerateAllSystemContainerPaths() {
    constexpr const char* fn = "-[VSLClientConnection _regenerateAllSystemContainerPaths]";
    LogWrite(kLogLevelNotice, fn, "Rolling system container directory UUIDs on disk");
    auto whitelist = VSLWhitelist::sharedWhitelist();
    for (VSLContainerClass containerClass : {kVSLClassSystemData, kVSLClassSystemGroup}) {
        VSLErrorRef error;
        auto containers = VSLContainerCache::sharedInstance()->allContainersForUserIdentity(
            clientIdentity_->userIdentity(), containerClass, false, &error);
        if (!containers) {
            LogWrite(kLogLevelError, fn, "Failed to get list of system containers for migration: %@", error);
            continue;
        }
        for (const auto& container : *containers) {
            const std::string& identifier = container->identifier();
            if (whitelist->containerIdIsWellknown(identifier, containerClass) || identifier == kPinnedSystemGroup)
                continue;
            uint64_t code = kVSLSuccess;
            auto identity = container->containerIdentity();
            if (!identity || !regenerateDirectoryUUIDWithContainerIdentity(identity, &code))
                LogWrite(kLogLevelError, fn, "Failed to regenerate directory UUID for identifier: %@, class: %llu",
                         identifier, static_cast<unsigned long long>(containerClass));
        }
    }
}

void VSLClientConnection::rebootVesselSetup() {
    constexpr const char* fn = "-[VSLClientConnection rebootVesselSetup]";
    if (auto status = VSLMigrationStatus::initForSystemMigration(); status && status->isBuildUpgrade()) {
        _regenerateAllSystemContainerPaths();
        VSLErrorRef error;
        if (!VSLContainerMigrator::sharedInstance()->performSynchronousBuildUpgradeMigration(*status, &error))
            LogWrite(kLogLevelError, fn, "Failed to perform build upgrade migration : %@", error);
        // Recorded whatever happened: a migration that fails every time must not run
        // at every boot.
        status->writeCurrentBuildInfoToDisk();
    }
    VSLMoveSystemContainersIntoPlace(shared_from_this());
    if (deviceFacts().multiUser) {
        // Queued with locking and drained here, after the reconciliation let go of the
        // global write lock.
        auto queue = VSLCommandQueue::create();
        VSLGroupManager::defaultManager()->reconcileGroupContainersOfType(kVSLGroupTypeApplication, queue, true);
        uint64_t code = kVSLSuccess;
        while (queue->executeNextCommandWithError(&code) || code != kVSLCommandQueueExhausted) code = kVSLSuccess;
    }
}

void VSLClientConnection::vesselSetup() {
    constexpr const char* fn = "-[VSLClientConnection vesselSetup]";
    VSLErrorRef replaceError;
    if (!_recoverFromReplaceOperationsWithError(&replaceError))
        LogWrite(kLogLevelError, fn, "Failed recovering from replace operations: %@", replaceError);
    VSLErrorRef protectionError;
    if (!VSLDataProtectionManager::defaultManager().restartPendingDataProtectionOperationsWithError(&protectionError))
        LogWrite(kLogLevelError, fn, "Failed restarting pending data protection operations: %@", protectionError);
}

}  // namespace vsl
