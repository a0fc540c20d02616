// Waiting for the daemon's notifications, so scripts and tests follow its start-up
// clean-ups without sleeping.
#pragma once

#include <chrono>
#include <string>

namespace vsl::client {

// Posted when the clean-up run at every start is done (staging emptied, death row
// destroyed). Withdrawn at each start before the first client is served.
inline constexpr const char* kCleanupCompleteNotification = "com.tarrow.vesseld.cleanup-complete";
// Posted when the first start since boot has finished its boot clean-up; stays posted
// until the next boot.
inline constexpr const char* kRebootCleanupCompleteNotification = "com.tarrow.vesseld.reboot-cleanup-complete";

// True once the daemon of the system root `root` ("/" in production) has posted
// `name`, also when it did so before the call; false after `timeout`.
bool waitForNotification(const std::string& root, const std::string& name, std::chrono::milliseconds timeout);

}  // namespace vsl::client
