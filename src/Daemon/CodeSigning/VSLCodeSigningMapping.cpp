#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"

#include "Daemon/Core/VSLErrorCodes.h"

namespace vsl {

std::shared_ptr<VSLCodeSigningMapping> VSLCodeSigningMapping::sharedInstance() {
    static const auto instance = std::make_shared<VSLCodeSigningMapping>();
    return instance;
}

uint64_t VSLCodeSigningMapping::processCallerRegisteredEntitlements(const std::optional<Value>&,
                                                                    const std::string& identifier,
                                                                    const std::shared_ptr<VSLCommandQueue>&) {
    return identifier.empty() ? uint64_t(kVSLErrorMissingIdentifier) : uint64_t(kVSLSuccess);
}

std::optional<std::string> VSLCodeSigningMapping::parentIdentifierForChildIdentifier(const std::string&) {
    return std::nullopt;
}

}  // namespace vsl
