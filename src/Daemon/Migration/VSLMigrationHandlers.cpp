#include "Daemon/Migration/VSLMigrationHandlers.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Migration/VSLContainerMigrator.h"
#include "Platform/Log.h"

namespace vsl {

void handlePerformDataMigration(const Value&, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                uint64_t* code) {
    VSLErrorRef error;
    if (VSLContainerMigrator::sharedInstance()->performDataMigratorMigrationForClientConnection(connection, &error))
        return;
    LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to perform data migration : %@", error);
    *code = codeForError(error, kVSLErrorException);
}

void handlePerformPerUserDataMigration(const Value&, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                       uint64_t* code) {
    VSLErrorRef error;
    if (VSLContainerMigrator::sharedInstance()->performPerUserDataMigrationForClientConnection(connection, &error))
        return;
    LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to perform per-user data migration : %@", error);
    *code = codeForError(error, kVSLErrorException);
}

}  // namespace vsl
