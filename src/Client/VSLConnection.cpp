#include "Client/VSLConnection.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Client/VSLUnixSocket.h"
#include "Platform/IpcWire.h"

namespace vsl::client {

namespace {

constexpr size_t kReadChunk = 64u << 10;
constexpr int kWriterRecheckMs = 10;

// Milliseconds left for poll(); -1 waits without end.
int pollTimeout(std::optional<std::chrono::steady_clock::time_point> deadline) {
    if (!deadline) return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - std::chrono::steady_clock::now());
    return left.count() <= 0 ? 0 : static_cast<int>(std::min<int64_t>(left.count(), INT32_MAX));
}

}  // namespace

struct VSLConnection::Pending {
    std::condition_variable cv;
    bool done = false;
    bool waiting = false;  // asleep on cv, so able to take over the reader role
    Value reply;
};

const char* statusName(VSLConnectionStatus status) {
    switch (status) {
    case VSLConnectionStatus::Ok: return "ok";
    case VSLConnectionStatus::InvalidRequest: return "invalid request";
    case VSLConnectionStatus::Timeout: return "timed out";
    case VSLConnectionStatus::Closed: return "connection closed";
    case VSLConnectionStatus::Refused: return "connection refused";
    }
    return "unknown";
}

std::string VSLConnection::socketPathForSystemRoot(const std::string& root) {
    return pathBelowSystemRoot(root, "run/vesseld/com.tarrow.vesseld");
}

std::shared_ptr<VSLConnection> VSLConnection::connectToSystemRoot(const std::string& root,
                                                                  std::string* error) {
    return connect(socketPathForSystemRoot(root), error);
}

std::shared_ptr<VSLConnection> VSLConnection::connect(const std::string& socketPath, std::string* error) {
    UniqueFd fd = connectUnixStream(socketPath, error);
    if (!fd) return nullptr;
    return std::make_shared<VSLConnection>(Passkey{}, fd.release());
}

VSLConnection::VSLConnection(Passkey, int fd) : fd_(fd) {}

VSLConnection::~VSLConnection() {
    close();
    ::close(fd_);
}

void VSLConnection::close() {
    std::lock_guard lock(mutex_);
    failLocked("closed by the client");
}

bool VSLConnection::isClosed() const {
    std::lock_guard lock(mutex_);
    return closed_;
}

bool VSLConnection::wasRefused() const {
    std::lock_guard lock(mutex_);
    return refused_;
}

void VSLConnection::failLocked(const std::string& reason, bool refused) {
    if (closed_) return;
    closed_ = true;
    refused_ = refused;
    closeReason_ = reason;
    // Wakes a reader blocked in poll(); the descriptor stays valid until destruction.
    ::shutdown(fd_, SHUT_RDWR);
    for (auto& [id, pending] : pending_) pending->cv.notify_one();
}

void VSLConnection::handOffReaderLocked() {
    readerActive_ = false;
    for (auto& [id, pending] : pending_) {
        if (pending->waiting) {
            pending->cv.notify_one();
            return;
        }
    }
}

VSLReply VSLConnection::sendRequest(const Value& request, std::optional<std::chrono::milliseconds> timeout) {
    std::optional<Clock::time_point> deadline;
    if (timeout) deadline = Clock::now() + *timeout;
    Pending mine;
    uint64_t id;
    {
        std::lock_guard lock(mutex_);
        if (closed_) return {closedStatusLocked(), {}, closeReason_};
        id = nextId_++;
    }
    std::string error;
    auto frame = encodeFrame(id, 0, request, &error);
    if (!frame) return {VSLConnectionStatus::InvalidRequest, {}, error};
    {
        std::lock_guard lock(mutex_);
        if (closed_) return {closedStatusLocked(), {}, closeReason_};
        pending_.emplace(id, &mine);
    }
    const bool written = writeFrame(*frame, deadline);

    std::unique_lock lock(mutex_);
    auto finish = [&](VSLConnectionStatus status, std::string why) {
        pending_.erase(id);
        return VSLReply{status, {}, std::move(why)};
    };
    for (;;) {
        if (mine.done) return {VSLConnectionStatus::Ok, std::move(mine.reply), {}};
        if (!written) return finish(VSLConnectionStatus::Timeout, closeReason_);
        if (closed_) return finish(closedStatusLocked(), closeReason_);
        if (!readerActive_) {
            readerActive_ = true;
            lock.unlock();
            const bool answered = readUntil(mine, deadline);
            lock.lock();
            handOffReaderLocked();
            if (!answered && !mine.done && !closed_) {
                return finish(VSLConnectionStatus::Timeout, "no reply in time");
            }
            continue;
        }
        auto wake = [&] { return mine.done || closed_ || !readerActive_; };
        mine.waiting = true;
        const bool woke = deadline ? mine.cv.wait_until(lock, *deadline, wake) : (mine.cv.wait(lock, wake), true);
        mine.waiting = false;
        if (!woke) return finish(VSLConnectionStatus::Timeout, "no reply in time");
    }
}

bool VSLConnection::writeFrame(const std::string& frame, std::optional<Clock::time_point> deadline) {
    std::lock_guard writeLock(writeMutex_);
    size_t done = 0;
    bool reading = false;  // took the reader role so replies keep flowing while we wait
    bool ok = true;
    while (done < frame.size()) {
        const ssize_t n = ::send(fd_, frame.data() + done, frame.size() - done, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0) {
            done += static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK) {
            const std::string why = std::string("write failed: ") + std::strerror(errno);
            if (reading) {
                receiveAvailable();
            } else {
                readLastWords();
            }
            std::lock_guard lock(mutex_);
            failLocked(why);
            break;
        }
        // The server stops reading while its replies to us are unread: read them
        // meanwhile unless another caller already does.
        if (!reading) {
            std::lock_guard lock(mutex_);
            if (!readerActive_) reading = readerActive_ = true;
        }
        pollfd p{fd_, static_cast<short>(POLLOUT | (reading ? POLLIN : 0)), 0};
        // Without the reader role, look again soon: its holder may leave without
        // knowing that we wait here rather than on a condition variable.
        int timeout = pollTimeout(deadline);
        if (!reading && (timeout < 0 || timeout > kWriterRecheckMs)) timeout = kWriterRecheckMs;
        const int r = ::poll(&p, 1, timeout);
        if (r == 0 && pollTimeout(deadline) != 0) continue;
        if (r == 0) {
            // Part of a frame is out: the stream cannot be used any more.
            std::lock_guard lock(mutex_);
            failLocked("timed out sending a request");
            ok = false;
            break;
        }
        if (r > 0 && reading && (p.revents & (POLLIN | POLLHUP | POLLERR))) receiveAvailable();
        if (isClosed()) break;
    }
    if (reading) {
        std::lock_guard lock(mutex_);
        handOffReaderLocked();
    }
    return ok;
}

void VSLConnection::readLastWords() {
    {
        std::lock_guard lock(mutex_);
        // The caller that reads now sees the same bytes.
        if (readerActive_) return;
        readerActive_ = true;
    }
    receiveAvailable();
    std::lock_guard lock(mutex_);
    handOffReaderLocked();
}

bool VSLConnection::readUntil(Pending& mine, std::optional<Clock::time_point> deadline) {
    for (;;) {
        {
            std::lock_guard lock(mutex_);
            if (mine.done || closed_) return true;
        }
        pollfd p{fd_, POLLIN, 0};
        const int r = ::poll(&p, 1, pollTimeout(deadline));
        if (r == 0) return false;
        if (r < 0 && errno != EINTR) {
            std::lock_guard lock(mutex_);
            failLocked(std::string("poll failed: ") + std::strerror(errno));
            return true;
        }
        if (r > 0) receiveAvailable();
    }
}

void VSLConnection::receiveAvailable() {
    char buffer[kReadChunk];
    const ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) return;
    if (n <= 0) {
        std::lock_guard lock(mutex_);
        failLocked(n == 0 ? "closed by the server" : std::string("read failed: ") + std::strerror(errno));
        return;
    }
    inbox_.append(buffer, static_cast<size_t>(n));
    size_t pos = 0;
    const auto* bytes = reinterpret_cast<const uint8_t*>(inbox_.data());
    while (inbox_.size() - pos >= kIpcLengthPrefix) {
        auto length = decodeFrameLength(bytes + pos);
        if (!length) {
            std::lock_guard lock(mutex_);
            failLocked("protocol error: bad frame length");
            return;
        }
        if (inbox_.size() - pos - kIpcLengthPrefix < *length) break;
        std::string error;
        auto frame = decodeFrameBody(bytes + pos + kIpcLengthPrefix, *length, &error);
        pos += kIpcLengthPrefix + *length;
        std::lock_guard lock(mutex_);
        if (!frame || frame->flags != kIpcFlagReply) {
            failLocked("protocol error: " + (frame ? std::string("not a reply") : error));
            return;
        }
        if (frame->messageId == kIpcNoticeMessageId) {
            const std::string* reason = nullptr;
            if (const Value* v = frame->body.find(kIpcRefusalKey)) reason = v->stringValue();
            failLocked(reason ? *reason : "refused by the server", true);
            return;
        }
        auto it = pending_.find(frame->messageId);
        if (it == pending_.end()) continue;  // its caller gave up waiting
        it->second->reply = std::move(frame->body);
        it->second->done = true;
        it->second->cv.notify_one();
        pending_.erase(it);
    }
    inbox_.erase(0, pos);
}

uint64_t resultCode(const VSLReply& reply, std::string* error) {
    if (!reply.ok()) {
        if (error) *error = std::string(statusName(reply.status)) + ": " + reply.error;
        return 0;
    }
    const Value* code = reply.body.find("ReplyError");
    if (!code || !code->uint64Value()) {
        if (error) *error = "reply without a result code";
        return 0;
    }
    return *code->uint64Value();
}

}  // namespace vsl::client
