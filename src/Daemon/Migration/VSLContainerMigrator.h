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

    bool _performInternalACLMigrationWithError(VSLMigrationStatus& status, VSLErrorRef* error);
    bool _performBundleContainerOwnershipMigrationWithError(VSLMigrationStatus& status, VSLErrorRef* error);

private:
    std::shared_ptr<VSLUserIdentityCache> userIdentityCache_;
};

}  // namespace vsl
