// Device and build facts: etc/vesseld/device.plist and etc/os-release of the system
// root, read once on first use (tests call reloadDeviceFacts after changing them).
#pragma once

#include <sys/types.h>

#include <map>
#include <optional>
#include <string>

#include "Platform/Log.h"

namespace vsl {

struct DeviceFacts {
    bool internalBuild = false;
    bool multiUser = false;
    bool personasSupported = false;
    bool ephemeralStorage = false;
    std::map<std::string, bool> featureFlags;
    // Without either key: 33 and 0 for a daemon running as root, else the daemon's own
    // uid, which is the only owner an unprivileged daemon can give.
    uid_t installerUID = 33;
    uid_t systemContainerUID = 0;
    std::string buildVersion;  // BUILD_ID of etc/os-release, "" when absent
    // "LogLevel": a name ("error", "default", "info", "debug") or 3, 5, 6, 7.
    std::optional<LogVerbosity> logLevel;

    bool featureEnabled(const std::string& name) const {
        auto it = featureFlags.find(name);
        return it != featureFlags.end() && it->second;
    }
};

const DeviceFacts& deviceFacts();
// What installerUID and systemContainerUID are when device.plist names none.
uid_t defaultInstallerUID();
uid_t defaultSystemContainerUID();
void reloadDeviceFacts();

}  // namespace vsl
