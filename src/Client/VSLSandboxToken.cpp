#include "Client/VSLSandboxToken.h"

namespace vsl::client {

bool verifySandboxToken(const std::string& token, const std::string& extensionClass, const std::string& path,
                        const SandboxAuditToken& processAuditToken, const std::string& systemRoot) {
    std::string root = systemRoot;
    while (root.size() > 1 && root.back() == '/') root.pop_back();
    std::string keyPath = (root == "/" ? std::string() : root) + "/run/vesseld/sandbox-extension.key";
    return verifySandboxFileExtension(token, extensionClass, path, processAuditToken, keyPath);
}

}  // namespace vsl::client
