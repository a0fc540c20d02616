#include "Daemon/Service/VSLReplaceHandler.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLRequestDecoding.h"

namespace vsl {

void handleReplaceContainer(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                            uint64_t* code) {
    uint64_t oldCode = kVSLSuccess;
    VSLContainerIdentityRef oldIdentity =
        concreteIdentityFromRequest(request, "OldIdentifier", "OldContainerClass", "OldContainerUUID",
                                    "OldPersonaUniqueString", *connection, &oldCode);
    if (!oldIdentity && oldCode != kVSLErrorMissingIdentifier) {
        *code = oldCode;
        return;
    }
    uint64_t newCode = kVSLSuccess;
    VSLContainerIdentityRef newIdentity =
        concreteIdentityFromRequest(request, "NewIdentifier", "NewContainerClass", "NewContainerUUID",
                                    "NewPersonaUniqueString", *connection, &newCode);
    if (!newIdentity) {
        *code = newCode;
        return;
    }
    connection->replaceContainerIdentity(oldIdentity, newIdentity, false, false, code);
}

}  // namespace vsl
