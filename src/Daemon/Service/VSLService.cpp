#include "Daemon/Service/VSLService.h"

#include "Daemon/Service/VSLProcessIPCEvent.h"

namespace vsl {

std::unique_ptr<VSLService> VSLService::start(const std::shared_ptr<WorkQueue>& listenerQueue, std::string* error) {
    IpcServerOptions options;
    options.path = defaultIpcServicePath();
    options.connectionQueue = listenerQueue;
    options.onConnection = [](std::shared_ptr<IpcPeer>) {};
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage message) {
        VSLPeerCredentials credentials;
        credentials.pid = peer->pid();
        credentials.uid = peer->uid();
        credentials.gid = peer->gid();
        credentials.auditToken = peer->auditToken().words;
        credentials.executablePath = peer->executablePath();
        std::weak_ptr<IpcPeer> weak = peer;
        uint64_t id = message.id;
        VSLProcessIPCEvent(
            credentials, message.body,
            [weak, id](const Value& body) {
                if (auto p = weak.lock()) p->sendReply(id, body);
            },
            [weak] {
                if (auto p = weak.lock()) p->cancel();
            });
    };
    auto server = IpcServer::start(std::move(options), error);
    if (!server) return nullptr;
    auto service = std::unique_ptr<VSLService>(new VSLService());
    service->server_ = std::move(server);
    return service;
}

void VSLService::stop() {
    if (server_) server_->stop();
}

}  // namespace vsl
