// Helpers shared by the IPC tests: a raw client socket that speaks frames by hand,
// and a gate to order threads without sleeping.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

#include "Platform/IpcPeer.h"
#include "Platform/IpcWire.h"

namespace vsl::test {

// Deadlines only keep a broken build from hanging; nothing asserts on speed.
constexpr std::chrono::seconds kPatience{60};

class Gate {
public:
    void open();
    bool wait(std::chrono::milliseconds timeout = kPatience);

private:
    std::mutex mutex_;
    std::condition_variable cv_;
    bool open_ = false;
};

// A counter that can be waited on.
class Counter {
public:
    void add();
    bool waitFor(size_t n, std::chrono::milliseconds timeout = kPatience);
    size_t value();

private:
    std::mutex mutex_;
    std::condition_variable cv_;
    size_t n_ = 0;
};

// What the test servers answer: {"Echo": the request's body}.
Value echoOf(const IpcMessage& m);

// Requests a test server keeps unanswered, for the test to answer later.
class Unanswered {
public:
    void keep(std::shared_ptr<IpcPeer> peer, uint64_t messageId);
    size_t size();
    // Answers the oldest one with body; what sendReply returned.
    bool answerOldest(const Value& body);

private:
    std::mutex mutex_;
    std::deque<std::pair<std::shared_ptr<IpcPeer>, uint64_t>> kept_;
};

class RawClient {
public:
    explicit RawClient(const std::string& path);
    ~RawClient();
    RawClient(const RawClient&) = delete;
    RawClient& operator=(const RawClient&) = delete;

    bool connected() const { return fd_ >= 0; }
    bool sendBytes(const std::string& bytes);
    bool sendRequest(uint64_t id, const Value& body);
    // Next whole frame, or none on EOF, error or timeout.
    std::optional<IpcFrame> readFrame(std::chrono::milliseconds timeout = kPatience);
    // True when the server closed the connection (EOF or reset) before the timeout.
    bool waitForClose(std::chrono::milliseconds timeout = kPatience);

private:
    bool fill(size_t n, std::chrono::milliseconds timeout);
    int fd_ = -1;
    std::string buffer_;
};

}  // namespace vsl::test
