// Following the device lock state: the lock-state queue is suspended while the device
// is locked, so protection-class retries parked on it run only after an unlock.
#pragma once

namespace vsl {

// Reads the keybag state and suspends or resumes the lock-state queue: suspended at
// most once at a time; a transition state changes nothing. Runs on the main queue
// (and once at start-up).
void lock_state_notification_callback();

// The last state acted upon: 1 locked, 0 unlocked.
int storedLockState();

// Delivers lock-status notifications to the callback on the main queue, then acts on
// the current state once.
void registerForLockStateNotifications();

}  // namespace vsl
