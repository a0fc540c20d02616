#include "Platform/IpcPeer.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "Platform/IpcEventLoop.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// Replies a peer leaves unread past this are a peer that stopped reading.
constexpr size_t kMaxOutbox = 64u << 20;
// Read at most this much per wake-up so one busy peer cannot hold a thread forever;
// the level-triggered rearm brings the thread back for the rest.
constexpr size_t kReadBudget = 1u << 20;
constexpr size_t kReadChunk = 64u << 10;

std::string queueLabel(pid_t pid) { return "com.tarrow.vesseld.peer." + std::to_string(pid); }

}  // namespace

IpcPeer::IpcPeer(Passkey, int fd, uint64_t serial, Credentials credentials,
                 std::shared_ptr<IpcEventLoop> loop)
    : fd_(fd),
      serial_(serial),
      credentials_(std::move(credentials)),
      loop_(std::move(loop)),
      queue_(WorkQueue::serial(queueLabel(credentials_.pid))) {}

IpcPeer::~IpcPeer() { ::close(fd_); }

void IpcPeer::arm() {
    std::lock_guard lock(mutex_);
    rearmLocked();
}

void IpcPeer::rearmLocked() {
    if (closed_) return;
    epoll_event ev{};
    // While replies wait for room, read nothing more: a peer that does not read
    // cannot make us buffer without end.
    ev.events = EPOLLONESHOT | EPOLLRDHUP | (outbox_.empty() ? EPOLLIN : EPOLLOUT);
    ev.data.u64 = serial_;
    ::epoll_ctl(loop_->epollFd(), registered_ ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, fd_, &ev);
    registered_ = true;
    armed_ = true;
}

bool IpcPeer::service() {
    const char* why = nullptr;
    {
        std::lock_guard lock(mutex_);
        armed_ = false;
        if (closed_) return false;
        lastUse_ = std::chrono::steady_clock::now();
        if (!outbox_.empty() && !flushLocked()) why = "write failed";
    }
    bool open = why == nullptr;
    if (open && outboxEmpty()) open = readAndHandle(&why);
    if (open) {
        loop_->willBeIdle();
        return true;
    }
    std::unique_lock lock(mutex_);
    const bool closing = markClosedLocked(why);
    lock.unlock();
    if (closing) finishClose();
    return false;
}

bool IpcPeer::outboxEmpty() const {
    std::lock_guard lock(mutex_);
    return outbox_.empty();
}

bool IpcPeer::readAndHandle(const char** why) {
    char buffer[kReadChunk];
    size_t budget = kReadBudget;
    for (;;) {
        const ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
        if (n == 0) {
            *why = "closed by peer";
            return false;
        }
        if (n < 0) {
            if (errno == EINTR) continue;
            if (errno == EAGAIN || errno == EWOULDBLOCK) return true;
            *why = "read failed";
            return false;
        }
        inbox_.append(buffer, static_cast<size_t>(n));
        if (!handleFrames(why)) return false;
        // A short read emptied the socket; the rearm catches anything later.
        if (static_cast<size_t>(n) < sizeof buffer || budget <= static_cast<size_t>(n)) return true;
        budget -= static_cast<size_t>(n);
    }
}

bool IpcPeer::handleFrames(const char** why) {
    size_t pos = 0;
    bool ok = true;
    const auto* bytes = reinterpret_cast<const uint8_t*>(inbox_.data());
    const IpcFraming& framing = *loop_->options().framing;
    while (pos < inbox_.size()) {
        IpcDecoded decoded = framing.decode(bytes + pos, inbox_.size() - pos);
        if (decoded.kind == IpcDecoded::Kind::NeedMore) break;
        if (decoded.kind == IpcDecoded::Kind::Error) {
            osLog(LogCategory::Ipc, OSLogLevel::Error, "protocol error from pid %d: %s", credentials_.pid,
                  decoded.error);
            *why = "protocol error";
            ok = false;
            break;
        }
        pos += decoded.consumed;
        {
            std::lock_guard lock(mutex_);
            if (closed_) {
                ok = false;
                *why = "cancelled";
                break;
            }
            pending_.emplace(decoded.message.id, Transaction("com.tarrow.vesseld.peer-message"));
        }
        if (const auto& handler = loop_->options().onMessage) {
            handler(shared_from_this(), std::move(decoded.message));
        }
        if (isCancelled()) {
            *why = "cancelled";
            ok = false;
            break;
        }
    }
    if (pos == inbox_.size()) {
        inbox_.clear();
    } else if (pos > 0) {
        inbox_.erase(0, pos);
    }
    return ok;
}

void IpcPeer::noReply(uint64_t messageId) {
    std::optional<Transaction> ended;  // ends outside the lock
    std::lock_guard lock(mutex_);
    if (auto it = pending_.find(messageId); it != pending_.end()) {
        ended.emplace(std::move(it->second));
        pending_.erase(it);
    }
}

bool IpcPeer::sendReply(uint64_t messageId, const Value& body) {
    std::string error;
    auto frame = loop_->options().framing->encodeReply(messageId, body, &error);
    if (!frame) {
        osLog(LogCategory::Ipc, OSLogLevel::Error, "cannot encode reply %llu to pid %d: %s",
              static_cast<unsigned long long>(messageId), credentials_.pid, error);
        return false;
    }
    std::optional<Transaction> answered;  // ends outside the lock
    bool closing = false;
    {
        std::lock_guard lock(mutex_);
        if (closed_) return false;
        if (auto it = pending_.find(messageId); it != pending_.end()) {
            answered.emplace(std::move(it->second));
            pending_.erase(it);
        }
        lastUse_ = std::chrono::steady_clock::now();
        const bool idle = outbox_.empty();
        outbox_.append(*frame);
        if (idle && !flushLocked()) {
            closing = markClosedLocked("write failed");
        } else if (outbox_.size() > kMaxOutbox) {
            closing = markClosedLocked("peer does not read its replies");
        } else if (!outbox_.empty() && armed_) {
            rearmLocked();  // now wait for room instead of input
        }
    }
    if (closing) {
        finishClose();
        return false;
    }
    return true;
}

bool IpcPeer::flushLocked() {
    size_t done = 0;
    while (done < outbox_.size()) {
        const ssize_t n = ::send(fd_, outbox_.data() + done, outbox_.size() - done,
                                 MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0) {
            done += static_cast<size_t>(n);
        } else if (n < 0 && errno == EINTR) {
            continue;
        } else if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            break;
        } else {
            return false;
        }
    }
    if (done == outbox_.size()) {
        outbox_.clear();
    } else {
        outbox_.erase(0, done);
    }
    return true;
}

void IpcPeer::closeIfIdleSince(std::chrono::steady_clock::time_point cutoff) {
    bool closing;
    {
        std::lock_guard lock(mutex_);
        if (closed_ || !armed_ || !outbox_.empty() || !pending_.empty() || lastUse_ > cutoff) return;
        closing = markClosedLocked("idle");
    }
    if (closing) finishClose();
}

void IpcPeer::cancel() {
    bool closing;
    {
        std::lock_guard lock(mutex_);
        closing = markClosedLocked("cancelled");
    }
    if (closing) finishClose();
}

bool IpcPeer::isCancelled() const {
    std::lock_guard lock(mutex_);
    return closed_;
}

bool IpcPeer::markClosedLocked(const char* why) {
    if (closed_) return false;
    closed_ = true;
    if (registered_) ::epoll_ctl(loop_->epollFd(), EPOLL_CTL_DEL, fd_, nullptr);
    // The descriptor itself stays open until the last reference goes, so a reader
    // still inside recv() can never hit a reused number.
    ::shutdown(fd_, SHUT_RDWR);
    outbox_.clear();
    pending_.clear();
    osLog(LogCategory::Ipc, OSLogLevel::Debug, "peer pid %d closed: %s", credentials_.pid, why);
    return true;
}

void IpcPeer::finishClose() { loop_->closed(shared_from_this()); }

std::string IpcPeer::description() const {
    return "<peer " + std::to_string(serial_) + ": pid " + std::to_string(credentials_.pid) +
           ", uid " + std::to_string(credentials_.uid) + ", gid " + std::to_string(credentials_.gid) +
           ", executable " + (credentials_.executable.empty() ? "(unknown)" : credentials_.executable) +
           ">";
}

}  // namespace vsl
