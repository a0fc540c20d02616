#include "Platform/IpcEventLoop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>
#include <vector>

#include "Platform/Log.h"

namespace vsl {

namespace {

constexpr uint64_t kListenerKey = 0;
constexpr uint64_t kWakeKey = 1;

// Set while an I/O thread serves an event and has not yet counted itself idle again.
thread_local bool tBusy = false;

void armListener(int epollFd, int listenFd, int op) {
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = kListenerKey;
    ::epoll_ctl(epollFd, op, listenFd, &ev);
}

}  // namespace

IpcEventLoop::IpcEventLoop(IpcServerOptions options, int listenFd)
    : options_(std::move(options)), listenFd_(listenFd) {}

IpcEventLoop::~IpcEventLoop() {
    if (epollFd_ >= 0) ::close(epollFd_);
    if (wakeFd_ >= 0) ::close(wakeFd_);
    if (listenFd_ >= 0) ::close(listenFd_);
}

bool IpcEventLoop::start(std::string* error) {
    epollFd_ = ::epoll_create1(EPOLL_CLOEXEC);
    wakeFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (epollFd_ < 0 || wakeFd_ < 0) {
        if (error) *error = std::string("cannot create the event set: ") + std::strerror(errno);
        return false;
    }
    // Level-triggered and never read: once written, every waiting thread sees it.
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.u64 = kWakeKey;
    ::epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &ev);
    armListener(epollFd_, listenFd_, EPOLL_CTL_ADD);
    std::lock_guard lock(mutex_);
    spawnThreadLocked();
    return true;
}

void IpcEventLoop::spawnThreadLocked() {
    ++threads_;
    ++idle_;  // available from now on, or a burst would spawn one per event
    // Detached: an exiting thread only needs the loop, which it keeps alive.
    std::thread([self = shared_from_this()] { self->threadMain(); }).detach();
}

void IpcEventLoop::threadMain() {
    std::unique_lock lock(mutex_);
    while (!stopping_) {
        lock.unlock();
        epoll_event ev{};
        const int timeout = static_cast<int>(options_.ioThreadIdleTimeout.count());
        const int n = ::epoll_wait(epollFd_, &ev, 1, timeout);
        lock.lock();
        if (stopping_) break;
        if (n == 0) {
            if (threads_ > 1) break;  // idle and not the last one
            continue;
        }
        if (n < 0) continue;  // EINTR
        --idle_;
        tBusy = true;
        // Whatever this event leads to may block; someone must keep listening.
        if (idle_ == 0 && threads_ < options_.maxIoThreads) spawnThreadLocked();
        std::shared_ptr<IpcPeer> peer;
        if (ev.data.u64 != kListenerKey && ev.data.u64 != kWakeKey) {
            auto it = peers_.find(ev.data.u64);
            if (it != peers_.end()) peer = it->second;
        }
        lock.unlock();
        if (ev.data.u64 == kListenerKey) {
            acceptAll();
            willBeIdle();
            armListener(epollFd_, listenFd_, EPOLL_CTL_MOD);
        } else if (peer) {
            // Inline on this thread when the peer's queue is free.
            peer->queue()->sync([&] { peer->service(); });
        }
        peer.reset();
        lock.lock();
        if (tBusy) ++idle_;
        tBusy = false;
    }
    --idle_;
    --threads_;
    threadExited_.notify_all();
}

void IpcEventLoop::acceptAll() {
    for (;;) {
        const int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
        if (fd >= 0) {
            admit(fd);
            continue;
        }
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
            osLog(LogCategory::Ipc, OSLogLevel::Error, "accept failed: %s", std::strerror(errno));
            // Out of descriptors: back off instead of spinning on a ready listener.
            if (errno == EMFILE || errno == ENFILE) ::usleep(50 * 1000);
        }
        return;
    }
}

void IpcEventLoop::admit(int fd) {
    ucred cred{};
    socklen_t len = sizeof cred;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        ::close(fd);
        return;
    }
    auto token = AuditToken::forProcess(cred.pid, cred.uid, cred.gid);
    if (!token) {
        // Gone before we could name it: nobody is left to answer.
        ::close(fd);
        return;
    }
    std::string why;
    auto executable = processExecutablePath(*token, &why);
    if (!executable) {
        osLog(LogCategory::Ipc, OSLogLevel::Info, "peer pid %d has no known executable: %s",
              cred.pid, why);
    }
    IpcPeer::Credentials credentials{cred.pid, cred.uid, cred.gid, *token, executable.value_or("")};
    std::shared_ptr<IpcPeer> peer;
    {
        std::lock_guard lock(mutex_);
        if (stopping_) {
            ::close(fd);
            return;
        }
        const uint64_t serial = nextSerial_++;
        peer = std::make_shared<IpcPeer>(IpcPeer::Passkey{}, fd, serial, std::move(credentials),
                                         shared_from_this());
        peers_.emplace(serial, peer);
    }
    auto welcome = [peer, this] {
        if (options_.onConnection && !peer->isCancelled()) options_.onConnection(peer);
        peer->arm();
    };
    if (options_.connectionQueue) {
        options_.connectionQueue->async(std::move(welcome));
    } else {
        welcome();
    }
}

void IpcEventLoop::willBeIdle() {
    if (!tBusy) return;  // not an I/O thread, or already counted
    tBusy = false;
    std::lock_guard lock(mutex_);
    ++idle_;
}

void IpcEventLoop::forget(uint64_t serial) {
    std::shared_ptr<IpcPeer> dropped;  // released outside the lock
    std::lock_guard lock(mutex_);
    auto it = peers_.find(serial);
    if (it == peers_.end()) return;
    dropped = std::move(it->second);
    peers_.erase(it);
}

void IpcEventLoop::stop() {
    std::vector<std::shared_ptr<IpcPeer>> peers;
    {
        std::unique_lock lock(mutex_);
        stopping_ = true;
        const uint64_t one = 1;
        [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
        threadExited_.wait(lock, [&] { return threads_ == 0; });
        for (auto& [serial, peer] : peers_) peers.push_back(peer);
        // Clients still in the backlog learn at once that nobody will answer.
        ::close(listenFd_);
        listenFd_ = -1;
    }
    for (auto& peer : peers) peer->cancel();
    // A welcome already queued finds its peer cancelled; wait until it has looked.
    if (options_.connectionQueue && !options_.connectionQueue->isCurrent()) {
        options_.connectionQueue->sync([] {});
    }
    // Their disconnect handlers are queued behind any work still on their queues;
    // once these return, nothing of this server runs any more.
    for (auto& peer : peers) peer->queue()->sync([] {});
}

size_t IpcEventLoop::peerCount() const {
    std::lock_guard lock(mutex_);
    return peers_.size();
}

size_t IpcEventLoop::threadCount() const {
    std::lock_guard lock(mutex_);
    return threads_;
}

}  // namespace vsl
