// Plain socket helpers for the transport benchmarks, and the floor they measure
// against: a blocking echo, one thread per connection, that reads a u32
// length-prefixed request and writes a canned reply without decoding anything.
#pragma once

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

namespace vslbench {

inline bool writeAll(int fd, const char* p, size_t n) {
    while (n > 0) {
        const ssize_t w = ::send(fd, p, n, MSG_NOSIGNAL);
        if (w <= 0) return false;
        p += w;
        n -= static_cast<size_t>(w);
    }
    return true;
}

inline bool readAll(int fd, char* p, size_t n) {
    while (n > 0) {
        const ssize_t r = ::recv(fd, p, n, 0);
        if (r <= 0) return false;
        p += r;
        n -= static_cast<size_t>(r);
    }
    return true;
}

inline int connectTo(const std::string& path) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
        std::perror("connect");
        std::exit(1);
    }
    return fd;
}

// The floor: blocking reads and writes, one thread per connection, no decoding.
class RawEchoServer {
public:
    RawEchoServer(const std::string& path, std::string replyFrame) : reply_(std::move(replyFrame)) {
        ::unlink(path.c_str());
        listener_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
        if (::bind(listener_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || ::listen(listener_, 64) != 0) {
            std::perror("raw echo server");
            std::exit(1);
        }
        acceptor_ = std::thread([this] {
            for (;;) {
                const int fd = ::accept(listener_, nullptr, nullptr);
                if (fd < 0) return;
                std::thread([this, fd] { serve(fd); }).detach();
            }
        });
    }
    ~RawEchoServer() {
        ::shutdown(listener_, SHUT_RDWR);
        ::close(listener_);
        acceptor_.join();
    }

private:
    void serve(int fd) {
        // Grown to the largest request seen: zeroing a frame-limit buffer per
        // connection would cost more than the round trips measured.
        std::vector<char> buffer;
        for (;;) {
            uint32_t length;
            if (!readAll(fd, reinterpret_cast<char*>(&length), 4) || length > (16u << 20)) break;
            if (buffer.size() < length) buffer.resize(length);
            if (!readAll(fd, buffer.data(), length) || !writeAll(fd, reply_.data(), reply_.size())) break;
        }
        ::close(fd);
    }

    std::string reply_;
    int listener_ = -1;
    std::thread acceptor_;
};

}  // namespace vslbench
