#include "Systemd/DatagramListener.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

namespace vsl::test {

DatagramListener::DatagramListener(const std::string& path) {
    fd_.reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bound_ = fd_ && ::bind(fd_.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
}

std::vector<std::string> DatagramListener::receive() {
    std::vector<std::string> all;
    static thread_local char buffer[1 << 16];
    for (;;) {
        const ssize_t n = ::recv(fd_.get(), buffer, sizeof buffer, 0);
        if (n < 0) return all;
        all.emplace_back(buffer, static_cast<size_t>(n));
    }
}

}  // namespace vsl::test
