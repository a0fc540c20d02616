#include "Platform/ProtectionClass.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <string_view>

#include "Platform/DurableIO.h"
#include "Platform/Keybag.h"
#include "Platform/SystemRoot.h"

namespace vsl {

const char* protectionClassAttributeName() {
    // trusted.* needs CAP_SYS_ADMIN; decided once, the daemon does not change identity.
    static const char* const name =
        ::geteuid() == 0 ? "trusted.vessel.protection-class" : "user.vessel.protection-class";
    return name;
}

int getProtectionClass(int fd, int* protectionClass) {
    char buf[16];
    ssize_t n = ::fgetxattr(fd, protectionClassAttributeName(), buf, sizeof buf);
    // An O_PATH descriptor reads no attributes itself; its /proc name reaches the same inode.
    if (n < 0 && errno == EBADF)
        n = ::getxattr(durable::descriptorPath(fd).c_str(), protectionClassAttributeName(), buf, sizeof buf);
    if (n < 0) {
        if (errno != ENODATA) return errno;
        *protectionClass = kProtectionClassNone;
        return 0;
    }
    int value = 0;
    auto [end, ec] = std::from_chars(buf, buf + n, value);
    if (ec != std::errc() || end != buf + n) return EINVAL;
    *protectionClass = value;
    return 0;
}

int setProtectionClass(int fd, const std::string& path, int protectionClass) {
    int current = kProtectionClassNone;
    if (int rc = getProtectionClass(fd, &current)) return rc;
    if (current == protectionClass) return 0;
    if ((current == kProtectionClassComplete || protectionClass == kProtectionClassComplete) && keybagLockState() == kKeybagLocked)
        return EPERM;
    std::string text = std::to_string(protectionClass);
    return durable::setXattr(fd, path, protectionClassAttributeName(), text.data(), text.size());
}

}  // namespace vsl
