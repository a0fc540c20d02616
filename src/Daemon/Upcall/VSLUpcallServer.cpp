#include "Daemon/Upcall/VSLUpcallServer.h"

#include <memory>
#include <mutex>

#include "Daemon/Upcall/VSLUpcallDemux.h"
#include "Platform/IpcServer.h"
#include "Platform/Log.h"
#include "Platform/ServiceManager.h"
#include "Platform/UpcallWire.h"
#include "Platform/WorkQueue.h"

#ifdef VESSEL_KILLPOINTS
#include <cstdlib>
#include <thread>
#endif

namespace vsl {

namespace {

// Only the kernel stand-in may connect (mode 0600); it keeps few connections open.
constexpr size_t kUpcallConnections = 256;

struct UpcallServer {
    std::shared_ptr<WorkQueue> queue = WorkQueue::serial("com.tarrow.vesseld.upcall", QueuePriority::UserInitiated);
    std::shared_ptr<WorkGroup> requests = WorkGroup::create();
    std::unique_ptr<IpcServer> server;
};

std::mutex gMutex;
std::shared_ptr<UpcallServer> gServer;

#ifdef VESSEL_KILLPOINTS
// Test builds: VESSELD_TEST_UPCALL_DELAY_MS holds every request that long, as a slow
// disk would, so that tests can watch requests queue up.
void delayForTests() {
    static const long delay = [] {
        const char* setting = std::getenv("VESSELD_TEST_UPCALL_DELAY_MS");
        return setting ? std::strtol(setting, nullptr, 10) : 0L;
    }();
    if (delay > 0) std::this_thread::sleep_for(std::chrono::milliseconds(delay));
}
#endif

void handle(const std::weak_ptr<IpcPeer>& weak, const AuditToken& token, const IpcMessage& message) {
    auto peer = weak.lock();
    if (!peer || peer->isCancelled()) return;
#ifdef VESSEL_KILLPOINTS
    delayForTests();
#endif
    const Data* bytes = message.body.dataValue();
    VSLUpcallMessage request;
    request.id = static_cast<uint32_t>(message.id);
    request.auditToken = token.words;
    request.bytes = bytes ? bytes->data() : nullptr;
    request.size = bytes ? bytes->size() : 0;
    VSLUpcallReply reply;
    demux_server(request, &reply);
    if (reply.prepared) {
        peer->sendReply(message.id, upcallReplyBody(reply.returnCode, reply.bytes));
    } else {
        peer->noReply(message.id);
    }
}

}  // namespace

bool startKernelUpcallServer(std::string* error) {
    std::lock_guard lock(gMutex);
    if (gServer) return true;
    auto state = std::make_shared<UpcallServer>();
    IpcServerOptions options;
    options.path = defaultUpcallServicePath();
    options.listenFd = takeActivatedSocket("upcall").release();
    options.framing = upcallServerFraming();
    options.socketMode = 0600;
    options.maxConnectionsPerUid = kUpcallConnections;
    options.maxConnectionsPrivileged = kUpcallConnections;
    std::weak_ptr<UpcallServer> weakState = state;
    options.onMessage = [weakState](std::shared_ptr<IpcPeer> peer, IpcMessage message) {
        auto state = weakState.lock();
        if (!state) return;
        std::weak_ptr<IpcPeer> weak = peer;
        AuditToken token = upcallSenderToken(peer->auditToken(), peer->uid());
        state->requests->async(state->queue, [weak, token, message = std::move(message)] {
            handle(weak, token, message);
        });
    };
    state->server = IpcServer::start(std::move(options), error);
    if (!state->server) return false;
    gServer = std::move(state);
    return true;
}

bool stopKernelUpcallServer(std::chrono::milliseconds grace) {
    std::shared_ptr<UpcallServer> state;
    {
        std::lock_guard lock(gMutex);
        state = gServer;
    }
    if (!state) return true;
    const auto deadline = std::chrono::steady_clock::now() + grace;
    bool done = state->server->stop(grace);
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    done = state->requests->wait(std::max(left, std::chrono::milliseconds(0))) && done;
    return done;
}

}  // namespace vsl
