// Private to IpcServer: the epoll set, the I/O threads that wait on it and the
// table of live peers. Events carry a peer's serial number, not a pointer, so an
// event for a peer that closed meanwhile finds nothing.
#pragma once

#include <sys/stat.h>

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "Platform/IpcServer.h"

namespace vsl {

class IpcEventLoop : public std::enable_shared_from_this<IpcEventLoop> {
public:
    IpcEventLoop(IpcServerOptions options, int listenFd);
    ~IpcEventLoop();  // closes the epoll set and the listener
    IpcEventLoop(const IpcEventLoop&) = delete;
    IpcEventLoop& operator=(const IpcEventLoop&) = delete;

    bool start(std::string* error);
    void stop();

    const IpcServerOptions& options() const { return options_; }
    int epollFd() const { return epollFd_; }
    void forget(uint64_t serial);
    // Called by an I/O thread just before it rearms what it served: it counts as
    // idle from then on, so the event the rearm may fire at once does not make
    // another thread think everybody is busy.
    void willBeIdle();
    size_t peerCount() const;
    size_t threadCount() const;

private:
    void threadMain();
    void spawnThreadLocked();
    void acceptAll();
    void admit(int fd);

    const IpcServerOptions options_;
    int listenFd_;  // closed by stop() once no thread can use it
    int epollFd_ = -1;
    int wakeFd_ = -1;

    mutable std::mutex mutex_;
    std::condition_variable threadExited_;
    std::unordered_map<uint64_t, std::shared_ptr<IpcPeer>> peers_;
    uint64_t nextSerial_ = 2;  // 0 is the listener, 1 the stop signal
    size_t threads_ = 0;
    size_t idle_ = 0;  // threads waiting for an event, or about to
    bool stopping_ = false;
};

}  // namespace vsl
