#include "RootProbe.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include <unistd.h>

#include "Platform/DirectoryEntries.h"
#include "Platform/NamedSemaphore.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

using namespace vsl;

namespace {

// 0 when connected, else the errno of connect(2).
int connectTo(const std::string& socketPath, UniqueFd* fd) {
    sockaddr_un address{};
    if (socketPath.size() >= sizeof(address.sun_path)) return ENAMETOOLONG;
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
    UniqueFd s(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!s) return errno;
    if (::connect(s.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0) return errno;
    *fd = std::move(s);
    return 0;
}

}  // namespace

namespace {

// The holder of the lock the serving daemon keeps on "<socket>.lock", from /proc/locks:
// right also when the listening socket was made by another process and handed over.
std::optional<pid_t> lockHolder(const std::string& lockPath) {
    struct stat st;
    if (::stat(lockPath.c_str(), &st) != 0) return std::nullopt;
    char device[64];
    std::snprintf(device, sizeof device, "%02x:%02x:%llu", major(st.st_dev), minor(st.st_dev),
                  (unsigned long long)st.st_ino);
    FILE* locks = std::fopen("/proc/locks", "re");
    if (!locks) return std::nullopt;
    std::optional<pid_t> holder;
    char line[512];
    while (!holder && std::fgets(line, sizeof line, locks)) {
        char type[32], kind[32], mode[32], where[64];
        long pid = 0;
        if (std::sscanf(line, "%*s %31s %31s %31s %ld %63s", type, kind, mode, &pid, where) == 5 &&
            std::strcmp(type, "FLOCK") == 0 && std::strcmp(where, device) == 0 && pid > 0)
            holder = static_cast<pid_t>(pid);
    }
    std::fclose(locks);
    return holder;
}

}  // namespace

std::optional<pid_t> daemonPid(const std::string& socketPath) {
    if (auto holder = lockHolder(socketPath + ".lock")) return holder;
    UniqueFd fd;
    if (connectTo(socketPath, &fd) != 0) return std::nullopt;
    ucred credentials{};
    socklen_t length = sizeof(credentials);
    if (::getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) return std::nullopt;
    return credentials.pid;
}

bool socketIsStale(const std::string& socketPath) {
    struct stat st;
    if (::lstat(socketPath.c_str(), &st) != 0) return false;
    UniqueFd fd;
    return connectTo(socketPath, &fd) == ECONNREFUSED;
}

long entryCount(const std::string& absolute) {
    UniqueFd dir(::open(rootedPath(absolute).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
    if (!dir) return errno == ENOENT ? 0 : -1;
    std::vector<DirectoryEntry> entries;
    if (readDirectoryEntries(dir.get(), &entries) != 0) return -1;
    return static_cast<long>(entries.size());
}

std::optional<Value> readPropertyListFile(const std::string& path, std::string* error) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        *error = std::strerror(errno);
        return std::nullopt;
    }
    std::string bytes;
    char buffer[65536];
    for (ssize_t n; (n = ::read(fd.get(), buffer, sizeof(buffer))) != 0;) {
        if (n < 0) {
            if (errno == EINTR) continue;
            *error = std::strerror(errno);
            return std::nullopt;
        }
        bytes.append(buffer, static_cast<size_t>(n));
    }
    return decodePropertyList(bytes.data(), bytes.size(), error);
}

bool firstBootWorkDone() {
    // The daemon's own naming, so a root's marker is found whatever path names the root.
    return semaphoreExists(semaphoreNameForSystemRoot(kFirstBootSemaphoreBase, systemRoot()));
}
