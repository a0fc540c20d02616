// Who is calling: a peer process, the kernel, or the daemon itself. Immutable.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLUserIdentity.h"
#include "Daemon/Service/VSLCodeSigningService.h"
#include "Platform/Value.h"

namespace vsl {

class VSLClientIdentity;
using VSLClientIdentityRef = std::shared_ptr<const VSLClientIdentity>;

class VSLClientIdentity {
public:
    static VSLClientIdentityRef create(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                       VSLUserIdentityRef userIdentity, std::optional<Value> entitlements,
                                       bool sandboxed, const VSLAuditToken& auditToken, bool kernel);

    // The identity of a message's sender, or none (no signing identifier, no user).
    static VSLClientIdentityRef clientIdentityWithIPCConnection(const VSLPeerCredentials& peer);
    static VSLClientIdentityRef privilegedClientIdentityWithUserIdentity(VSLUserIdentityRef userIdentity,
                                                                         bool kernel);
    static VSLClientIdentityRef anonymousPrivilegedClientIdentity();

    bool sandboxed() const { return sandboxed_; }
    bool kernel() const { return kernel_; }
    pid_t posixPID() const { return pid_; }
    uid_t posixUID() const { return uid_; }
    gid_t posixGID() const { return gid_; }
    const std::string& bundleIdentifier() const { return bundleIdentifier_; }
    const std::optional<Value>& entitlements() const { return entitlements_; }
    const VSLUserIdentityRef& userIdentity() const { return userIdentity_; }
    const VSLAuditToken& auditToken() const { return auditToken_; }

    // Only a number counts, by its truth value; anything else or absent is false.
    bool boolValueOfEntitlement(const std::string& key) const;
    const Value* entitlement(const std::string& key) const;

    uid_t posixUIDForContainerClass(VSLContainerClass c) const;
    gid_t posixGIDForContainerClass(VSLContainerClass c) const;

    std::string description() const;

private:
    VSLClientIdentity() = default;
    bool sandboxed_ = false;
    bool kernel_ = false;
    pid_t pid_ = 0;
    uid_t uid_ = 0;
    gid_t gid_ = 0;
    std::string bundleIdentifier_;
    std::optional<Value> entitlements_;
    VSLUserIdentityRef userIdentity_;
    VSLAuditToken auditToken_{};
};

}  // namespace vsl
