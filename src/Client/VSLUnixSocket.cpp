#include "Client/VSLUnixSocket.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

namespace vsl::client {

UniqueFd connectUnixStream(const std::string& path, std::string* error) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof addr.sun_path) {
        if (error) *error = "unusable socket path \"" + path + "\"";
        errno = EINVAL;
        return UniqueFd();
    }
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd || ::connect(fd.get(), reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0) {
        const int saved = errno;
        if (error) *error = "cannot connect to " + path + ": " + std::strerror(saved);
        fd.reset();
        errno = saved;
        return UniqueFd();
    }
    // Waits happen in poll(), where the deadlines live.
    ::fcntl(fd.get(), F_SETFL, ::fcntl(fd.get(), F_GETFL) | O_NONBLOCK);
    return fd;
}

std::string pathBelowSystemRoot(const std::string& root, const std::string& relative) {
    std::string base = root;
    while (!base.empty() && base.back() == '/') base.pop_back();
    return base + "/" + relative;
}

}  // namespace vsl::client
