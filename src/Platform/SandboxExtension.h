// Sandbox extension tokens: what lets a sandboxed process open one path. A token is
// an HMAC-SHA256 over the extension class, the path and the process's audit token,
// keyed by a per-boot secret in run/vesseld/ under the system root, printed as one
// opaque string. Only a holder of the key can make one; anyone with the key can
// check one.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>

namespace vsl {

using SandboxAuditToken = std::array<uint32_t, 8>;

// The key file: run/vesseld/sandbox-extension.key under the system root.
std::string sandboxExtensionKeyPath();

// Issues a token; none with errno set when the key cannot be made or read.
std::optional<std::string> issueSandboxFileExtension(const std::string& extensionClass, const std::string& path,
                                                     const SandboxAuditToken& token);

// True when `token` was issued with `keyPath`'s key for exactly this class, path
// and process.
bool verifySandboxFileExtension(const std::string& token, const std::string& extensionClass,
                                const std::string& path, const SandboxAuditToken& auditToken,
                                const std::string& keyPath);

}  // namespace vsl
