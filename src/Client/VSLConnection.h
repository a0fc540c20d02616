// libvessel's connection to the daemon: sends request dictionaries and waits for
// their replies. Requests may be sent from several threads at once; each reply is
// paired with its request by message id, whatever order they come back in. A
// waiting caller reads the socket itself when no other caller is reading, so a
// single-threaded client pays no thread hand-off.
//
// The daemon limits the connections each uid may hold and closes one that stays
// unused for long (docs/operations.md): a long-lived client reconnects when it finds
// its connection Closed, and a Refused one has too many open already.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl::client {

enum class VSLConnectionStatus {
    Ok,
    InvalidRequest,  // the request cannot be encoded (not a dictionary, bad string, ...)
    Timeout,         // no reply in time; a late reply is dropped
    Closed,          // the connection is closed (by either side, or a protocol error)
    Refused,         // the server refused the connection: its caller holds too many
};

const char* statusName(VSLConnectionStatus status);

struct VSLReply {
    VSLConnectionStatus status = VSLConnectionStatus::Closed;
    Value body;         // the reply dictionary when status is Ok
    std::string error;  // a reason otherwise

    bool ok() const { return status == VSLConnectionStatus::Ok; }
};

// "ReplyError" of a reply, or 0 with `error` set when no reply or no code came.
uint64_t resultCode(const VSLReply& reply, std::string* error);

class VSLConnection {
    struct Passkey {};

public:
    // Connects to a socket path; none with a reason on failure, errno as connect(2)
    // left it (ENOENT or ECONNREFUSED: no server there).
    static std::shared_ptr<VSLConnection> connect(const std::string& socketPath,
                                                  std::string* error = nullptr);
    // Connects to "run/vesseld/com.tarrow.vesseld" below a system root ("/" in production).
    static std::shared_ptr<VSLConnection> connectToSystemRoot(const std::string& root,
                                                              std::string* error = nullptr);
    static std::string socketPathForSystemRoot(const std::string& root);

    VSLConnection(Passkey, int fd);
    ~VSLConnection();
    VSLConnection(const VSLConnection&) = delete;
    VSLConnection& operator=(const VSLConnection&) = delete;

    // Sends a request and waits for its reply; no timeout waits as long as it takes.
    VSLReply sendRequest(const Value& request,
                         std::optional<std::chrono::milliseconds> timeout = std::nullopt);

    // Closes the connection; callers waiting on it get Closed.
    void close();
    bool isClosed() const;
    bool wasRefused() const;

private:
    struct Pending;
    using Clock = std::chrono::steady_clock;

    // Reads until the given request is answered or the connection fails (true), or
    // the deadline passes (false). Only the caller holding the reader role reads.
    bool readUntil(Pending& mine, std::optional<Clock::time_point> deadline);
    // Reads what the socket holds and hands every whole reply to its caller.
    void receiveAvailable();
    // False when the deadline passed with the frame partly written.
    bool writeFrame(const std::string& frame, std::optional<Clock::time_point> deadline);
    void failLocked(const std::string& reason, bool refused = false);
    VSLConnectionStatus closedStatusLocked() const {
        return refused_ ? VSLConnectionStatus::Refused : VSLConnectionStatus::Closed;
    }
    // After a failed write: reads what the server said before it hung up.
    void readLastWords();
    void handOffReaderLocked();

    const int fd_;
    mutable std::mutex mutex_;
    std::mutex writeMutex_;
    bool closed_ = false;
    bool refused_ = false;
    std::string closeReason_;
    bool readerActive_ = false;
    uint64_t nextId_ = 1;
    std::map<uint64_t, Pending*> pending_;
    std::string inbox_;  // owned by whoever holds the reader role
};

}  // namespace vsl::client
