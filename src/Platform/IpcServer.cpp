#include "Platform/IpcServer.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Platform/IpcEventLoop.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

std::unique_ptr<IpcServer> failWith(std::string* error, std::string text) {
    if (error) *error = std::move(text);
    return nullptr;
}

bool fillAddress(const std::string& path, sockaddr_un& addr) {
    addr = {};
    addr.sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof addr.sun_path) return false;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    return true;
}

void makeDirectories(const std::string& dir) {
    if (dir.empty() || dir == "/") return;
    struct stat st;
    if (::stat(dir.c_str(), &st) == 0) return;
    makeDirectories(parentPath(dir));
    ::mkdir(dir.c_str(), 0755);
}

// Whether a server accepts connections on the path right now.
bool someoneAnswers(const sockaddr_un& addr) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return false;
    const bool answers = ::connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0;
    ::close(fd);
    return answers;
}

// The lock beside a socket, held for as long as its process serves: -1 with errno set
// when it cannot be opened, or EWOULDBLOCK when another process holds it.
int takeServerLock(const std::string& lockPath) {
    const int fd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (fd < 0) return -1;
    if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
        const int err = errno;
        ::close(fd);
        errno = err;
        return -1;
    }
    return fd;
}

}  // namespace

std::string defaultIpcServicePath() { return rootedPath("run/vesseld/com.tarrow.vesseld"); }

std::unique_ptr<IpcServer> IpcServer::start(IpcServerOptions options, std::string* error) {
    if (options.listenFd >= 0) {
        const int fd = options.listenFd;
        options.listenFd = -1;
        ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
        ::fcntl(fd, F_SETFD, FD_CLOEXEC);
        // The service manager owns the socket file; the lock still names the serving
        // process to whoever asks (vesselctl status reads its holder).
        const int lockFd = options.path.empty() ? -1 : takeServerLock(options.path + ".lock");
        auto loop = std::make_shared<IpcEventLoop>(std::move(options), fd);
        if (!loop->start(error)) {
            if (lockFd >= 0) ::close(lockFd);
            return nullptr;
        }
        return std::unique_ptr<IpcServer>(new IpcServer(std::move(loop), "", lockFd));
    }

    const std::string path = options.path;
    sockaddr_un addr;
    if (!fillAddress(path, addr)) return failWith(error, "unusable socket path \"" + path + "\"");
    makeDirectories(parentPath(path));

    // The lock decides between two servers starting at once; the probe below
    // still catches a server that does not take it.
    const std::string lockPath = path + ".lock";
    const int lockFd = takeServerLock(lockPath);
    if (lockFd < 0) {
        const int err = errno;
        if (err == EWOULDBLOCK) return failWith(error, "another server is running on " + path);
        return failWith(error, "cannot open " + lockPath + ": " + std::strerror(err));
    }
    auto giveUp = [&](std::string text) {
        ::close(lockFd);
        return failWith(error, std::move(text));
    };

    struct stat st;
    if (::lstat(path.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) return giveUp(path + " exists and is not a socket");
        if (someoneAnswers(addr)) return giveUp("another server answers on " + path);
        osLog(LogCategory::Ipc, OSLogLevel::Default, "replacing stale socket %s", path);
        ::unlink(path.c_str());
    }

    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) return giveUp(std::string("socket: ") + std::strerror(errno));
    if (::bind(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0 ||
        ::chmod(path.c_str(), options.socketMode) != 0 || ::listen(fd, SOMAXCONN) != 0 ||
        ::stat(path.c_str(), &st) != 0) {
        const std::string text = "cannot listen on " + path + ": " + std::strerror(errno);
        ::close(fd);
        return giveUp(text);
    }
    auto loop = std::make_shared<IpcEventLoop>(std::move(options), fd);
    if (!loop->start(error)) {
        ::unlink(path.c_str());
        ::close(lockFd);
        return nullptr;
    }
    std::unique_ptr<IpcServer> server(new IpcServer(std::move(loop), path, lockFd));
    server->socketDev_ = st.st_dev;
    server->socketIno_ = st.st_ino;
    return server;
}

IpcServer::IpcServer(std::shared_ptr<IpcEventLoop> loop, std::string path, int lockFd)
    : loop_(std::move(loop)), path_(std::move(path)), lockFd_(lockFd) {}

IpcServer::~IpcServer() { stop(); }

bool IpcServer::stop(std::optional<std::chrono::milliseconds> grace) {
    std::lock_guard lock(stopMutex_);
    if (stopped_) return true;
    stopped_ = true;
    std::optional<std::chrono::steady_clock::time_point> deadline;
    if (grace) deadline = std::chrono::steady_clock::now() + *grace;
    // First the name goes (only while it is still ours), so that no client reaches a
    // server that is stopping; the next server gets in once the loop has stopped.
    struct stat st;
    if (!path_.empty() && ::lstat(path_.c_str(), &st) == 0 && st.st_dev == socketDev_ &&
        st.st_ino == socketIno_) {
        ::unlink(path_.c_str());
    }
    const bool finished = loop_->stop(deadline);
    if (lockFd_ >= 0) ::close(lockFd_);
    lockFd_ = -1;
    return finished;
}

size_t IpcServer::peerCount() const { return loop_->peerCount(); }

size_t IpcServer::ioThreadCount() const { return loop_->threadCount(); }

size_t IpcServer::connectionLimit() const { return loop_->connectionLimit(); }

}  // namespace vsl
