// Private to IpcServer: the epoll set, the I/O threads that wait on it, the table
// of live peers and the connection limits. Events carry a peer's serial number, not
// a pointer, so an event for a peer that closed meanwhile finds nothing.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
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
    // False when the deadline passed with handlers or queued peer work still running.
    bool stop(std::optional<std::chrono::steady_clock::time_point> deadline);

    const IpcServerOptions& options() const { return options_; }
    int epollFd() const { return epollFd_; }
    // A peer has closed: queues its disconnect handler, then drops it from the table.
    void closed(const std::shared_ptr<IpcPeer>& peer);
    // Called by an I/O thread just before it rearms what it served: it counts as
    // idle from then on, so the event the rearm may fire at once does not make
    // another thread think everybody is busy.
    void willBeIdle();
    size_t peerCount() const;
    size_t threadCount() const;
    size_t connectionLimit() const { return maxConnections_; }

private:
    struct UidConnections {
        size_t open = 0;
        std::chrono::steady_clock::time_point lastRefusalLog{};
        size_t refusedSinceLog = 0;
    };

    void threadMain();
    // False at the thread cap or when no thread can be started.
    bool spawnThreadLocked();
    void acceptAll();
    void admit(int fd);
    // Counts a new connection of uid against the limits; the refusal text when over one.
    std::optional<std::string> reserveLocked(uid_t uid);
    void releaseLocked(uid_t uid);
    void closeIdlePeers();

    const IpcServerOptions options_;
    int listenFd_;  // closed by stop() once no thread can use it
    int epollFd_ = -1;
    int wakeFd_ = -1;
    int timerFd_ = -1;  // idle-connection sweeps, when a timeout is set
    const uid_t ownUid_;
    size_t maxConnections_ = 0;

    mutable std::mutex mutex_;
    std::condition_variable threadExited_;
    // Disconnect handlers queued and not yet run, which a stop waits for: a peer that
    // left the table just before the stop looked is no longer among those it drains.
    const std::shared_ptr<WorkGroup> disconnects_ = WorkGroup::create();
    std::unordered_map<uint64_t, std::shared_ptr<IpcPeer>> peers_;
    // Admitted and being admitted, per uid and in all.
    std::unordered_map<uid_t, UidConnections> perUid_;
    size_t open_ = 0;
    std::chrono::steady_clock::time_point lastTotalRefusalLog_{};
    size_t totalRefusedSinceLog_ = 0;
    uint64_t nextSerial_ = 3;  // 0 is the listener, 1 the stop signal, 2 the sweep timer
    size_t threads_ = 0;
    // Threads waiting for an event, or about to. One always stays: an idle thread
    // leaves only while another idle one is left, whatever the busy ones do.
    size_t idle_ = 0;
    bool stopping_ = false;
};

}  // namespace vsl
