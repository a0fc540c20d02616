#include "Daemon/Service/VSLCodeSigningService.h"

#include <mutex>

#include "Platform/CodeSigningPolicy.h"

namespace vsl {

namespace {

class PolicyStoreService : public VSLCodeSigningService {
public:
    VSLCodeSigningFacts factsForPeer(const VSLPeerCredentials& peer) override {
        VSLCodeSigningFacts facts;
        // Only the executable seen at connect counts: reading it now would let a
        // process that exec'd since lend the new image's rights to the old connection.
        if (peer.executablePath.empty()) {
            facts.error = "executable of the peer unknown";
            return facts;
        }
        CodeSigningInfo info = CodeSigningPolicy::shared().infoForExecutable(peer.executablePath);
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
