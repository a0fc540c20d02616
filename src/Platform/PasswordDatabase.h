// The password and group databases: the host's (NSS) when the system root is "/",
// otherwise the root's own etc/passwd and etc/group. Home directories come back as
// host paths (below the root).
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace vsl {

struct PasswordEntry {
    std::string name;
    uid_t uid = 0;
    gid_t gid = 0;
    std::string home;  // host path
};

std::optional<PasswordEntry> passwordEntryForUID(uid_t uid);
std::optional<PasswordEntry> passwordEntryForName(const std::string& name);
std::optional<gid_t> groupIDForName(const std::string& name);

}  // namespace vsl
