#include "DoctorChecks.h"

#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>

#include "Daemon/Service/VSLEntitlements.h"
#include "Platform/DirectoryEntries.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/ProtectionClass.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Platform/UserManagement.h"
#include "RootProbe.h"

using namespace vsl;

namespace {

using Findings = std::vector<DoctorFinding>;

std::string realPath(const std::string& path) {
    char buffer[PATH_MAX];
    return ::realpath(path.c_str(), buffer) ? std::string(buffer) : std::string();
}

void checkUsers(const std::string&, Findings* findings) {
    const std::string passwd = rootedPath("/etc/passwd");
    if (!passwordEntryForName("mobile"))
        findings->push_back({"users", "no user \"mobile\" in " + passwd,
                             "add one, e.g. `mobile:x:501:501::/private/var/mobile:/bin/sh`, to " + passwd +
                                 " (vesseld --init writes it when the file is missing)"});
    if (!groupIDForName("systemusers"))
        findings->push_back({"users", "no group \"systemusers\" in " + rootedPath("/etc/group") +
                                          ": setting ACLs on system group containers fails with 63",
                             "add one, e.g. `systemusers:x:502:`, to " + rootedPath("/etc/group")});
}

void checkDeviceFacts(const std::string&, Findings* findings) {
    const std::string path = rootedPath("/etc/vesseld/device.plist");
    if (::access(path.c_str(), F_OK) != 0) return;  // absent: the defaults serve
    std::string error;
    auto facts = readPropertyListFile(path, &error);
    if (!facts || !facts->dictionaryValue())
        findings->push_back({"device.plist", path + " is not a property-list dictionary" +
                                                 (error.empty() ? std::string() : ": " + error),
                             "fix or remove it (the daemon then uses its defaults); vesseld-files(5) lists the keys"});
}

void checkPersonas(const std::string&, Findings* findings) {
    const std::string path = rootedPath("/etc/vesseld/personas.plist");
    std::ifstream in(path, std::ios::binary);
    if (!in) return;  // absent: no personas
    std::string bytes((std::istreambuf_iterator<char>(in)), {});
    std::string error;
    if (!parsePersonaList(bytes, systemRootIsSlash() ? std::string() : systemRoot(), &error))
        findings->push_back({"personas.plist", path + " cannot be used: " + error,
                             "fix the entry named (an array of dictionaries with PersonaType and KernelPersonaID); "
                             "until then the daemon keeps the last good list"});
}

// One record of a policy file: its problems, and whether it entitles this vesselctl.
void checkRecord(const Value& record, const std::string& file, const std::string& self, bool* entitlesSelf,
                 Findings* findings) {
    const Value* executable = record.find("Executable");
    const Value* identifier = record.find("SigningIdentifier");
    if (!record.dictionaryValue() || !executable || !executable->stringValue() || !identifier ||
        !identifier->stringValue() || identifier->stringValue()->empty()) {
        findings->push_back({"policy store", file + ": a record without Executable or SigningIdentifier",
                             "give every record both strings; the daemon skips this one"});
        return;
    }
    const std::string path = *executable->stringValue();
    if (::access(path.c_str(), X_OK) != 0) {
        findings->push_back({"policy store", file + " names " + path + ", which is not an executable",
                             "point Executable at the program's real path or remove the record"});
        return;
    }
    const Value* entitlements = record.find("Entitlements");
    const Value* allowed = entitlements ? entitlements->find(kVSLEntitlementAllowed) : nullptr;
    if (realPath(path) == self && allowed && allowed->boolValue() && *allowed->boolValue()) *entitlesSelf = true;
}

void checkPolicyStore(const std::string&, Findings* findings) {
    const std::string directory = rootedPath("/etc/vesseld/code-signatures");
    const std::string self = realPath("/proc/self/exe");
    bool entitlesSelf = false;
    UniqueFd dir(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::vector<DirectoryEntry> entries;
    if (dir) readDirectoryEntries(dir.get(), &entries);
    for (const auto& entry : entries) {
        if (entry.name.size() < 6 || entry.name.substr(entry.name.size() - 6) != ".plist") continue;
        const std::string file = joinPath(directory, entry.name);
        struct stat st;
        if (::stat(file.c_str(), &st) == 0 && (st.st_mode & 022))
            findings->push_back({"policy store", file + " is writable by group or others, so the daemon skips it",
                                 "chmod go-w " + file});
        std::string error;
        auto contents = readPropertyListFile(file, &error);
        if (!contents) {
            findings->push_back({"policy store", file + " does not parse: " + error, "fix or remove it"});
            continue;
        }
        if (const Array* records = contents->arrayValue()) {
            for (const auto& record : *records) checkRecord(record, file, self, &entitlesSelf, findings);
        } else {
            checkRecord(*contents, file, self, &entitlesSelf, findings);
        }
    }
    if (!entitlesSelf)
        findings->push_back({"entitlement", "no policy record gives " + self + " the entitlement " +
                                                kVSLEntitlementAllowed,
                             "add a record for it to " + directory + " (vesseld --init writes vesselctl.plist)"});
}

// An unnamed file in the root's file system takes both, and vanishes with its descriptor.
void checkFileSystem(const std::string&, Findings* findings) {
    const std::string root = systemRoot();
    UniqueFd fd(::open(root.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600));
    if (!fd) {
        findings->push_back({"file system", "cannot test " + root + " for extended attributes and ACLs: " +
                                                std::strerror(errno),
                             "run doctor as the daemon's user on a file system with O_TMPFILE (ext4, xfs, tmpfs)"});
        return;
    }
    if (int rc = setProtectionClass(fd.get(), root, 4))
        findings->push_back({"file system", std::string("the file system of ") + root + " refuses the attribute " +
                                                protectionClassAttributeName() + ": " + std::strerror(rc),
                             "keep the root on a file system with extended attributes (mount with user_xattr)"});
    acl_t acl = acl_from_text("u::rw-,u:0:r--,g::---,m::r--,o::---");
    const int aclResult = acl ? acl_set_fd(fd.get(), acl) : -1;
    const int aclErrno = errno;
    if (acl) acl_free(acl);
    if (aclResult != 0)
        findings->push_back({"file system", "the file system of " + root + " refuses POSIX ACLs: " +
                                                std::strerror(aclErrno),
                             "keep the root on a file system with POSIX ACLs (mount with acl)"});
}

void checkSocket(const std::string& socketPath, Findings* findings) {
    if (socketIsStale(socketPath))
        findings->push_back({"socket", socketPath + " exists but no daemon listens on it",
                             "remove it (rm " + socketPath + ") or start vesseld"});
}

}  // namespace

const std::vector<DoctorCheck>& doctorChecks() {
    static const std::vector<DoctorCheck> checks = {
        {"users", checkUsers},           {"device.plist", checkDeviceFacts},   {"personas.plist", checkPersonas},
        {"policy store", checkPolicyStore}, {"file system", checkFileSystem}, {"socket", checkSocket},
    };
    return checks;
}
