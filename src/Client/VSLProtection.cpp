#include "Client/VSLProtection.h"

#include <sys/stat.h>

#include "Client/VSLProtocol.h"
#include "Platform/Lifecycle.h"
#include "Platform/SystemRoot.h"

namespace vsl::client {

Value setDataProtectionRequest(const VSLProtectionChange& change) {
    return Value::dictionary({{"Command", Value::uint64(*commandNumberForName("setDataProtection"))},
                              {"Identifier", Value::string(change.identifier)},
                              {"ContainerClass", Value::uint64(change.containerClass)},
                              {"DataProtectionClass", Value::int64(change.dataProtectionClass)},
                              {"IsThirdParty", Value::boolean(change.isThirdParty)},
                              {"RetryIfLocked", Value::boolean(change.retryIfLocked)}});
}

uint64_t setDataProtection(VSLConnection& connection, const VSLProtectionChange& change, std::string* error,
                           std::optional<std::chrono::milliseconds> timeout) {
    return resultCode(connection.sendRequest(setDataProtectionRequest(change), timeout), error);
}

bool isLaunchBlocked(const std::string& root, const std::string& identifier) {
    auto name = launchBlockMarkerName(identifier);
    if (!name) return false;
    std::string path = joinPath(joinPath(root.empty() ? "/" : root, "run/vesseld/launch-block"), *name);
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

}  // namespace vsl::client
