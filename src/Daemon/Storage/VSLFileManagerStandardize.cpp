// Bringing container trees to their standard owners, modes and access control lists.
// Every walk reads an item's state first and writes only what differs, and re-opens
// an item for a write through a NodePinner so that a link swapped into the tree by
// the container's owner cannot turn a root-owned write onto something outside it.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DurableIO.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/PinnedNode.h"

namespace vsl {

namespace {

const char* const kOwnershipFunction = "-[VSLFileManager standardizeOwnershipAtURL:toUID:GID:error:]";
const char* const kACLFunction = "-[VSLFileManager standardizeACLsAtURL:isSystemContainer:error:]";
const char* const kSystemUsersGroup = "systemusers";
// The unprivileged identity (-2) that owns every item of a standardised system container.
constexpr uid_t kNobodyID = 4294967294u;

constexpr uint32_t kAllPermissions = 0x3ffe;
constexpr uint32_t kFilePermissions = 0x3fbe;  // all but delete child
constexpr uint32_t kTopLevelPermissions = kAclPermWriteData | kAclPermAppendData | kAclPermReadExtAttributes |
                                          kAclPermWriteExtAttributes;  // 0x0624

bool isMetadataPath(const char* path) { return std::strstr(path, kVSLMetadataFileName) != nullptr; }

mode_t standardMode(mode_t mode) { return S_ISDIR(mode) || (mode & 0111) ? 0755 : 0644; }

void standardizeOwnershipOfNode(const NodePinner& pinner, const std::string& path, const struct stat& st, uid_t uid,
                                gid_t gid) {
    bool ownerDiffers = st.st_uid != uid || st.st_gid != gid;
    // Links have no mode of their own on Linux.
    bool modeDiffers = !S_ISLNK(st.st_mode) && (st.st_mode & 07777) != standardMode(st.st_mode);
    if (!ownerDiffers && !modeDiffers) return;
    int fd = pinner.open(path, st);
    if (fd < 0) {
        LogWrite(kLogLevelError, kOwnershipFunction, "Could not chown %s: %s", path, std::strerror(errno));
        return;
    }
    if (ownerDiffers)
        if (int rc = durable::changeOwnerOfNode(fd, path, uid, gid))
            LogWrite(kLogLevelError, kOwnershipFunction, "Could not chown %s: %s", path, std::strerror(rc));
    if (modeDiffers)
        if (int rc = durable::changeModeOfNode(fd, path, standardMode(st.st_mode)))
            LogWrite(kLogLevelError, kOwnershipFunction, "Could not chmod %s: %s", path, std::strerror(rc));
    ::close(fd);
}

bool isVisitedOnce(const FTSENT* node) {
    // Directories are handled on their first visit for ownership; errors have no stat.
    return node->fts_info != FTS_DP && node->fts_info != FTS_NS && node->fts_info != FTS_DC;
}

std::string describeList(const std::vector<VSLItemURL>& items) {
    std::string s = "(\n";
    for (const VSLItemURL& item : items) s += "    \"" + item.path + "\",\n";
    return s + ")";
}

}  // namespace

bool VSLFileManager::standardizeOwnershipAtURL(const std::string& url, uid_t uid, gid_t gid,
                                               VSLErrorRef* error) const {
    NodePinner pinner(url);
    bool walked = _traverseDirectory(url, error, [&](FTSENT* node, VSLErrorRef*) {
        if (node->fts_info == FTS_NS)
            LogWrite(kLogLevelError, kOwnershipFunction, "Could not chown %s: %s", node->fts_path,
                     std::strerror(node->fts_errno));
        if (!isVisitedOnce(node) || isMetadataPath(node->fts_path)) return true;
        standardizeOwnershipOfNode(pinner, node->fts_path, *node->fts_statp, uid, gid);
        return true;
    });
    struct stat st;
    if (::lstat(url.c_str(), &st) != 0) {
        int err = errno;
        if (error) *error = VSL_POSIX_ERROR(err, "Could not stat %s: %s", url, std::strerror(err));
        return false;
    }
    if (!isMetadataPath(url.c_str())) standardizeOwnershipOfNode(pinner, url, st, uid, gid);
    return walked;
}

bool VSLFileManager::standardizeACLsAtURL(const std::string& url, bool isSystemContainer, VSLErrorRef* error) const {
    auto topLevelACL = _CopyTopLevelSystemContainerACLWithError(error);
    if (!topLevelACL) return false;
    auto directoryACL = _CopySystemContainerACLWithNumACEs(1, true, false, error);
    if (!directoryACL) return false;
    auto fileACL = _CopySystemContainerACLWithNumACEs(1, false, false, error);
    if (!fileACL) return false;

    NodePinner pinner(url);
    return _traverseDirectory(url, error, [&](FTSENT* node, VSLErrorRef*) {
        // Directories after their contents: a directory closed to its owner stays walkable.
        if (node->fts_info == FTS_D || node->fts_info == FTS_DC || node->fts_info == FTS_NS) return true;
        if (isMetadataPath(node->fts_path)) return true;
        const std::string path = node->fts_path;
        const struct stat& st = *node->fts_statp;
        bool isDirectory = node->fts_info == FTS_DP;
        int fd = pinner.open(path, st);
        if (fd < 0) {
            LogWrite(kLogLevelError, kACLFunction, "Failed to set ACL on dir %s: %s", path, std::strerror(errno));
            return true;
        }
        if (isDirectory && node->fts_level == 0 && isSystemContainer) {
            // The container's root keeps its owner and mode and only gains the grant.
            if (int rc = applyExtendedAcl(fd, path, *topLevelACL, aclBaseMode(fd, st.st_mode), true))
                LogWrite(kLogLevelError, kACLFunction, "Failed to set top level ACL on dir %s: %s", path,
                         std::strerror(rc));
            ::close(fd);
            return true;
        }
        if (!S_ISLNK(st.st_mode)) {
            // Owner, group and other get nothing (mode 0000) and the group gets the grant.
            // On Linux the ACL carries the mode, so one write sets both; a chmod would
            // instead narrow the mask and void the grant.
            int rc = applyExtendedAcl(fd, path, isDirectory ? *directoryACL : *fileACL, 0, isDirectory);
            if (rc) {
                LogWrite(kLogLevelError, kACLFunction, "Failed to set ACL on dir %s: %s", path, std::strerror(rc));
                if ((st.st_mode & 07777) != 0)
                    if (int rc2 = durable::changeModeOfNode(fd, path, 0))
                        LogWrite(kLogLevelError, kACLFunction, "Could not chmod %s: %s", path, std::strerror(rc2));
            }
        }
        if (st.st_uid != kNobodyID || st.st_gid != kNobodyID)
            if (int rc = durable::changeOwnerOfNode(fd, path, kNobodyID, kNobodyID))
                LogWrite(kLogLevelError, kACLFunction, "Could not chown %s: %s", path, std::strerror(rc));
        ::close(fd);
        return true;
    });
}

bool VSLFileManager::standardizeACLsForSystemContainerAtURL(const std::string& url, VSLErrorRef* error) const {
    return standardizeACLsAtURL(url, true, error);
}

bool VSLFileManager::standardizeAllSystemContainerACLsAtURL(const std::string& url, VSLErrorRef* error) const {
    static const char* const fn = "-[VSLFileManager standardizeAllSystemContainerACLsAtURL:error:]";
    VSLErrorRef listError;
    auto items = urlsForItemsInDirectoryAtURL(url, &listError);
    if (!items) {
        if (isPOSIXError(listError, ENOENT)) return true;
        LogWrite(kLogLevelError, fn, "Failed to get items at URL%@ : %@", url, listError);
        if (error) *error = listError;
        return false;
    }
    if (items->empty()) return true;
    LogWrite(kLogLevelNotice, fn, "Potential containers requiring ACL migration: %@", describeList(*items));
    bool ok = true;
    for (const VSLItemURL& item : *items) {
        VSLErrorRef itemError;
        if (standardizeACLsAtURL(item.path, true, &itemError)) continue;
        LogWrite(kLogLevelError, fn, "Failed to set system container ACL at %@: %@", item.path, itemError);
        ok = false;
        if (error) *error = itemError;
    }
    return ok;
}

bool VSLFileManager::setTopLevelSystemContainerACLAtURL(const std::string& url, VSLErrorRef* error) const {
    auto acl = _CopyTopLevelSystemContainerACLWithError(error);
    if (!acl) return false;
    int fd = ::open(url.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC);
    struct stat st;
    int rc = fd < 0 ? errno : ::fstat(fd, &st) != 0 ? errno : 0;
    if (rc == 0) rc = applyExtendedAcl(fd, url, *acl, aclBaseMode(fd, st.st_mode), S_ISDIR(st.st_mode));
    if (fd >= 0) ::close(fd);
    if (rc) {
        if (error) *error = VSL_ERROR(kVSLErrorSetACL, nullptr, true, "Failed to set ACL on %@: %s", url, std::strerror(rc));
        return false;
    }
    return true;
}

bool VSLFileManager::_CreateSystemUserACEInACL(ExtendedAcl& acl, uint32_t permissions, uint32_t flags,
                                               VSLErrorRef* error) const {
    auto group = groupIDForName(kSystemUsersGroup);
    if (!group) {
        if (error)
            *error = VSL_ERROR(kVSLErrorSetACL, nullptr, true, "mbr_identifier_to_uuid() failed: %s",
                               std::strerror(ENOENT));
        return false;
    }
    acl.add(GroupAce{*group, permissions, flags});
    return true;
}

std::optional<ExtendedAcl> VSLFileManager::_CopySystemContainerACLWithNumACEs(int numACEs, bool isDir,
                                                                              bool inheritOnly,
                                                                              VSLErrorRef* error) const {
    (void)numACEs;  // a capacity hint only; the list grows as needed
    ExtendedAcl acl;
    uint32_t permissions = isDir ? kAllPermissions : kFilePermissions;
    uint32_t flags = !isDir ? kAclFlagEntryInherited
                            : kAclFlagFileInherit | kAclFlagDirectoryInherit | (inheritOnly ? kAclFlagOnlyInherit : 0);
    if (!_CreateSystemUserACEInACL(acl, permissions, flags, error)) return std::nullopt;
    return acl;
}

std::optional<ExtendedAcl> VSLFileManager::_CopyTopLevelSystemContainerACLWithError(VSLErrorRef* error) const {
    auto acl = _CopySystemContainerACLWithNumACEs(2, true, true, error);
    if (!acl || !_CreateSystemUserACEInACL(*acl, kTopLevelPermissions, 0, error)) return std::nullopt;
    return acl;
}

}  // namespace vsl
