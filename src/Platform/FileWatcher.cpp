#include "Platform/FileWatcher.h"

#include <poll.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <thread>
#include <vector>

#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

// One mask for every watch: the kernel keeps one mask per inode, and a directory
// may be watched both for itself and as the parent of a missing one.
constexpr uint32_t kMask = IN_CLOSE_WRITE | IN_ATTRIB | IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_DELETE_SELF |
                           IN_MOVE_SELF | IN_ONLYDIR;

struct Watch {
    std::string directory;
    std::string name;
    FileWatcher::Callback changed;
    int directoryWd = -1;
    int parentWd = -1;  // while the directory is missing
};

}  // namespace

struct FileWatcher::State {
    std::mutex mutex;
    std::condition_variable idle;
    UniqueFd fd;
    std::thread::id threadId;
    bool started = false;
    bool busy = false;  // between reading a batch and finishing its callbacks
    uint64_t running = 0;  // the token whose callback runs now
    uint64_t nextToken = 1;
    std::map<uint64_t, Watch> watches;

    // Under mutex. Watches the directory, or its parent while it is missing.
    bool arm(Watch& w) {
        w.directoryWd = ::inotify_add_watch(fd.get(), w.directory.c_str(), kMask);
        if (w.directoryWd >= 0) {
            dropParent(w);
            return true;
        }
        if (errno != ENOENT) return false;
        if (w.parentWd < 0) w.parentWd = ::inotify_add_watch(fd.get(), parentPath(w.directory).c_str(), kMask);
        if (w.parentWd < 0) return false;
        // Made between the two calls?
        w.directoryWd = ::inotify_add_watch(fd.get(), w.directory.c_str(), kMask);
        if (w.directoryWd >= 0) dropParent(w);
        return true;
    }

    void dropParent(Watch& w) {
        int wd = std::exchange(w.parentWd, -1);
        if (wd >= 0 && !inUse(wd)) ::inotify_rm_watch(fd.get(), wd);
    }

    bool inUse(int wd) const {
        for (const auto& [token, w] : watches)
            if (w.directoryWd == wd || w.parentWd == wd) return true;
        return false;
    }

    // Under mutex: the tokens whose callbacks one event calls for.
    void match(const inotify_event& ev, std::vector<uint64_t>* fire) {
        const std::string name = ev.len ? ev.name : "";
        for (auto& [token, w] : watches) {
            bool hit = false;
            if (ev.mask & IN_Q_OVERFLOW) {
                hit = true;
                if (w.directoryWd < 0) arm(w);
            } else if (ev.wd == w.directoryWd) {
                if (ev.mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                    // Gone or replaced: watch whatever takes its place.
                    if (!(ev.mask & IN_IGNORED)) ::inotify_rm_watch(fd.get(), w.directoryWd);
                    w.directoryWd = -1;
                    arm(w);
                    hit = true;
                } else {
                    hit = w.name.empty() || name == w.name;
                }
            } else if (ev.wd == w.parentWd && w.directoryWd < 0 && name == lastPathComponent(w.directory)) {
                arm(w);
                hit = w.directoryWd >= 0;  // its entries may predate the watch
            }
            if (hit && (fire->empty() || fire->back() != token)) fire->push_back(token);
        }
    }

    void run() {
        alignas(inotify_event) char buffer[8192];
        pollfd pfd{fd.get(), POLLIN, 0};
        for (;;) {
            if (::poll(&pfd, 1, -1) < 0 && errno != EINTR) return;
            std::vector<uint64_t> fire;
            {
                std::lock_guard g(mutex);
                busy = true;
                for (;;) {
                    ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
                    if (n <= 0) break;
                    for (char* p = buffer; p < buffer + n;) {
                        const auto* ev = reinterpret_cast<const inotify_event*>(p);
                        p += sizeof(inotify_event) + ev->len;
                        match(*ev, &fire);
                    }
                }
            }
            for (uint64_t token : fire) {
                Callback call;
                {
                    std::lock_guard g(mutex);
                    auto found = watches.find(token);
                    if (found == watches.end()) continue;  // unwatched meanwhile
                    call = found->second.changed;
                    running = token;
                }
                call();
                std::lock_guard g(mutex);
                running = 0;
                idle.notify_all();
            }
            std::lock_guard g(mutex);
            busy = false;
            idle.notify_all();
        }
    }
};

FileWatcher& FileWatcher::shared() {
    static FileWatcher* watcher = new FileWatcher();
    return *watcher;
}

FileWatcher::FileWatcher() : state_(new State()) {}

uint64_t FileWatcher::watch(const std::string& directory, const std::string& name, Callback changed) {
    State& s = *state_;
    std::lock_guard g(s.mutex);
    if (!s.fd) {
        s.fd.reset(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
        if (!s.fd) return 0;
    }
    Watch w{directory, name, std::move(changed)};
    if (!s.arm(w)) {
        int err = errno;
        s.dropParent(w);
        errno = err;
        return 0;
    }
    uint64_t token = s.nextToken++;
    s.watches.emplace(token, std::move(w));
    if (!s.started) {
        s.started = true;
        std::thread t([&s] { s.run(); });
        s.threadId = t.get_id();
        t.detach();
    }
    return token;
}

void FileWatcher::unwatch(uint64_t token) {
    State& s = *state_;
    Callback released;  // destroyed outside the lock: it may own what calls back in here
    {
        std::unique_lock g(s.mutex);
        if (std::this_thread::get_id() != s.threadId) s.idle.wait(g, [&] { return s.running != token; });
        auto found = s.watches.find(token);
        if (found == s.watches.end()) return;
        Watch w = std::move(found->second);
        s.watches.erase(found);
        released = std::move(w.changed);
        for (int wd : {w.directoryWd, w.parentWd})
            if (wd >= 0 && !s.inUse(wd)) ::inotify_rm_watch(s.fd.get(), wd);
    }
}

void FileWatcher::sync() {
    State& s = *state_;
    std::unique_lock g(s.mutex);
    if (!s.started || std::this_thread::get_id() == s.threadId) return;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(1);
    for (;;) {
        int queued = 0;
        if (::ioctl(s.fd.get(), FIONREAD, &queued) != 0) return;
        if (queued == 0 && !s.busy) return;
        if (s.idle.wait_until(g, deadline) == std::cv_status::timeout) return;
    }
}

}  // namespace vsl
