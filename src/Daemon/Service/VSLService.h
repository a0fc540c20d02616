// The service "com.tarrow.vesseld": the IPC listener wired to the dispatcher.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

#include "Platform/IpcServer.h"
#include "Platform/WorkQueue.h"

namespace vsl {

// Connections one uid may hold open at once (docs/operations.md). Root and the
// daemon's own uid run the system's services and installers, hence their larger share.
constexpr size_t kVSLConnectionsPerUser = 128;
constexpr size_t kVSLConnectionsPrivileged = 1024;
// A connection unused for this long, with nothing owed either way, is closed.
constexpr std::chrono::minutes kVSLIdleConnectionTimeout{10};

class VSLService {
public:
    // Listens on the socket under the system root; new connections are taken on
    // `listenerQueue`, so none is accepted before work queued there ahead of it ends.
    static std::unique_ptr<VSLService> start(const std::shared_ptr<WorkQueue>& listenerQueue, std::string* error);
    // Stops serving; waits at most `grace` for handlers still running. False when
    // some were: the process must then exit without tearing down what they use.
    bool stop(std::chrono::milliseconds grace);

private:
    std::unique_ptr<IpcServer> server_;
};

}  // namespace vsl
