// Who a peer process is, as the code-signing layer vouches for it: its signing
// identifier, entitlements and sandbox state. The daemon installs the policy-store
// implementation at start; tests may install their own.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl {

using VSLAuditToken = std::array<uint32_t, 8>;

// What the transport knows of a peer.
struct VSLPeerCredentials {
    pid_t pid = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    VSLAuditToken auditToken{};
    std::string executablePath;  // real path when it connected; empty when unknown
};

struct VSLCodeSigningFacts {
    std::optional<std::string> signingIdentifier;  // none: no signing identity
    std::optional<Value> entitlements;             // a dictionary, or none when unreadable
    bool sandboxed = false;
    std::string error;  // why there is no signing identifier
};

class VSLCodeSigningService {
public:
    virtual ~VSLCodeSigningService() = default;
    virtual VSLCodeSigningFacts factsForPeer(const VSLPeerCredentials& peer) = 0;
};

// The policy store under the system root.
std::shared_ptr<VSLCodeSigningService> makePolicyStoreCodeSigningService();

void setCodeSigningService(std::shared_ptr<VSLCodeSigningService> service);
// The installed service, or the policy store's when none was installed.
std::shared_ptr<VSLCodeSigningService> codeSigningService();

}  // namespace vsl
