#include "Platform/ServiceManager.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>

#include <systemd/sd-daemon.h>

#include "Platform/Log.h"

namespace vsl {

namespace {

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

}  // namespace

void adoptActivatedSockets() {
    char** names = nullptr;
    // The variables are dropped so that no child takes these sockets for its own.
    const int count = sd_listen_fds_with_names(1, &names);
    if (count < 0) {
        LogWrite(kLogLevelError, "adoptActivatedSockets", "Cannot read the sockets passed by the service manager: %s",
                 std::strerror(-count));
        return;
    }
    std::lock_guard lock(gMutex);
    for (int i = 0; i < count; i++) {
        const int fd = SD_LISTEN_FDS_START + i;
        const std::string name = names && names[i] ? names[i] : "unknown";
        if (names) std::free(names[i]);
        if (!isKnownName(name)) {
            LogWrite(kLogLevelError, "adoptActivatedSockets",
                     "Refusing passed socket %d named \"%s\": the daemon listens only as \"vesseld\" and \"upcall\"",
                     fd, name);
            ::close(fd);
            continue;
        }
        if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0) {
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
    std::free(names);
}

UniqueFd takeActivatedSocket(const std::string& name) {
    std::lock_guard lock(gMutex);
    auto it = adopted().find(name);
    if (it == adopted().end()) return UniqueFd();
    UniqueFd fd(it->second);
    adopted().erase(it);
    return fd;
}

void notifyServiceReady() { sd_notify(0, "READY=1"); }

void notifyServiceStopping() { sd_notify(0, "STOPPING=1"); }

}  // namespace vsl
