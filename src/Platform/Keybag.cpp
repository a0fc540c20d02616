#include "Platform/Keybag.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "Platform/DurableIO.h"
#include "Platform/Notification.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

std::string keybagLockStatePath() { return rootedPath("/run/vesseld/keybag/lockstate"); }

int keybagLockState() {
    UniqueFd fd(::open(keybagLockStatePath().c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    if (fd.get() < 0) return errno == ENOENT ? kKeybagUnlocked : kKeybagTransition;
    char buf[8];
    ssize_t n = ::read(fd.get(), buf, sizeof buf);
    if (n > 0 && buf[n - 1] == '\n') n--;
    if (n == 1 && buf[0] == '0') return kKeybagUnlocked;
    if (n == 1 && buf[0] == '1') return kKeybagLocked;
    return kKeybagTransition;
}

int setKeybagLockState(bool locked) {
    std::string path = keybagLockStatePath();
    UniqueFd dir;
    if (int rc = durable::makeDirectoryNoFollow(parentPath(path), 0755, true, dir.out())) return rc;
    const char* text = locked ? "1\n" : "0\n";
    if (int rc = durable::writeFileAtomically(path, text, 2, 0644)) return rc;
    return postNotification(kKeybagLockStatusNotification);
}

}  // namespace vsl
