// The dictionary-message IPC service: a listener on a Unix stream socket and its
// peer connections.
//
// Each peer has one serial WorkQueue; its messages are handled in order on it, and
// different peers in parallel. Readiness comes from one epoll set with one-shot
// registrations, waited on by a small, self-sizing group of I/O threads: the thread
// that wakes for a peer reads, decodes and runs the message handler itself (through
// a sync onto the peer's queue, which runs inline when the queue is free), so the
// request path costs one wake-up, as a thread per connection would, while idle
// connections cost no thread. A thread about to run a handler makes sure another
// one still waits for events (an idle thread leaves only while another idle one
// stays, and at the thread cap the handler is handed to the peer's queue instead),
// so a blocked handler delays only its own peer.
//
// Connections are limited per uid and in total, and long-idle ones are closed, so
// no local user can take every descriptor. A connection over a limit gets one
// notice frame (message id 0, see IpcWire.h) and is closed.
//
// A frame that does not decode closes that connection and nothing else.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "Platform/IpcFraming.h"
#include "Platform/IpcPeer.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class IpcEventLoop;

struct IpcServerOptions {
    std::string path;  // socket path; ignored when listenFd is given
    int listenFd = -1;  // an already listening socket (socket activation); adopted
    // How bytes become messages and replies become bytes; none for dictionary frames.
    std::shared_ptr<const IpcFraming> framing;
    // Mode of the socket file made on `path`.
    mode_t socketMode = 0666;
    // Called for each message on the peer's queue.
    std::function<void(std::shared_ptr<IpcPeer>, IpcMessage)> onMessage;
    // Called for each new peer on connectionQueue (inline on an I/O thread when
    // none); the peer's messages are handled only after it returns.
    std::function<void(std::shared_ptr<IpcPeer>)> onConnection;
    std::shared_ptr<WorkQueue> connectionQueue;
    // Called on the peer's queue once it is closed, whatever closed it.
    std::function<void(std::shared_ptr<IpcPeer>)> onDisconnect;
    size_t maxIoThreads = 64;
    std::chrono::milliseconds ioThreadIdleTimeout{5000};
    // Open connections per peer uid; 0 for no limit. Uid 0 and the server's own
    // effective uid have maxConnectionsPrivileged instead.
    size_t maxConnectionsPerUid = 0;
    size_t maxConnectionsPrivileged = 0;
    // Open connections in all; 0 for a limit derived from the descriptor limit at
    // start, leaving room for the descriptors that handlers use.
    size_t maxConnections = 0;
    // A connection with no request, no unanswered message and no unsent reply for
    // this long is closed; 0 never closes one.
    std::chrono::milliseconds idleConnectionTimeout{0};
};

class IpcServer {
public:
    // Binds, listens and starts serving. Refuses when another server answers on the
    // path; a stale socket file left by a crash is replaced. The socket has the
    // options' mode, 0666 by default: rights come from the policy store, not from file modes.
    static std::unique_ptr<IpcServer> start(IpcServerOptions options, std::string* error = nullptr);
    ~IpcServer();  // stop()
    IpcServer(const IpcServer&) = delete;
    IpcServer& operator=(const IpcServer&) = delete;

    // Stops accepting, closes every peer, waits for running handlers and for the
    // peers' disconnect handlers, and removes the socket file. Must not be called
    // from a handler. Replies sent later from completions are refused.
    // With a grace, waits at most that long: false when handlers were still running
    // then. They finish on their own later, so whatever they use must outlive them
    // (the daemon exits instead). A later call returns at once.
    bool stop(std::optional<std::chrono::milliseconds> grace = std::nullopt);

    const std::string& path() const { return path_; }
    size_t peerCount() const;
    size_t ioThreadCount() const;
    size_t connectionLimit() const;  // the total in force

private:
    IpcServer(std::shared_ptr<IpcEventLoop> loop, std::string path, int lockFd);

    std::shared_ptr<IpcEventLoop> loop_;
    std::string path_;  // empty for an adopted socket: not ours to remove
    int lockFd_;        // held for the server's life; excludes a second server
    dev_t socketDev_ = 0;
    ino_t socketIno_ = 0;
    std::mutex stopMutex_;
    bool stopped_ = false;
};

// "run/vesseld/com.tarrow.vesseld" under the system root.
std::string defaultIpcServicePath();

}  // namespace vsl
