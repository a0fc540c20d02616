#include "RootProbe.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <semaphore.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include <unistd.h>

#include "Platform/DirectoryEntries.h"
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

std::optional<pid_t> daemonPid(const std::string& socketPath) {
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
    std::string name = "/vesseld.fb_check";
    if (!systemRootIsSlash()) {
        unsigned char digest[EVP_MAX_MD_SIZE];
        unsigned int length = 0;
        const std::string& root = systemRoot();
        EVP_Digest(root.data(), root.size(), digest, &length, EVP_sha256(), nullptr);
        char hex[17];
        for (int i = 0; i < 8; i++) std::snprintf(hex + 2 * i, 3, "%02x", digest[i]);
        name += std::string("-") + hex;
    }
    sem_t* marker = ::sem_open(name.c_str(), 0);
    if (marker == SEM_FAILED) return false;
    ::sem_close(marker);
    return true;
}
