#include "Platform/IpcEventLoop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <thread>
#include <vector>

#include "Platform/Log.h"

namespace vsl {

namespace {

using Clock = std::chrono::steady_clock;

constexpr uint64_t kListenerKey = 0;
constexpr uint64_t kWakeKey = 1;
constexpr uint64_t kTimerKey = 2;

// A refused uid, or the total, is reported at most this often, with a count.
constexpr auto kRefusalLogInterval = std::chrono::seconds(60);

// Set while an I/O thread serves an event and has not yet counted itself idle again.
thread_local bool tBusy = false;

void armOneShot(int epollFd, int fd, uint64_t key, int op) {
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = key;
    ::epoll_ctl(epollFd, op, fd, &ev);
}

// What the descriptor limit leaves for connections once handlers, the database,
// the logs and the tree walks have their share.
size_t connectionsTheDescriptorLimitAllows() {
    rlimit limit{};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == RLIM_INFINITY) return 1u << 20;
    const size_t soft = static_cast<size_t>(limit.rlim_cur);
    const size_t reserve = std::max<size_t>(64, soft / 4);
    return soft > reserve + 16 ? soft - reserve : 16;
}

// Tells the peer why before hanging up; a fresh socket always has room for this.
void refuse(int fd, const IpcFraming& framing, const std::string& reason) {
    if (auto frame = framing.encodeRefusal(reason)) {
        [[maybe_unused]] ssize_t n = ::send(fd, frame->data(), frame->size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    }
    ::close(fd);
}

IpcServerOptions withDefaultFraming(IpcServerOptions options) {
    if (!options.framing) options.framing = dictionaryFraming();
    return options;
}

}  // namespace

IpcEventLoop::IpcEventLoop(IpcServerOptions options, int listenFd)
    : options_(withDefaultFraming(std::move(options))), listenFd_(listenFd), ownUid_(::geteuid()) {}

IpcEventLoop::~IpcEventLoop() {
    if (epollFd_ >= 0) ::close(epollFd_);
    if (wakeFd_ >= 0) ::close(wakeFd_);
    if (timerFd_ >= 0) ::close(timerFd_);
    if (listenFd_ >= 0) ::close(listenFd_);
}

bool IpcEventLoop::start(std::string* error) {
    const size_t allowed = connectionsTheDescriptorLimitAllows();
    maxConnections_ = options_.maxConnections ? std::min(options_.maxConnections, allowed) : allowed;
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
    armOneShot(epollFd_, listenFd_, kListenerKey, EPOLL_CTL_ADD);
    if (options_.idleConnectionTimeout.count() > 0) {
        timerFd_ = ::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC);
        if (timerFd_ < 0) {
            if (error) *error = std::string("cannot create the idle timer: ") + std::strerror(errno);
            return false;
        }
        // A connection is closed between one and one and a quarter timeouts after its last use.
        const auto period = std::max(options_.idleConnectionTimeout / 4, std::chrono::milliseconds(10));
        const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(period).count();
        itimerspec spec{};
        spec.it_interval.tv_sec = spec.it_value.tv_sec = static_cast<time_t>(ns / 1000000000);
        spec.it_interval.tv_nsec = spec.it_value.tv_nsec = static_cast<long>(ns % 1000000000);
        ::timerfd_settime(timerFd_, 0, &spec, nullptr);
        armOneShot(epollFd_, timerFd_, kTimerKey, EPOLL_CTL_ADD);
    }
    std::lock_guard lock(mutex_);
    if (!spawnThreadLocked()) {
        if (error) *error = "cannot start an I/O thread";
        return false;
    }
    return true;
}

bool IpcEventLoop::spawnThreadLocked() {
    if (threads_ >= std::max<size_t>(options_.maxIoThreads, 1)) return false;
    try {
        // Detached: an exiting thread only needs the loop, which it keeps alive. It
        // waits for the lock held here before it looks at the counts.
        std::thread([self = shared_from_this()] { self->threadMain(); }).detach();
    } catch (const std::system_error& e) {
        osLog(LogCategory::Ipc, OSLogLevel::Error, "cannot start an I/O thread: %s", e.what());
        return false;
    }
    ++threads_;
    ++idle_;  // available from now on, or a burst would spawn one per event
    return true;
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
            if (idle_ > 1) break;  // another thread still waits for events
            continue;
        }
        if (n < 0) continue;  // EINTR
        --idle_;
        tBusy = true;
        // Whatever this event leads to may block; someone must keep listening. When no
        // thread can be added, the peer's work goes to its queue and this one stays.
        const bool handOff = idle_ == 0 && !spawnThreadLocked();
        // A copy: epoll_event is packed, so its key may not be aligned for a reference.
        const uint64_t key = ev.data.u64;
        std::shared_ptr<IpcPeer> peer;
        if (key != kListenerKey && key != kWakeKey && key != kTimerKey) {
            auto it = peers_.find(key);
            if (it != peers_.end()) peer = it->second;
        }
        lock.unlock();
        if (key == kListenerKey) {
            acceptAll();
            willBeIdle();
            armOneShot(epollFd_, listenFd_, kListenerKey, EPOLL_CTL_MOD);
        } else if (key == kTimerKey) {
            uint64_t expirations = 0;
            [[maybe_unused]] ssize_t r = ::read(timerFd_, &expirations, sizeof expirations);
            closeIdlePeers();
            willBeIdle();
            armOneShot(epollFd_, timerFd_, kTimerKey, EPOLL_CTL_MOD);
        } else if (peer && handOff) {
            peer->queue()->async([peer] {
                if (peer->service()) peer->arm();
            });
        } else if (peer) {
            // Inline on this thread when the peer's queue is free.
            bool open = false;
            peer->queue()->sync([&] { open = peer->service(); });
            if (open) peer->arm();
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

std::optional<std::string> IpcEventLoop::reserveLocked(uid_t uid) {
    const bool privileged = uid == 0 || uid == ownUid_;
    const size_t cap = privileged ? options_.maxConnectionsPrivileged : options_.maxConnectionsPerUid;
    const auto now = Clock::now();
    auto it = perUid_.find(uid);
    const size_t open = it == perUid_.end() ? 0 : it->second.open;
    if (cap != 0 && open >= cap) {
        UidConnections& entry = it->second;
        ++entry.refusedSinceLog;
        if (now - entry.lastRefusalLog >= kRefusalLogInterval) {
            LogWrite(kLogLevelError, "IpcEventLoop::admit",
                     "Connection limit reached for uid %u: %llu open (limit %llu); refused %llu connection(s)", uid,
                     static_cast<unsigned long long>(open), static_cast<unsigned long long>(cap),
                     static_cast<unsigned long long>(entry.refusedSinceLog));
            entry.lastRefusalLog = now;
            entry.refusedSinceLog = 0;
        }
        return "too many connections from uid " + std::to_string(uid) + " (limit " + std::to_string(cap) + ")";
    }
    if (open_ >= maxConnections_) {
        ++totalRefusedSinceLog_;
        if (now - lastTotalRefusalLog_ >= kRefusalLogInterval) {
            LogWrite(kLogLevelError, "IpcEventLoop::admit",
                     "Connection limit reached: %llu open (limit %llu); refused %llu connection(s)",
                     static_cast<unsigned long long>(open_), static_cast<unsigned long long>(maxConnections_),
                     static_cast<unsigned long long>(totalRefusedSinceLog_));
            lastTotalRefusalLog_ = now;
            totalRefusedSinceLog_ = 0;
        }
        return "too many connections to the daemon (limit " + std::to_string(maxConnections_) + ")";
    }
    ++perUid_[uid].open;
    ++open_;
    return std::nullopt;
}

void IpcEventLoop::releaseLocked(uid_t uid) {
    auto it = perUid_.find(uid);
    if (it == perUid_.end()) return;
    --open_;
    if (--it->second.open == 0) perUid_.erase(it);
}

void IpcEventLoop::admit(int fd) {
    ucred cred{};
    socklen_t len = sizeof cred;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        ::close(fd);
        return;
    }
    // Counted before any work is spent on the caller, so a flood costs little.
    std::optional<std::string> refusal;
    {
        std::lock_guard lock(mutex_);
        if (stopping_) {
            ::close(fd);
            return;
        }
        refusal = reserveLocked(cred.uid);
    }
    if (refusal) {
        refuse(fd, *options_.framing, *refusal);
        return;
    }
    auto giveBack = [&] {
        std::lock_guard lock(mutex_);
        releaseLocked(cred.uid);
    };
    auto token = AuditToken::forProcess(cred.pid, cred.uid, cred.gid);
    if (!token) {
        // Gone before we could name it: nobody is left to answer.
        giveBack();
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
            releaseLocked(cred.uid);
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

void IpcEventLoop::closeIdlePeers() {
    std::vector<std::shared_ptr<IpcPeer>> peers;
    {
        std::lock_guard lock(mutex_);
        peers.reserve(peers_.size());
        for (auto& [serial, peer] : peers_) peers.push_back(peer);
    }
    const auto cutoff = Clock::now() - options_.idleConnectionTimeout;
    for (auto& peer : peers) peer->closeIfIdleSince(cutoff);
}

void IpcEventLoop::willBeIdle() {
    if (!tBusy) return;  // not an I/O thread, or already counted
    tBusy = false;
    std::lock_guard lock(mutex_);
    ++idle_;
}

void IpcEventLoop::closed(const std::shared_ptr<IpcPeer>& peer) {
    if (options_.onDisconnect) {
        // The peer keeps the loop, and so these options, alive.
        disconnects_->async(peer->queue(), [peer] { peer->loop_->options().onDisconnect(peer); });
    }
    std::shared_ptr<IpcPeer> dropped;  // released outside the lock
    std::lock_guard lock(mutex_);
    auto it = peers_.find(peer->serial());
    if (it == peers_.end()) return;
    dropped = std::move(it->second);
    peers_.erase(it);
    releaseLocked(dropped->uid());
}

namespace {

// What is left of a deadline, for waits that take a timeout.
std::optional<std::chrono::milliseconds> timeLeft(std::optional<Clock::time_point> deadline) {
    if (!deadline) return std::nullopt;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - Clock::now());
    return std::max(left, std::chrono::milliseconds(0));
}

// Waits for the work already on queue; false when the deadline came first.
bool drained(const std::shared_ptr<WorkQueue>& queue, std::optional<Clock::time_point> deadline) {
    auto group = WorkGroup::create();
    group->async(queue, [] {});
    return group->wait(timeLeft(deadline));
}

}  // namespace

bool IpcEventLoop::stop(std::optional<Clock::time_point> deadline) {
    std::vector<std::shared_ptr<IpcPeer>> peers;
    bool threadsGone = true;
    {
        std::unique_lock lock(mutex_);
        stopping_ = true;
        const uint64_t one = 1;
        [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
        auto gone = [&] { return threads_ == 0; };
        if (deadline) {
            threadsGone = threadExited_.wait_until(lock, *deadline, gone);
        } else {
            threadExited_.wait(lock, gone);
        }
        for (auto& [serial, peer] : peers_) peers.push_back(peer);
        // Clients still in the backlog learn at once that nobody will answer. A thread
        // still busy may yet touch the listener: then the destructor closes it.
        if (threadsGone) {
            ::close(listenFd_);
            listenFd_ = -1;
        }
    }
    for (auto& peer : peers) peer->cancel();
    // A welcome already queued finds its peer cancelled; wait until it has looked.
    bool queuesDone = true;
    if (options_.connectionQueue && !options_.connectionQueue->isCurrent()) {
        queuesDone = drained(options_.connectionQueue, deadline);
    }
    // Their disconnect handlers are queued behind any work still on their queues;
    // once these return, nothing of this server runs any more.
    for (auto& peer : peers) {
        if (!queuesDone) break;
        queuesDone = drained(peer->queue(), deadline);
    }
    if (queuesDone) queuesDone = disconnects_->wait(timeLeft(deadline));
    return threadsGone && queuesDone;
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
