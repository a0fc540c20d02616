#include "Daemon/Service/VSLCodeSigningService.h"

#include <mutex>

#include "Platform/AuditToken.h"
#include "Platform/CodeSigningPolicy.h"

namespace vsl {

namespace {

class PolicyStoreService : public VSLCodeSigningService {
public:
    VSLCodeSigningFacts factsForPeer(const VSLPeerCredentials& peer) override {
        auto& policy = CodeSigningPolicy::shared();
        CodeSigningInfo info;
        if (!peer.executablePath.empty()) {
            info = policy.infoForExecutable(peer.executablePath);
        } else {
            AuditToken token;
            token.words = peer.auditToken;
            info = policy.infoForAuditToken(token);
        }
        VSLCodeSigningFacts facts;
        facts.signingIdentifier = info.signingIdentifier;
        facts.entitlements = Value::dictionary(std::move(info.entitlements));
        facts.sandboxed = info.sandboxed;
        facts.error = info.error;
        return facts;
    }
};

std::mutex gMutex;
std::shared_ptr<VSLCodeSigningService> gService;

}  // namespace

std::shared_ptr<VSLCodeSigningService> makePolicyStoreCodeSigningService() {
    return std::make_shared<PolicyStoreService>();
}

void setCodeSigningService(std::shared_ptr<VSLCodeSigningService> service) {
    std::lock_guard<std::mutex> g(gMutex);
    gService = std::move(service);
}

std::shared_ptr<VSLCodeSigningService> codeSigningService() {
    std::lock_guard<std::mutex> g(gMutex);
    if (!gService) gService = makePolicyStoreCodeSigningService();
    return gService;
}

}  // namespace vsl
