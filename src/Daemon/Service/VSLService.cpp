#include "Daemon/Service/VSLService.h"

#include "Daemon/Service/VSLProcessIPCEvent.h"
#include "Platform/DurableIO.h"
#include "Platform/ServiceManager.h"

#ifdef VESSEL_KILLPOINTS
#include <cstdlib>
#include <thread>
#endif

namespace vsl {

namespace {

#ifdef VESSEL_KILLPOINTS
// Test builds: VESSELD_TEST_HANDLER_DELAY=<command>:<seconds> holds every message
// with that command number for that long before it is handled, as a handler stuck
// on a slow disk would.
void delayForTests(const Value& body) {
    struct Delay {
        uint64_t command = 0;
        unsigned seconds = 0;
    };
    static const Delay delay = [] {
        Delay d;
        const char* setting = std::getenv("VESSELD_TEST_HANDLER_DELAY");
        if (!setting) return d;
        char* end = nullptr;
        d.command = std::strtoull(setting, &end, 10);
        if (end && *end == ':') d.seconds = static_cast<unsigned>(std::strtoul(end + 1, nullptr, 10));
        return d;
    }();
    if (delay.seconds == 0) return;
    const Value* command = body.find("Command");
    const uint64_t number = command && command->uint64Value() ? *command->uint64Value() : 0;
    if (number == delay.command) std::this_thread::sleep_for(std::chrono::seconds(delay.seconds));
}
#endif

}  // namespace

std::unique_ptr<VSLService> VSLService::start(const std::shared_ptr<WorkQueue>& listenerQueue, std::string* error) {
    IpcServerOptions options;
    options.path = defaultIpcServicePath();
    options.listenFd = takeActivatedSocket("vesseld").release();
    options.connectionQueue = listenerQueue;
    options.maxConnectionsPerUid = kVSLConnectionsPerUser;
    options.maxConnectionsPrivileged = kVSLConnectionsPrivileged;
    options.idleConnectionTimeout = kVSLIdleConnectionTimeout;
    options.onConnection = [](std::shared_ptr<IpcPeer>) {};
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage message) {
#ifdef VESSEL_KILLPOINTS
        delayForTests(message.body);
#endif
        durable::beginScope(durable::Scope::ClientMessages);
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

bool VSLService::stop(std::chrono::milliseconds grace) { return server_ ? server_->stop(grace) : true; }

}  // namespace vsl
