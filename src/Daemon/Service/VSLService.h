// The service "com.tarrow.vesseld": the IPC listener wired to the dispatcher.
#pragma once

#include <memory>
#include <string>

#include "Platform/IpcServer.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class VSLService {
public:
    // Listens on the socket under the system root; new connections are taken on
    // `listenerQueue`, so none is accepted before work queued there ahead of it ends.
    static std::unique_ptr<VSLService> start(const std::shared_ptr<WorkQueue>& listenerQueue, std::string* error);
    void stop();

private:
    std::unique_ptr<IpcServer> server_;
};

}  // namespace vsl
