// Checking a "ReplySandboxToken": it opens exactly one path, of one extension
// class, to one process.
#pragma once

#include <string>

#include "Platform/SandboxExtension.h"

namespace vsl::client {

// keyPath defaults to the key below the given system root.
bool verifySandboxToken(const std::string& token, const std::string& extensionClass, const std::string& path,
                        const SandboxAuditToken& processAuditToken, const std::string& systemRoot);

}  // namespace vsl::client
