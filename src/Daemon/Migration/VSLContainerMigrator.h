// The one-time and per-request migrations that bring data laid down by older builds
// into today's layout.
#pragma once

#include <memory>

#include "Daemon/Core/VSLError.h"
#include "Daemon/Service/VSLClientConnection.h"

namespace vsl {

class VSLUserIdentityCache;
class VSLMigrationStatus;

class VSLContainerMigrator {
public:
    static const std::shared_ptr<VSLContainerMigrator>& sharedInstance();
    explicit VSLContainerMigrator(std::shared_ptr<VSLUserIdentityCache> userIdentityCache);

    // ACLs of system containers, ownership of bundle containers, then the code-signing
    // imports and group reconciliation; stagings go on the connection's command queue,
    // which the front end drains after the handler.
    bool performDataMigratorMigrationForClientConnection(const VSLClientConnectionRef& connection,
                                                         VSLErrorRef* error);

    // Skeleton directories of every user's containers (once), the protection class of
    // data containers whose application has no bundle container, and the removal of
    // retired containers.
    bool performPerUserDataMigrationForClientConnection(const VSLClientConnectionRef& connection, VSLErrorRef* error);

    // The first boot of a new build (VSLContainerMigratorBuildUpgrade.cpp): old log
    // files join the current rotation (not on a multi-user device), bundles move from
    // the legacy location, a device without system containers records the ACL
    // migration as done, and well-known system containers move to their fixed names.
    bool performSynchronousBuildUpgradeMigration(VSLMigrationStatus& status, VSLErrorRef* error);
    void _checkIfDeviceMayNeedSystemContainerACLMigration(VSLMigrationStatus& status);
    bool _performWhitelistMigrationWithError(VSLErrorRef* error);

    // Class 2: the application's bundle container; class 4: its parent's.
    VSLMetadataRef _bundleContainerForDataContainer(const VSLMetadata& container, VSLErrorRef* error);
    void _setDataProtectionIfNecessaryOnContainer(const VSLMetadata& container);

    bool _performInternalACLMigrationWithError(VSLMigrationStatus& status, VSLErrorRef* error);
    bool _performBundleContainerOwnershipMigrationWithError(VSLMigrationStatus& status, VSLErrorRef* error);

private:
    bool subdirectoryMigration();
    bool dataProtectionMigration();
    void removeDeprecatedContainers(const VSLClientConnectionRef& connection);

    std::shared_ptr<VSLUserIdentityCache> userIdentityCache_;
};

}  // namespace vsl
