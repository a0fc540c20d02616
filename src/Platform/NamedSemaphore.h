// POSIX named semaphores used as markers that live as long as the boot (in production
// they sit in /dev/shm, which a reboot empties).
#pragma once

#include <sys/types.h>

#include <string>

namespace vsl {

// `base` for the root "/", else `base` + "-" + the first 16 hex digits of the SHA-256
// of the root's real path, so daemons on different roots do not share a marker.
// The marker of first-boot work done, one per system root (semaphoreNameForSystemRoot).
inline constexpr const char* kFirstBootSemaphoreBase = "vesseld.fb_check";

std::string semaphoreNameForSystemRoot(const std::string& base, const std::string& root);

// Whether the semaphore exists (opened without creating, then closed).
bool semaphoreExists(const std::string& name);
// Creates it with `mode` and `value` unless it exists; 0 or an errno value.
int createSemaphore(const std::string& name, mode_t mode, unsigned value);
// 0 or an errno value; a missing semaphore is not an error.
int removeSemaphore(const std::string& name);

}  // namespace vsl
