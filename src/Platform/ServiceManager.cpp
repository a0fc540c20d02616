#include "Platform/ServiceManager.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <optional>
#include <vector>

#include "Platform/Log.h"

namespace vsl {

namespace {

// Passed descriptors start right after the standard three.
constexpr int kFirstPassedFd = 3;

// The names the daemon listens under; anything else passed to it is a set-up mistake.
constexpr const char* kKnownNames[] = {"vesseld", "upcall"};

std::mutex gMutex;
std::map<std::string, int>& adopted() {
    static auto* sockets = new std::map<std::string, int>;
    return *sockets;
}

bool isKnownName(const std::string& name) {
    for (const char* known : kKnownNames)
        if (name == known) return true;
    return false;
}

std::optional<long> parseCount(const char* text) {
    if (!text || !*text) return std::nullopt;
    char* end = nullptr;
    errno = 0;
    const long value = std::strtol(text, &end, 10);
    if (errno || *end || value < 0) return std::nullopt;
    return value;
}

// The names of the descriptors passed to this process, the first at fd 3, or a
// negative errno. Passed descriptors are for this process only: LISTEN_PID names it,
// they are marked close-on-exec, and the variables are dropped so that no child takes
// them for its own.
int passedSocketNames(std::vector<std::string>& names) {
    const char* pidText = std::getenv("LISTEN_PID");
    const char* countText = std::getenv("LISTEN_FDS");
    const char* namesText = std::getenv("LISTEN_FDNAMES");
    int result = 0;
    const auto pid = parseCount(pidText);
    if (pidText && !pid) {
        result = -EINVAL;
    } else if (pid && *pid == ::getpid()) {
        const auto count = parseCount(countText);
        if (!count) {
            result = -EINVAL;
        } else if (*count > INT_MAX - kFirstPassedFd) {
            result = -E2BIG;
        } else {
            result = static_cast<int>(*count);
        }
    }
    for (int fd = kFirstPassedFd; result > 0 && fd < kFirstPassedFd + result; fd++) {
        const int flags = ::fcntl(fd, F_GETFD);
        if (flags < 0 || ::fcntl(fd, F_SETFD, flags | FD_CLOEXEC) < 0) result = -errno;
    }
    if (result > 0) {
        names.assign(static_cast<size_t>(result), "unknown");
        if (namesText) {
            std::vector<std::string> given;
            std::string_view rest = namesText;
            for (size_t colon; (colon = rest.find(':')) != std::string_view::npos; rest.remove_prefix(colon + 1))
                given.emplace_back(rest.substr(0, colon));
            given.emplace_back(rest);
            if (given.size() == names.size()) names = std::move(given);
            else result = -EINVAL;
        }
    }
    ::unsetenv("LISTEN_PID");
    ::unsetenv("LISTEN_FDS");
    ::unsetenv("LISTEN_FDNAMES");
    return result;
}

bool isListeningUnixStreamSocket(int fd) {
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISSOCK(st.st_mode)) return false;
    int type = 0, accepting = 0;
    socklen_t length = sizeof type;
    if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0 || type != SOCK_STREAM) return false;
    length = sizeof accepting;
    if (::getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &accepting, &length) != 0 || !accepting) return false;
    sockaddr_storage address{};
    length = sizeof address;
    return ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) == 0 && address.ss_family == AF_UNIX;
}

// One datagram to $NOTIFY_SOCKET: a path, or an abstract name written with a leading '@'.
void notifyServiceManager(const char* state) {
    const char* target = std::getenv("NOTIFY_SOCKET");
    if (!target || (target[0] != '/' && target[0] != '@')) return;
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const size_t length = std::strlen(target);
    if (length >= sizeof address.sun_path) return;
    std::memcpy(address.sun_path, target, length);
    if (target[0] == '@') address.sun_path[0] = '\0';
    const UniqueFd fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    if (!fd) return;
    ::sendto(fd.get(), state, std::strlen(state), MSG_NOSIGNAL | MSG_DONTWAIT, reinterpret_cast<sockaddr*>(&address),
             static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length));
}

}  // namespace

void adoptActivatedSockets() {
    std::vector<std::string> names;
    const int count = passedSocketNames(names);
    if (count < 0) {
        LogWrite(kLogLevelError, "adoptActivatedSockets", "Cannot read the sockets passed by the service manager: %s",
                 std::strerror(-count));
        return;
    }
    std::lock_guard lock(gMutex);
    for (int i = 0; i < count; i++) {
        const int fd = kFirstPassedFd + i;
        const std::string& name = names[static_cast<size_t>(i)];
        if (!isKnownName(name)) {
            LogWrite(kLogLevelError, "adoptActivatedSockets",
                     "Refusing passed socket %d named \"%s\": the daemon listens only as \"vesseld\" and \"upcall\"",
                     fd, name);
            ::close(fd);
            continue;
        }
        if (!isListeningUnixStreamSocket(fd)) {
            LogWrite(kLogLevelError, "adoptActivatedSockets",
                     "Refusing passed socket %d named \"%s\": not a listening Unix stream socket; binding it here instead",
                     fd, name);
            ::close(fd);
            continue;
        }
        if (adopted().count(name)) {
            LogWrite(kLogLevelError, "adoptActivatedSockets", "Refusing a second passed socket named \"%s\"", name);
            ::close(fd);
            continue;
        }
        adopted()[name] = fd;
    }
}

UniqueFd takeActivatedSocket(const std::string& name) {
    std::lock_guard lock(gMutex);
    auto it = adopted().find(name);
    if (it == adopted().end()) return UniqueFd();
    UniqueFd fd(it->second);
    adopted().erase(it);
    return fd;
}

void notifyServiceReady() { notifyServiceManager("READY=1"); }

void notifyServiceStopping() { notifyServiceManager("STOPPING=1"); }

}  // namespace vsl
