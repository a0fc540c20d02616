#include "Platform/Acl.h"

#include <acl/libacl.h>
#include <sys/acl.h>

#include <cerrno>
#include <map>

#include "Platform/DurableIO.h"

namespace vsl {

namespace {

constexpr uint32_t kReadBits = kAclPermReadData;
constexpr uint32_t kWriteBits = kAclPermWriteData | kAclPermAppendData | kAclPermDeleteChild;
constexpr uint32_t kInheritBits = kAclFlagFileInherit | kAclFlagDirectoryInherit;

struct AclHolder {
    acl_t acl = nullptr;
    ~AclHolder() {
        if (acl) acl_free(acl);
    }
};

int addEntry(acl_t* acl, acl_tag_t tag, unsigned perms, const gid_t* group) {
    acl_entry_t entry;
    acl_permset_t permset;
    if (acl_create_entry(acl, &entry) != 0 || acl_set_tag_type(entry, tag) != 0) return errno;
    if (group && acl_set_qualifier(entry, group) != 0) return errno;
    if (acl_get_permset(entry, &permset) != 0 || acl_clear_perms(permset) != 0) return errno;
    if ((perms & 4) && acl_add_perm(permset, ACL_READ) != 0) return errno;
    if ((perms & 2) && acl_add_perm(permset, ACL_WRITE) != 0) return errno;
    if ((perms & 1) && acl_add_perm(permset, ACL_EXECUTE) != 0) return errno;
    return acl_set_permset(entry, permset) == 0 ? 0 : errno;
}

// Owner, group and other from `base`, then the named groups and their mask.
int buildAcl(acl_t* out, unsigned owner, unsigned group, unsigned other, const std::map<gid_t, unsigned>& named) {
    acl_t acl = acl_init(static_cast<int>(4 + named.size()));
    if (!acl) return errno;
    int rc = addEntry(&acl, ACL_USER_OBJ, owner, nullptr);
    if (rc == 0) rc = addEntry(&acl, ACL_GROUP_OBJ, group, nullptr);
    if (rc == 0) rc = addEntry(&acl, ACL_OTHER, other, nullptr);
    for (const auto& [gid, perms] : named)
        if (rc == 0) rc = addEntry(&acl, ACL_GROUP, perms, &gid);
    if (rc == 0 && !named.empty() && acl_calc_mask(&acl) != 0) rc = errno;
    if (rc != 0) {
        acl_free(acl);
        return rc;
    }
    *out = acl;
    return 0;
}

// Whether writing `desired` would change `current`; a null `desired` means none of that type.
bool differs(acl_t current, acl_t desired) {
    if (!current) return true;
    if (!desired) return acl_entries(current) > 0;
    return acl_cmp(current, desired) != 0;
}

}  // namespace

unsigned posixPermissionsFor(uint32_t permissions, bool isDirectory) {
    unsigned p = 0;
    if (permissions & kReadBits) p |= 4;
    if (permissions & kWriteBits) p |= isDirectory ? 3 : 2;
    if (permissions & kAclPermExecute) p |= 1;
    return p;
}

mode_t aclBaseMode(int fd, mode_t statMode) {
    mode_t mode = statMode & 07777;
    AclHolder current;
    current.acl = acl_get_file(durable::descriptorPath(fd).c_str(), ACL_TYPE_ACCESS);
    acl_entry_t entry;
    if (!current.acl) return mode;
    for (int which = ACL_FIRST_ENTRY; acl_get_entry(current.acl, which, &entry) == 1; which = ACL_NEXT_ENTRY) {
        acl_tag_t tag;
        acl_permset_t permset;
        if (acl_get_tag_type(entry, &tag) != 0 || tag != ACL_GROUP_OBJ || acl_get_permset(entry, &permset) != 0)
            continue;
        mode_t group = (acl_get_perm(permset, ACL_READ) == 1 ? 4 : 0) | (acl_get_perm(permset, ACL_WRITE) == 1 ? 2 : 0) |
                       (acl_get_perm(permset, ACL_EXECUTE) == 1 ? 1 : 0);
        mode = (mode & ~static_cast<mode_t>(070)) | (group << 3);
    }
    return mode;
}

int applyExtendedAcl(int fd, const std::string& path, const ExtendedAcl& acl, mode_t baseMode, bool isDirectory,
                     bool* wrote) {
    if (wrote) *wrote = false;
    std::map<gid_t, unsigned> accessGrants, inheritedGrants;
    unsigned other = baseMode & 7;
    for (const GroupAce& ace : acl.entries()) {
        unsigned perms = posixPermissionsFor(ace.permissions, isDirectory);
        if (!(ace.flags & kAclFlagOnlyInherit)) accessGrants[ace.group] |= perms | other;
        if (isDirectory && (ace.flags & kInheritBits)) inheritedGrants[ace.group] |= posixPermissionsFor(ace.permissions, true);
    }

    AclHolder desiredAccess, desiredDefault, currentAccess, currentDefault;
    if (int rc = buildAcl(&desiredAccess.acl, (baseMode >> 6) & 7, (baseMode >> 3) & 7, other, accessGrants))
        return rc;
    if (!inheritedGrants.empty())
        if (int rc = buildAcl(&desiredDefault.acl, 7, 0, 0, inheritedGrants)) return rc;

    std::string procPath = durable::descriptorPath(fd);
    currentAccess.acl = acl_get_file(procPath.c_str(), ACL_TYPE_ACCESS);
    if (differs(currentAccess.acl, desiredAccess.acl)) {
        if (int rc = durable::setACL(fd, path, ACL_TYPE_ACCESS, desiredAccess.acl)) return rc;
        if (wrote) *wrote = true;
    }
    if (!isDirectory) return 0;
    currentDefault.acl = acl_get_file(procPath.c_str(), ACL_TYPE_DEFAULT);
    if (!differs(currentDefault.acl, desiredDefault.acl)) return 0;
    int rc = desiredDefault.acl ? durable::setACL(fd, path, ACL_TYPE_DEFAULT, desiredDefault.acl)
                                : durable::removeDefaultACL(fd, path);
    if (rc == 0 && wrote) *wrote = true;
    return rc;
}

}  // namespace vsl
