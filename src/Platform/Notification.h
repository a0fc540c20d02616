// Named notifications: a file run/vesseld/notify/<name> below the system root. Posting
// rewrites it atomically; watchers learn of it through the process's one file watcher.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

namespace vsl {

std::string notificationDirectory();  // run/vesseld/notify below the root

// A name must be one plain path component. Returns 0 or an errno value.
int postNotification(const std::string& name);

// `changed` runs on the file watcher's thread; keep it short (hand the work to a
// queue). Returns the watch token (0 with errno on failure).
uint64_t watchNotification(const std::string& name, std::function<void()> changed);
void unwatchNotification(uint64_t token);

// A posted notification stays posted (its file exists) until withdrawn: waiters that
// come late still see it. Returns 0 or an errno value; withdrawing what was never
// posted is not an error.
int withdrawNotification(const std::string& name);

// True once `name` is posted in `directory` (a notification directory of any root),
// false when `timeout` passes first.
bool waitForNotificationIn(const std::string& directory, const std::string& name,
                           std::chrono::milliseconds timeout);

}  // namespace vsl
