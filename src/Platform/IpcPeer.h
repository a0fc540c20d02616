// One peer connection of the IPC service (see IpcServer.h): the caller's
// credentials, its serial queue and the way back to it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "Platform/AuditToken.h"
#include "Platform/IpcFraming.h"
#include "Platform/Transaction.h"
#include "Platform/Value.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class IpcEventLoop;

class IpcPeer : public std::enable_shared_from_this<IpcPeer> {
    struct Passkey {};

public:
    struct Credentials {
        pid_t pid = 0;
        uid_t uid = 0;
        gid_t gid = 0;
        AuditToken token;
        std::string executable;
    };
    IpcPeer(Passkey, int fd, uint64_t serial, Credentials credentials,
            std::shared_ptr<IpcEventLoop> loop);
    ~IpcPeer();
    IpcPeer(const IpcPeer&) = delete;
    IpcPeer& operator=(const IpcPeer&) = delete;

    // Credentials the kernel recorded when the peer connected (SO_PEERCRED).
    pid_t pid() const { return credentials_.pid; }
    uid_t uid() const { return credentials_.uid; }  // effective
    gid_t gid() const { return credentials_.gid; }  // effective
    const AuditToken& auditToken() const { return credentials_.token; }
    // Real path of the peer's executable, read and checked against the token when
    // it connected; empty when it could not be established.
    const std::string& executablePath() const { return credentials_.executable; }
    uint64_t serial() const { return serial_; }  // unique per server, for logs
    // The serial queue the peer's messages are handled on. Handlers run on it, so
    // a handler must not sync onto it.
    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // Sends a reply to the message with that id. Thread-safe, from any thread and at
    // any later time; replies never interleave. False when the peer is closed or the
    // body cannot be encoded (not a dictionary, bad string, too deep or large).
    bool sendReply(uint64_t messageId, const Value& body);
    // Ends a message that gets no reply, so that it no longer keeps the process alive.
    void noReply(uint64_t messageId);

    // Closes the connection: messages not yet handled are dropped and later
    // replies are refused. Idempotent, any thread.
    void cancel();
    bool isCancelled() const;

    std::string description() const;

private:
    friend class IpcEventLoop;

    // Runs on the peer's queue: flushes pending output, reads and handles messages.
    // True when the connection stays open: the caller then re-arms it with arm(), after
    // it has let go of the queue, so that the next message finds the queue free.
    bool service();
    // Registration, once the connection handler has run, and each re-arm after service().
    void arm();
    void rearmLocked();
    // Closes the connection when it waits for input with nothing owed either way and
    // has not been used since cutoff.
    void closeIfIdleSince(std::chrono::steady_clock::time_point cutoff);
    bool flushLocked();
    bool markClosedLocked(const char* why);
    void finishClose();
    // Reads what the socket holds and handles every whole frame; false on EOF,
    // socket error or protocol error.
    bool readAndHandle(const char** why);
    bool handleFrames(const char** why);
    bool outboxEmpty() const;

    const int fd_;
    const uint64_t serial_;
    const Credentials credentials_;
    const std::shared_ptr<IpcEventLoop> loop_;
    const std::shared_ptr<WorkQueue> queue_;

    // Guards the socket's state and output; never held while a handler runs.
    mutable std::mutex mutex_;
    bool closed_ = false;
    bool registered_ = false;  // added to the epoll set
    bool armed_ = false;       // waiting there for readiness
    std::string outbox_;       // reply bytes the socket did not take yet
    std::chrono::steady_clock::time_point lastUse_ = std::chrono::steady_clock::now();
    // A message handled but not yet answered keeps the process alive, as a pending
    // reply does; the transaction ends with the reply or with the peer.
    std::unordered_multimap<uint64_t, Transaction> pending_;

    std::string inbox_;  // bytes read but not yet decoded; touched on the queue only
};

}  // namespace vsl
