#include "Platform/Notification.h"

#include <fcntl.h>

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>

#include "Platform/DurableIO.h"
#include "Platform/FileWatcher.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Platform/Value.h"

namespace vsl {

std::string notificationDirectory() { return rootedPath("/run/vesseld/notify"); }

int postNotification(const std::string& name) {
    if (!isPlainPathComponent(name)) return EINVAL;
    UniqueFd dir;
    if (int rc = durable::makeDirectoryNoFollow(notificationDirectory(), 0755, true, dir.out())) return rc;
    // The content only has to change; watchers see the rename either way. Nothing
    // under run/ outlives a reboot, so the rename is not synced: it is the post's last
    // step, and a waiter that sees the notification sees a finished post.
    std::string stamp =
        std::to_string(std::chrono::system_clock::now().time_since_epoch().count()) + "\n";
    const std::string path = joinPath(notificationDirectory(), name);
    const std::string temp = joinPath(notificationDirectory(), "." + name + ".tmp-" + Uuid::random().string());
    int rc = durable::writeFile(temp, stamp.data(), stamp.size(), 0644);
    if (rc == 0) rc = durable::renamePath(temp, path);
    if (rc != 0) ::unlink(temp.c_str());
    return rc;
}

uint64_t watchNotification(const std::string& name, std::function<void()> changed) {
    if (!isPlainPathComponent(name)) {
        errno = EINVAL;
        return 0;
    }
    // After a reboot nothing has posted yet and the directory is gone; a watch on a
    // missing directory would never fire.
    UniqueFd dir;
    if (int rc = durable::makeDirectoryNoFollow(notificationDirectory(), 0755, true, dir.out())) {
        errno = rc;
        return 0;
    }
    return FileWatcher::shared().watch(notificationDirectory(), name, std::move(changed));
}

void unwatchNotification(uint64_t token) { FileWatcher::shared().unwatch(token); }

int withdrawNotification(const std::string& name) {
    if (!isPlainPathComponent(name)) return EINVAL;
    int rc = durable::removeFile(joinPath(notificationDirectory(), name));
    return rc == ENOENT ? 0 : rc;
}

bool waitForNotificationIn(const std::string& directory, const std::string& name,
                           std::chrono::milliseconds timeout) {
    if (!isPlainPathComponent(name)) return false;
    const std::string path = joinPath(directory, name);
    auto posted = [&] { return ::access(path.c_str(), F_OK) == 0; };
    struct Signal {
        std::mutex mutex;
        std::condition_variable changed;
        uint64_t events = 0;
    };
    auto signal = std::make_shared<Signal>();
    uint64_t token = FileWatcher::shared().watch(directory, name, [signal] {
        std::lock_guard<std::mutex> g(signal->mutex);
        signal->events++;
        signal->changed.notify_all();
    });
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    bool found = posted();
    while (!found && std::chrono::steady_clock::now() < deadline) {
        std::unique_lock<std::mutex> lock(signal->mutex);
        uint64_t seen = signal->events;
        // The watch is the fast path; the periodic look covers a directory that could
        // not be watched and a change the watcher has not delivered yet.
        auto slice = std::min(deadline, std::chrono::steady_clock::now() + std::chrono::milliseconds(200));
        signal->changed.wait_until(lock, slice, [&] { return signal->events != seen; });
        lock.unlock();
        found = posted();
    }
    if (token) FileWatcher::shared().unwatch(token);
    return found;
}

}  // namespace vsl
