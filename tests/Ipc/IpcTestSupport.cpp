#include "Ipc/IpcTestSupport.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace vsl::test {

Value echoOf(const IpcMessage& m) { return dict({{"Echo", m.body}}); }

void Unanswered::keep(std::shared_ptr<IpcPeer> peer, uint64_t messageId) {
    std::lock_guard lock(mutex_);
    kept_.emplace_back(std::move(peer), messageId);
}

size_t Unanswered::size() {
    std::lock_guard lock(mutex_);
    return kept_.size();
}

bool Unanswered::answerOldest(const Value& body) {
    std::pair<std::shared_ptr<IpcPeer>, uint64_t> oldest;
    {
        std::lock_guard lock(mutex_);
        if (kept_.empty()) return false;
        oldest = std::move(kept_.front());
        kept_.pop_front();
    }
    return oldest.first->sendReply(oldest.second, body);
}

void Gate::open() {
    std::lock_guard lock(mutex_);
    open_ = true;
    cv_.notify_all();
}

bool Gate::wait(std::chrono::milliseconds timeout) {
    std::unique_lock lock(mutex_);
    return cv_.wait_for(lock, timeout, [&] { return open_; });
}

void Counter::add() {
    std::lock_guard lock(mutex_);
    ++n_;
    cv_.notify_all();
}

bool Counter::waitFor(size_t n, std::chrono::milliseconds timeout) {
    std::unique_lock lock(mutex_);
    return cv_.wait_for(lock, timeout, [&] { return n_ >= n; });
}

size_t Counter::value() {
    std::lock_guard lock(mutex_);
    return n_;
}

RawClient::RawClient(const std::string& path) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd_ >= 0 && ::connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
        ::close(fd_);
        fd_ = -1;
    }
}

RawClient::~RawClient() {
    if (fd_ >= 0) ::close(fd_);
}

bool RawClient::sendBytes(const std::string& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t n = ::send(fd_, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

bool RawClient::sendRequest(uint64_t id, const Value& body) {
    auto frame = encodeFrame(id, 0, body);
    return frame && sendBytes(*frame);
}

bool RawClient::fill(size_t n, std::chrono::milliseconds timeout) {
    const auto end = std::chrono::steady_clock::now() + timeout;
    while (buffer_.size() < n) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        if (left.count() <= 0) return false;
        pollfd p{fd_, POLLIN, 0};
        if (::poll(&p, 1, static_cast<int>(left.count())) <= 0) continue;
        char chunk[65536];
        const ssize_t got = ::recv(fd_, chunk, sizeof chunk, 0);
        if (got < 0 && errno == EINTR) continue;
        if (got <= 0) return false;
        buffer_.append(chunk, static_cast<size_t>(got));
    }
    return true;
}

std::optional<IpcFrame> RawClient::readFrame(std::chrono::milliseconds timeout) {
    if (!fill(kIpcLengthPrefix, timeout)) return std::nullopt;
    auto length = decodeFrameLength(reinterpret_cast<const uint8_t*>(buffer_.data()));
    if (!length || !fill(kIpcLengthPrefix + *length, timeout)) return std::nullopt;
    auto frame = decodeFrameBody(reinterpret_cast<const uint8_t*>(buffer_.data()) + kIpcLengthPrefix, *length);
    buffer_.erase(0, kIpcLengthPrefix + *length);
    return frame;
}

bool RawClient::waitForClose(std::chrono::milliseconds timeout) {
    pollfd p{fd_, POLLIN, 0};
    if (::poll(&p, 1, static_cast<int>(timeout.count())) <= 0) return false;
    char c;
    return ::recv(fd_, &c, 1, MSG_DONTWAIT) <= 0;
}

}  // namespace vsl::test
