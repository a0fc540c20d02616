// The device lock state. The keybag's state lives in run/vesseld/keybag/lockstate below
// the system root: "0" unlocked, "1" locked, missing = unlocked; anything else is a
// transition between the two. A change is announced with the notification
// "com.tarrow.keybag.lock-status" (Platform/Notification.h).
#pragma once

#include <string>

namespace vsl {

constexpr const char* kKeybagLockStatusNotification = "com.tarrow.keybag.lock-status";

constexpr int kKeybagUnlocked = 0;
constexpr int kKeybagLocked = 1;
constexpr int kKeybagTransition = 2;  // any other content of the state file

std::string keybagLockStatePath();
int keybagLockState();

// Writes the state file atomically and posts the notification (the operator's
// `vesselctl keybag lock|unlock`). Returns 0 or an errno value.
int setKeybagLockState(bool locked);

}  // namespace vsl
