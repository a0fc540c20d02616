#include "Daemon/Service/VSLClientIdentity.h"

#include <mutex>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLEntitlements.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// The installer sends many messages in a row: its identity is kept per audit token.
std::mutex gInstallerMutex;
VSLClientIdentityRef gInstallerIdentity;

}  // namespace

VSLClientIdentityRef VSLClientIdentity::create(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                               VSLUserIdentityRef userIdentity, std::optional<Value> entitlements,
                                               bool sandboxed, const VSLAuditToken& auditToken, bool kernel) {
    auto c = std::shared_ptr<VSLClientIdentity>(new VSLClientIdentity());
    c->bundleIdentifier_ = std::move(bundleIdentifier);
    c->uid_ = uid;
    c->gid_ = gid;
    c->pid_ = pid;
    c->userIdentity_ = std::move(userIdentity);
    c->entitlements_ = std::move(entitlements);
    c->sandboxed_ = sandboxed;
    c->auditToken_ = auditToken;
    c->kernel_ = kernel;
    return c;
}

VSLClientIdentityRef VSLClientIdentity::clientIdentityWithIPCConnection(const VSLPeerCredentials& peer) {
    static const char* const fn = "+[VSLClientIdentity clientIdentityWithIPCConnection:]";
    auto userIdentity =
        VSLUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentContext(peer.uid, peer.gid);

    VSLCodeSigningFacts facts = codeSigningService()->factsForPeer(peer);
    bool isInstaller = facts.signingIdentifier && *facts.signingIdentifier == kVSLInstallerSigningIdentifier;
    if (isInstaller) {
        std::lock_guard<std::mutex> g(gInstallerMutex);
        if (gInstallerIdentity && gInstallerIdentity->auditToken() == peer.auditToken) return gInstallerIdentity;
    }

    std::optional<Value> entitlements = std::move(facts.entitlements);
    if (!entitlements || !entitlements->isDictionary()) {
        LogWrite(kLogLevelError, fn, "Missing or malformed entitlements for pid %d", peer.pid);
        entitlements = Value::dictionary({});
    }

    VSLClientIdentityRef identity;
    if (!facts.signingIdentifier) {
        LogWrite(kLogLevelError, fn, "Failed to copy signing ID for pid %d : %@", peer.pid, facts.error);
    } else if (userIdentity) {
        identity = create(*facts.signingIdentifier, peer.uid, peer.gid, peer.pid, userIdentity,
                          std::move(entitlements), facts.sandboxed, peer.auditToken, false);
    }
    if (isInstaller) {
        std::lock_guard<std::mutex> g(gInstallerMutex);
        gInstallerIdentity = identity;
    }
    osLog(LogCategory::Ipc, OSLogLevel::Info, "[%s] IPC client identity: %@", fn, identity);
    return identity;
}

VSLClientIdentityRef VSLClientIdentity::privilegedClientIdentityWithUserIdentity(VSLUserIdentityRef userIdentity,
                                                                                 bool kernel) {
    return create(kVSLInternalBundleIdentifier, 0, 0, 0, std::move(userIdentity), std::nullopt, false,
                  VSLAuditToken{}, kernel);
}

VSLClientIdentityRef VSLClientIdentity::anonymousPrivilegedClientIdentity() {
    return privilegedClientIdentityWithUserIdentity(VSLUserIdentityCache::defaultUserIdentity(), false);
}

const Value* VSLClientIdentity::entitlement(const std::string& key) const {
    return entitlements_ ? entitlements_->find(key) : nullptr;
}

bool VSLClientIdentity::boolValueOfEntitlement(const std::string& key) const {
    const Value* v = entitlement(key);
    if (!v) return false;
    if (auto b = v->boolValue()) return *b;
    if (auto n = v->doubleValue()) return *n != 0;
    if (auto n = v->unsignedNumber()) return *n != 0;
    return false;
}

uid_t VSLClientIdentity::posixUIDForContainerClass(VSLContainerClass c) const {
    return userIdentity_ ? userIdentity_->posixUIDForContainerClass(c) : uid_;
}

gid_t VSLClientIdentity::posixGIDForContainerClass(VSLContainerClass c) const {
    return userIdentity_ ? userIdentity_->posixGIDForContainerClass(c) : gid_;
}

std::string VSLClientIdentity::description() const {
    return formatLog(
        "<%@: %p; bundleIdentifier = %@, userIdentity = %@, posixUID = %u, posixGID = %u, posixPID = %u, "
        "isSandboxed = %d, entitlements = %@>",
        "VSLClientIdentity", static_cast<const void*>(this), bundleIdentifier_,
        userIdentity_ ? userIdentity_->shortDescription() : std::string("(null)"), uid_, gid_, pid_, sandboxed_,
        entitlements_ ? "YES" : "NO");
}

}  // namespace vsl
