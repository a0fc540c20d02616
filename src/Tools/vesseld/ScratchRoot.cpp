#include "ScratchRoot.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

bool makeDirs(const std::string& path, std::string* error) {
    for (size_t i = 1; i <= path.size(); i++) {
        if (i != path.size() && path[i] != '/') continue;
        std::string part = path.substr(0, i);
        struct stat st;
        if (::lstat(part.c_str(), &st) == 0) continue;
        int rc = durable::makeDirectory(part, 0755);
        if (rc != 0 && rc != EEXIST) {
            *error = "mkdir " + part + ": " + std::strerror(rc);
            return false;
        }
    }
    return true;
}

bool writeIfMissing(const std::string& relative, const std::string& contents, std::string* error) {
    std::string path = rootedPath(relative);
    if (::access(path.c_str(), F_OK) == 0) return true;
    if (!makeDirs(parentPath(path), error)) return false;
    if (int rc = durable::writeFileAtomically(path, contents.data(), contents.size(), 0644)) {
        *error = "create " + path + ": " + std::strerror(rc);
        return false;
    }
    return true;
}

bool plistIfMissing(const std::string& relative, const Value& dictionary, std::string* error) {
    std::string path = rootedPath(relative);
    if (::access(path.c_str(), F_OK) == 0) return true;
    if (!makeDirs(parentPath(path), error)) return false;
    VSLErrorRef e;
    if (!VSL_writeToURL(dictionary, path, kVSLWriteAtomic, &e)) {
        *error = "write " + path + ": " + (e ? e->description() : "");
        return false;
    }
    if (int rc = durable::changeMode(path, 0644)) {
        *error = "chmod " + path + ": " + std::strerror(rc);
        return false;
    }
    return true;
}

std::string vesselctlPath() {
    char self[PATH_MAX];
    ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
    if (n <= 0) return {};
    self[n] = 0;
    std::string candidate = joinPath(parentPath(self), "../vesselctl/vesselctl");
    char real[PATH_MAX];
    if (::realpath(candidate.c_str(), real)) return real;
    candidate = joinPath(parentPath(self), "vesselctl");
    if (::realpath(candidate.c_str(), real)) return real;
    // Installed: /usr/sbin/vesseld beside /usr/bin/vesselctl.
    candidate = joinPath(parentPath(self), "../bin/vesselctl");
    if (::realpath(candidate.c_str(), real)) return real;
    return {};
}

}  // namespace

bool initializeScratchRoot(std::string* error) {
    bool asRoot = ::geteuid() == 0;
    uid_t uid = asRoot ? 501 : ::geteuid();
    gid_t gid = asRoot ? 501 : ::getegid();
    uid_t installer = defaultInstallerUID();
    uid_t system = defaultSystemContainerUID();
    gid_t systemUsers = asRoot ? 95 : ::getegid();
    std::string u = std::to_string(uid), g = std::to_string(gid);

    if (!writeIfMissing("etc/passwd", "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                      "_installd:x:33:33:installer:/private/var/installd:/bin/false\n"
                                      "mobile:x:" + u + ":" + g + ":mobile:/private/var/mobile:/bin/sh\n",
                        error) ||
        !writeIfMissing("etc/group", "wheel:x:0:\nmobile:x:" + g + ":\nsystemusers:x:" +
                                         std::to_string(systemUsers) + ":mobile\n",
                        error) ||
        !writeIfMissing("etc/os-release", "NAME=vessel\nBUILD_ID=dev\n", error))
        return false;
    if (!makeDirs(rootedPath("/private/var/mobile"), error) || !makeDirs(rootedPath("/private/var/root"), error))
        return false;
    if (!plistIfMissing("etc/vesseld/device.plist",
                        dict({{"InternalBuild", Value::boolean(false)},
                              {"MultiUser", Value::boolean(false)},
                              {"PersonasSupported", Value::boolean(false)},
                              {"EphemeralStorage", Value::boolean(false)},
                              {"FeatureFlags", Value::dictionary({})},
                              {"InstallerUID", Value::uint64(installer)},
                              {"SystemContainerUID", Value::uint64(system)}}),
                        error))
        return false;
    std::string ctl = vesselctlPath();
    if (!ctl.empty() &&
        !plistIfMissing("etc/vesseld/code-signatures/vesselctl.plist",
                        dict({{"Executable", Value::string(ctl)},
                              {"SigningIdentifier", Value::string("com.tarrow.vesselctl")},
                              {"Entitlements", dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}})},
                              {"Sandboxed", Value::boolean(false)}}),
                        error))
        return false;
    if (!makeDirs(rootedPath("/run/vesseld"), error)) return false;
    reloadDeviceFacts();
    return true;
}

}  // namespace vsl
