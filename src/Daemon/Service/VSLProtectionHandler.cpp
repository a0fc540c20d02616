#include "Daemon/Service/VSLProtectionHandler.h"

#include "Daemon/Concurrency/VSLDataProtectionManager.h"
#include "Daemon/Service/VSLRequestDecoding.h"

namespace vsl {

void handleSetDataProtection(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                             uint64_t* code) {
    auto identity = identityFromRequest(request, "Identifier", nullptr, *connection, code);
    if (!identity) return;
    const Value* cls = request.find("DataProtectionClass");
    auto dataProtectionClass = static_cast<int32_t>(cls && cls->int64Value() ? *cls->int64Value() : 0);
    VSLDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForContainerIdentity(
        identity, dataProtectionClass, boolFromRequest(request, "IsThirdParty").value_or(false),
        boolFromRequest(request, "RetryIfLocked").value_or(false),
        [reply](uint64_t result) { reply->sendWithCode(result); });
}

}  // namespace vsl
