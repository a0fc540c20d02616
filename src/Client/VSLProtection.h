// libvessel: protection-class changes of data containers, and the launch-block check
// for launchers (an application held terminated while its container is changed).
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "Client/VSLConnection.h"

namespace vsl::client {

struct VSLProtectionChange {
    std::string identifier;
    uint64_t containerClass = 2;
    int64_t dataProtectionClass = 0;
    bool isThirdParty = false;
    bool retryIfLocked = false;
};

Value setDataProtectionRequest(const VSLProtectionChange& change);

// The daemon's result code, sent once the change is done (1) or has failed; 0 with
// `error` set when no reply came. With retryIfLocked on a locked device the reply
// comes after the next unlock.
uint64_t setDataProtection(VSLConnection& connection, const VSLProtectionChange& change, std::string* error = nullptr,
                           std::optional<std::chrono::milliseconds> timeout = std::nullopt);

// Whether the application must not be launched now (the daemon holds it terminated).
// `root` is the system root ("/" in production).
bool isLaunchBlocked(const std::string& root, const std::string& identifier);

}  // namespace vsl::client
