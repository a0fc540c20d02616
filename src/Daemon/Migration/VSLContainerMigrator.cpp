#include "Daemon/Migration/VSLContainerMigrator.h"

#include <sys/stat.h>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

bool isDirectory(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

VSLErrorRef unreadableStatusError(const char* function, int line) {
    return createVSLError(function, line, kVSLErrorReadFile, nullptr, false,
                          "Error reading system migration file from disk.  This is bad");
}

}  // namespace

const std::shared_ptr<VSLContainerMigrator>& VSLContainerMigrator::sharedInstance() {
    static const std::shared_ptr<VSLContainerMigrator> instance =
        std::make_shared<VSLContainerMigrator>(VSLUserIdentitySharedCache::sharedInstance());
    return instance;
}

VSLContainerMigrator::VSLContainerMigrator(std::shared_ptr<VSLUserIdentityCache> userIdentityCache)
    : userIdentityCache_(std::move(userIdentityCache)) {}

bool VSLContainerMigrator::_performInternalACLMigrationWithError(VSLMigrationStatus& status, VSLErrorRef* error) {
    if (status.hasMigrationOccurredForType(kVSLMigrationACL)) return true;
    auto& configuration = *VSLGlobalConfiguration::sharedInstance();
    bool succeeded = true;
    struct Pass {
        VSLContainerClass containerClass;
        const char* failure;
    };
    for (const Pass& pass : {Pass{kVSLClassSystemData, "Failed to set ACLs on system containers : %@"},
                             Pass{kVSLClassSystemGroup, "Failed to set ACLs on system group containers : %@"}}) {
        auto directory = configuration.globalContainerBaseURLWithContentClass(pass.containerClass, false);
        if (!directory || !isDirectory(*directory)) continue;  // nothing there to fix
        VSLErrorRef passError;
        if (VSLFileManager::defaultManager().standardizeAllSystemContainerACLsAtURL(*directory, &passError)) continue;
        LogWrite(kLogLevelError, VSL_FUNCTION, pass.failure, passError);
        if (succeeded && error) *error = passError;
        succeeded = false;
    }
    if (succeeded) status.setMigrationCompleteForType(kVSLMigrationACL);
    return succeeded;
}

bool VSLContainerMigrator::_performBundleContainerOwnershipMigrationWithError(VSLMigrationStatus& status,
                                                                             VSLErrorRef* error) {
    if (status.hasMigrationOccurredForType(kVSLMigrationBundle)) return true;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Changing ownership of bundle container content.");
    const std::string bundles = VSLGlobalConfiguration::sharedInstance()->bundleDirectory();
    const uid_t installer = deviceFacts().installerUID;
    VSLErrorRef ownerError;
    if (!VSLFileManager::defaultManager().standardizeOwnershipAtURL(bundles, installer, installer, &ownerError)) {
        if (error)
            *error = VSL_ERROR(kVSLErrorChangeOwner, ownerError, true, "Failed to change owner of %@: %@", bundles,
                               ownerError);
        return false;
    }
    status.setMigrationCompleteForType(kVSLMigrationBundle);
    return true;
}

bool VSLContainerMigrator::performDataMigratorMigrationForClientConnection(const VSLClientConnectionRef& connection,
                                                                           VSLErrorRef* error) {
    return guardExceptions(VSL_FUNCTION, __LINE__, error, [&] {
        LogWrite(kLogLevelNotice, "-[VSLContainerMigrator performDataMigratorMigrationForClientConnection:withError:]",
                 "Performing Data Migration on %@", VSLMigrationStatus::currentBuildVersion());
        auto status = VSLMigrationStatus::initForSystemMigration();
        if (!status) {
            if (error) *error = unreadableStatusError("-[VSLContainerMigrator performDataMigratorMigration]", __LINE__);
            return false;
        }
        bool result = true;
        VSLErrorRef stepError;
        if (!_performInternalACLMigrationWithError(*status, &stepError)) {
            LogWrite(kLogLevelError, "-[VSLContainerMigrator performDataMigratorMigration]",
                     "Failed to migrate ACLs on system containers : %@", stepError);
            if (error) *error = stepError;
            result = false;
        }
        stepError.reset();
        if (!_performBundleContainerOwnershipMigrationWithError(*status, &stepError)) {
            LogWrite(kLogLevelError, "-[VSLContainerMigrator performDataMigratorMigration]",
                     "Failed to migrate bundle containers to system location : %@", stepError);
            if (error && result) *error = stepError;
            result = false;
        }
        if (auto mapping = VSLCodeSigningMapping::sharedInstance())
            mapping->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(connection->commandQueue());
        return result;
    });
}

}  // namespace vsl
