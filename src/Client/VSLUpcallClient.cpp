#include "Client/VSLUpcallClient.h"

#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "Client/VSLUnixSocket.h"
#include "Client/VSLUpcallProtocol.h"

namespace vsl::client {

const char* upcallStatusName(VSLUpcallStatus status) {
    switch (status) {
    case VSLUpcallStatus::Ok: return "ok";
    case VSLUpcallStatus::Timeout: return "timeout";
    case VSLUpcallStatus::Closed: return "closed";
    case VSLUpcallStatus::ProtocolError: return "protocol error";
    }
    return "unknown";
}

std::unique_ptr<VSLUpcallClient> VSLUpcallClient::connect(const std::string& socketPath, std::string* error) {
    UniqueFd fd = connectUnixStream(socketPath, error);
    if (!fd) return nullptr;
    return std::make_unique<VSLUpcallClient>(Passkey{}, std::move(fd));
}

std::string VSLUpcallClient::socketPathForSystemRoot(const std::string& root) {
    return pathBelowSystemRoot(root, "run/vesseld/com.tarrow.vesseld.upcall");
}

VSLUpcallClient::VSLUpcallClient(Passkey, UniqueFd fd) : fd_(std::move(fd)) {}

bool VSLUpcallClient::sendBytes(const std::string& bytes, std::string* error) {
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t n = ::send(fd_.get(), bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (n > 0) {
            done += static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            pollfd p{fd_.get(), POLLOUT, 0};
            ::poll(&p, 1, -1);
            continue;
        }
        if (error) *error = std::string("send failed: ") + std::strerror(errno);
        return false;
    }
    return true;
}

bool VSLUpcallClient::sendRequest(uint32_t messageId, const std::string& packbuff, std::string* error) {
    auto frame = encodeUpcallRequestFrame(messageId, packbuff);
    if (!frame) {
        if (error) *error = "the request is over the frame limit";
        return false;
    }
    return sendBytes(*frame, error);
}

VSLUpcallStatus VSLUpcallClient::receiveReply(UpcallReplyFrame* frame, std::chrono::milliseconds timeout,
                                              std::string* error) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        size_t consumed = 0;
        switch (decodeUpcallReplyFrame(reinterpret_cast<const uint8_t*>(inbox_.data()), inbox_.size(), frame,
                                       &consumed, error)) {
        case UpcallDecodeStatus::Frame:
            inbox_.erase(0, consumed);
            return VSLUpcallStatus::Ok;
        case UpcallDecodeStatus::Error:
            return VSLUpcallStatus::ProtocolError;
        case UpcallDecodeStatus::NeedMore:
            break;
        }
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            if (error) *error = "no reply in time";
            return VSLUpcallStatus::Timeout;
        }
        pollfd p{fd_.get(), POLLIN, 0};
        const int ready = ::poll(&p, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno != EINTR) {
            if (error) *error = std::string("poll failed: ") + std::strerror(errno);
            return VSLUpcallStatus::Closed;
        }
        if (ready <= 0) continue;
        char buffer[16384];
        const ssize_t n = ::recv(fd_.get(), buffer, sizeof buffer, MSG_DONTWAIT);
        if (n > 0) {
            inbox_.append(buffer, static_cast<size_t>(n));
        } else if (n == 0 || (errno != EINTR && errno != EAGAIN && errno != EWOULDBLOCK)) {
            if (error) *error = inbox_.empty() ? "the daemon closed the connection" : "the connection ended inside a frame";
            return VSLUpcallStatus::Closed;
        }
    }
}

VSLUpcallStatus VSLUpcallClient::getProcessContainers(const std::string& packbuff, UpcallReplyFrame* frame,
                                                      std::chrono::milliseconds timeout, std::string* error) {
    if (!sendRequest(kVSLUpcallGetProcessContainersID, packbuff, error)) return VSLUpcallStatus::Closed;
    return receiveReply(frame, timeout, error);
}

}  // namespace vsl::client
