// The per-user migration: run at every request of the data-migration service.
#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Concurrency/VSLDataProtectionManager.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Migration/VSLContainerMigrator.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Service/VSLClientIdentity.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// Containers of retired applications of our own, removed at every per-user migration.
struct VSLDeprecatedContainer {
    const char* identifier;
    VSLContainerClass containerClass;
};
constexpr VSLDeprecatedContainer kVSLDeprecatedContainers[] = {
    {"com.tarrow.Almanac", kVSLClassApplicationData},
    {"com.tarrow.Almanac.Glance", kVSLClassPluginData},
};

constexpr VSLContainerClass kSubdirectoryClasses[] = {
    kVSLClassApplicationData, kVSLClassPluginData, kVSLClassVPNPluginData, kVSLClassAppGroup,
    kVSLClassIPCService,      kVSLClassInternalDaemon, kVSLClassTempDir};

const char* const kPerUserFn = "-[VSLContainerMigrator performPerUserDataMigrationForClientConnection:withError:]";

}  // namespace

bool VSLContainerMigrator::subdirectoryMigration() {
    bool succeeded = true;
    const std::string build = VSLMigrationStatus::currentBuildVersion();
    userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        LogWrite(kLogLevelNotice, kPerUserFn, "Performing Per User Subdirectory Migration for %@ on %@", user, build);
        bool userSucceeded = true;
        auto connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(user);
        for (VSLContainerClass containerClass : kSubdirectoryClasses) {
            VSLErrorRef error;
            auto containers =
                VSLContainerCache::sharedInstance()->allContainersForUserIdentity(user, containerClass, false, &error);
            if (!containers) {
                LogWrite(kLogLevelError, kPerUserFn, "Failed to fetch list of containers for userIdentity: %@, class %ld : %@",
                         user, static_cast<long>(containerClass), error);
                userSucceeded = false;
                continue;
            }
            for (const auto& container : *containers) {
                uint64_t code = kVSLSuccess;
                if (connection->recreateDefaultStructureWithContainerIdentity(container->containerIdentity(), &code))
                    continue;
                LogWrite(kLogLevelError, kPerUserFn, "Failed to recreate container directory structure for %@:%ld:%@ : %llu",
                         user, static_cast<long>(containerClass), container->identifier(),
                         static_cast<unsigned long long>(code));
                userSucceeded = false;
            }
        }
        LogWrite(kLogLevelNotice, kPerUserFn, "Completed Per User Subdirectory Migration for %@ on %@ : Success: %c", user,
                 build, userSucceeded ? 'Y' : 'N');
        succeeded &= userSucceeded;
    });
    return succeeded;
}

VSLMetadataRef VSLContainerMigrator::_bundleContainerForDataContainer(const VSLMetadata& container,
                                                                      VSLErrorRef* error) {
    std::string identifier = container.identifier();
    if (container.containerClass() == kVSLClassPluginData) {
        auto mapping = VSLCodeSigningMapping::sharedInstance();
        auto parent = mapping ? mapping->parentIdentifierForChildIdentifier(identifier) : std::nullopt;
        if (!parent) {
            if (error)
                *error = VSL_ERROR(kVSLErrorNotFound, nullptr, false, "Parent Container for: \"%@\" Not Found",
                                   identifier);
            return nullptr;
        }
        identifier = *parent;
    } else if (container.containerClass() != kVSLClassApplicationData) {
        if (error)
            *error = VSL_ERROR(kVSLErrorUnexpectedClass, nullptr, false, "Passed an unexpected container type: %llu",
                               static_cast<unsigned long long>(container.containerClass()));
        return nullptr;
    }
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(container.containerIdentity()->userIdentity(),
                                                                            identifier, kVSLClassApplication, &code);
    if (!identity) {
        if (error) *error = VSL_ERROR(code, nullptr, false, "Could not create container identity from [%@]", identifier);
        return nullptr;
    }
    return VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, true, error);
}

void VSLContainerMigrator::_setDataProtectionIfNecessaryOnContainer(const VSLMetadata& container) {
    VSLErrorRef error;
    if (_bundleContainerForDataContainer(container, &error)) return;  // the installer sets its class
    if (!errorHasCode(error, kVSLErrorNotFound)) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Error looking up bundle container for %@ : %@", container.identifier(),
                 error);
        return;
    }
    auto& manager = VSLDataProtectionManager::defaultManager();
    const int32_t protectionClass = manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        container.identifier());
    auto identity = container.containerIdentity();
    manager.setDataProtectionOnDataContainerForContainerIdentity(
        identity, protectionClass, false, false, [protectionClass, identity](uint64_t result) {
            if (result == kVSLSuccess) return;
            LogWrite(kLogLevelError, "-[VSLContainerMigrator _setDataProtectionIfNecessaryOnContainer:]",
                     "Error setting protection class %d on %@:%llu (%@) : %llu", protectionClass,
                     identity->identifier(), static_cast<unsigned long long>(identity->containerClass()),
                     identity->userIdentity(), static_cast<unsigned long long>(result));
        });
}

bool VSLContainerMigrator::dataProtectionMigration() {
    bool succeeded = true;
    const std::string build = VSLMigrationStatus::currentBuildVersion();
    userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        LogWrite(kLogLevelNotice, kPerUserFn, "Performing User Data Protection Migration for %@ on %@", user, build);
        bool userSucceeded = true;
        for (VSLContainerClass containerClass : {kVSLClassApplicationData, kVSLClassPluginData}) {
            VSLErrorRef error;
            auto containers =
                VSLContainerCache::sharedInstance()->allContainersForUserIdentity(user, containerClass, false, &error);
            if (!containers) {
                LogWrite(kLogLevelError, kPerUserFn,
                         "Failed to fetch list of data containers for userIdentity: %@, class: %ld: %@", user,
                         static_cast<long>(containerClass), error);
                userSucceeded = false;
                continue;
            }
            for (const auto& container : *containers) _setDataProtectionIfNecessaryOnContainer(*container);
        }
        LogWrite(kLogLevelNotice, kPerUserFn, "Completed User Data Protection Migration for %@ on %@ : Success: %c", user,
                 build, userSucceeded ? 'Y' : 'N');
        succeeded &= userSucceeded;
    });
    return succeeded;
}

void VSLContainerMigrator::removeDeprecatedContainers(const VSLClientConnectionRef& connection) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    for (const auto& deprecated : kVSLDeprecatedContainers) {
        if (mapping) {
            auto queue = VSLCommandQueue::create();
            mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(deprecated.identifier, queue);
            uint64_t drained = kVSLSuccess;
            queue->executeAllUntilExhaustedOrError(&drained);
        }
        const auto& client = connection->clientIdentity();
        auto user = userIdentityCache_->userIdentityForPersonalPersona(client->posixUID(), client->posixGID());
        uint64_t code = kVSLSuccess;
        auto identity = user ? VSLContainerIdentity::containerIdentityWithUserIdentity(user, deprecated.identifier,
                                                                                      deprecated.containerClass, &code)
                             : nullptr;
        if (!identity) {
            LogWrite(kLogLevelError, VSL_FUNCTION,
                     "Could not create container identity when trying to remove deprecated [%llu:%@]",
                     static_cast<unsigned long long>(deprecated.containerClass), deprecated.identifier);
            continue;
        }
        // The daemon removes them itself, the requester need not be entitled to them,
        // and stages them at once: no lock is held here.
        code = kVSLSuccess;
        auto privileged = VSLClientConnection::privilegedClientConnectionWithUserIdentity(user);
        if (privileged->deleteContainerWithContainerIdentity(identity, false, &code) && privileged->commandQueue())
            privileged->commandQueue()->executeAllUntilExhaustedOrError(&code);
        if (code != kVSLSuccess && code != kVSLErrorNotFound)
            LogWrite(kLogLevelError, VSL_FUNCTION, "Could not delete deprecated container [%llu:%@]: %llu",
                     static_cast<unsigned long long>(deprecated.containerClass), deprecated.identifier,
                     static_cast<unsigned long long>(code));
    }
}

bool VSLContainerMigrator::performPerUserDataMigrationForClientConnection(const VSLClientConnectionRef& connection,
                                                                          VSLErrorRef* error) {
    return guardExceptions(VSL_FUNCTION, __LINE__, error, [&] {
        LogWrite(kLogLevelNotice, kPerUserFn, "Container data migration requested by %@ for current mobile user: %u",
                 connection->clientBundleIdentifier(), VSLGlobalConfiguration::sharedInstance()->currentMobileUserId());
        auto status = VSLMigrationStatus::initForMobileUserMigration();
        if (!status) {
            if (error)
                *error = createVSLError(kPerUserFn, __LINE__, kVSLErrorReadFile, nullptr, false,
                                        "Error reading user migration file from disk.  This is bad");
            return false;
        }
        bool subdirectories = true;
        if (!status->hasMigrationOccurredForType(kVSLMigrationSubdirectory)) {
            subdirectories = subdirectoryMigration();
            if (subdirectories) status->setMigrationCompleteForType(kVSLMigrationSubdirectory);
        }
        const bool protection = dataProtectionMigration();
        removeDeprecatedContainers(connection);
        if (subdirectories && protection) return true;
        if (error)
            *error = createVSLError(kPerUserFn, __LINE__, kVSLErrorCreateSubdirectory, nullptr, false,
                                    "Per-user migration did not complete");
        return false;
    });
}

}  // namespace vsl
