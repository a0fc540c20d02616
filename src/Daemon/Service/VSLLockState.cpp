#include "Daemon/Service/VSLLockState.h"

#include <cerrno>
#include <cstring>
#include <mutex>

#include "Daemon/Service/VSLStartup.h"
#include "Platform/Keybag.h"
#include "Platform/Log.h"
#include "Platform/Notification.h"
#include "Platform/WorkQueue.h"

namespace vsl {

namespace {

std::mutex gLockStateMutex;
int gStoredLockState = kKeybagUnlocked;

}  // namespace

void lock_state_notification_callback() {
    int state = keybagLockState();
    LogWrite(kLogLevelDebug, "lock_state_notification_callback", "LockState=%d", state);
    std::lock_guard<std::mutex> guard(gLockStateMutex);
    if (state == kKeybagLocked) {
        if (gStoredLockState != kKeybagLocked) lockStateQueue()->suspend();
        gStoredLockState = kKeybagLocked;
    } else if (state == kKeybagUnlocked) {
        if (gStoredLockState == kKeybagLocked) lockStateQueue()->resume();
        gStoredLockState = kKeybagUnlocked;
    }
}

int storedLockState() {
    std::lock_guard<std::mutex> guard(gLockStateMutex);
    return gStoredLockState;
}

void registerForLockStateNotifications() {
    uint64_t token = watchNotification(kKeybagLockStatusNotification, [] {
        WorkQueue::main()->async([] { lock_state_notification_callback(); });
    });
    if (!token) {
        int err = errno;
        LogWrite(kLogLevelError, "registerForLockStateNotifications",
                 "notify_register_dispatch for notification \"%s\" failed; returned %d\n",
                 kKeybagLockStatusNotification, err);
    }
    lock_state_notification_callback();
}

}  // namespace vsl
