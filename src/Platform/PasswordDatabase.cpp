#include "Platform/PasswordDatabase.h"

#include <grp.h>
#include <pwd.h>

#include <cstdio>
#include <functional>
#include <vector>

#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

PasswordEntry fromPasswd(const passwd& pw, bool rooted) {
    PasswordEntry e;
    e.name = pw.pw_name ? pw.pw_name : "";
    e.uid = pw.pw_uid;
    e.gid = pw.pw_gid;
    std::string home = pw.pw_dir ? pw.pw_dir : "";
    e.home = rooted ? rootedPath(home) : home;
    return e;
}

// fgetpwent over the root's file: a chroot-style view of its users.
std::optional<PasswordEntry> scanPasswd(const std::function<bool(const passwd&)>& match) {
    FILE* f = std::fopen(rootedPath("/etc/passwd").c_str(), "re");
    if (!f) return std::nullopt;
    std::optional<PasswordEntry> found;
    while (passwd* pw = fgetpwent(f)) {
        if (match(*pw)) {
            found = fromPasswd(*pw, true);
            break;
        }
    }
    std::fclose(f);
    return found;
}

std::optional<PasswordEntry> nssLookup(bool byUID, uid_t uid, const std::string& name) {
    std::vector<char> buf(16384);
    passwd pw;
    passwd* result = nullptr;
    int rc = byUID ? getpwuid_r(uid, &pw, buf.data(), buf.size(), &result)
                   : getpwnam_r(name.c_str(), &pw, buf.data(), buf.size(), &result);
    if (rc != 0 || !result) return std::nullopt;
    return fromPasswd(pw, false);
}

}  // namespace

std::optional<PasswordEntry> passwordEntryForUID(uid_t uid) {
    if (systemRootIsSlash()) return nssLookup(true, uid, {});
    return scanPasswd([uid](const passwd& pw) { return pw.pw_uid == uid; });
}

std::optional<PasswordEntry> passwordEntryForName(const std::string& name) {
    if (systemRootIsSlash()) return nssLookup(false, 0, name);
    return scanPasswd([&name](const passwd& pw) { return pw.pw_name && name == pw.pw_name; });
}

std::optional<gid_t> groupIDForName(const std::string& name) {
    if (systemRootIsSlash()) {
        std::vector<char> buf(16384);
        group gr;
        group* result = nullptr;
        if (getgrnam_r(name.c_str(), &gr, buf.data(), buf.size(), &result) != 0 || !result)
            return std::nullopt;
        return result->gr_gid;
    }
    FILE* f = std::fopen(rootedPath("/etc/group").c_str(), "re");
    if (!f) return std::nullopt;
    std::optional<gid_t> found;
    while (group* gr = fgetgrent(f)) {
        if (gr->gr_name && name == gr->gr_name) {
            found = gr->gr_gid;
            break;
        }
    }
    std::fclose(f);
    return found;
}

}  // namespace vsl
