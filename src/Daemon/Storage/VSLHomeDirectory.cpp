#include "Daemon/Storage/VSLHomeDirectory.h"

#include <climits>
#include <cstdlib>

#include "Platform/Log.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/SystemRoot.h"

namespace vsl {

std::string homeDirectoryURLForPOSIXUID(uid_t uid) {
    static const char* const fn = "+[VSLFileManager homeDirectoryURLForPOSIXUID:]";
    auto entry = passwordEntryForUID(uid);
    if (!entry) {
        LogWrite(kLogLevelError, fn, "Failed to getpwuid for uid: %u", uid);
    } else {
        char buf[1025];
        if (entry->home.size() < sizeof buf && realpath(entry->home.c_str(), buf)) return buf;
    }
    LogWrite(kLogLevelError, fn, "Failed to get home dir using getpwuid for uid: %u", uid);
    return rootedPath("/private/var/mobile");
}

}  // namespace vsl
