#include "Platform/Notification.h"

#include <fcntl.h>

#include <cerrno>
#include <chrono>

#include "Platform/DurableIO.h"
#include "Platform/FileWatcher.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {


}  // namespace

std::string notificationDirectory() { return rootedPath("/run/vesseld/notify"); }

int postNotification(const std::string& name) {
    if (!isPlainPathComponent(name)) return EINVAL;
    UniqueFd dir;
    if (int rc = durable::makeDirectoryNoFollow(notificationDirectory(), 0755, true, dir.out())) return rc;
    // The content only has to change; watchers see the rename either way.
    std::string stamp =
        std::to_string(std::chrono::system_clock::now().time_since_epoch().count()) + "\n";
    return durable::writeFileAtomically(joinPath(notificationDirectory(), name), stamp.data(), stamp.size(), 0644);
}

uint64_t watchNotification(const std::string& name, std::function<void()> changed) {
    if (!isPlainPathComponent(name)) {
        errno = EINVAL;
        return 0;
    }
    return FileWatcher::shared().watch(notificationDirectory(), name, std::move(changed));
}

void unwatchNotification(uint64_t token) { FileWatcher::shared().unwatch(token); }

}  // namespace vsl
