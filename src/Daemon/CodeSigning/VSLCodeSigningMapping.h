// Code-signing information of installed identifiers and what derives from it.
// This build keeps no code-signing database yet: nothing is registered, no
// identifier has a parent, and caller registrations are accepted and dropped.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Platform/Value.h"

namespace vsl {

class VSLCodeSigningMapping {
public:
    static std::shared_ptr<VSLCodeSigningMapping> sharedInstance();

    // Registration of a running client's own entitlements; returns a result code.
    uint64_t processCallerRegisteredEntitlements(const std::optional<Value>& entitlements,
                                                 const std::string& identifier,
                                                 const std::shared_ptr<VSLCommandQueue>& commandQueue);
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
};

}  // namespace vsl
