// Reading back what the storage code wrote: modes, owners, xattrs and POSIX ACLs.
#pragma once

#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "Platform/ProtectionClass.h"

namespace vsl::test {

inline bool runningAsRoot() { return ::geteuid() == 0; }

inline struct stat lstatOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(0, ::lstat(path.c_str(), &st)) << path;
    return st;
}

inline mode_t modeOf(const std::string& path) { return lstatOf(path).st_mode & 07777; }

inline void writeText(const std::string& path, const std::string& text, mode_t mode = 0644) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
    ::chmod(path.c_str(), mode);
}

// The protection-class attribute as stored, "" when absent.
inline std::string protectionClassAttribute(const std::string& path) {
    char buf[32];
    ssize_t n = ::lgetxattr(path.c_str(), protectionClassAttributeName(), buf, sizeof buf);
    return n < 0 ? std::string() : std::string(buf, static_cast<size_t>(n));
}

// rwx bits (4/2/1) of one entry of an ACL; -1 when the entry is absent. `qualifier`
// picks the named group for ACL_GROUP.
inline int aclPerms(const std::string& path, acl_type_t type, acl_tag_t tag, gid_t qualifier = 0) {
    acl_t acl = acl_get_file(path.c_str(), type);
    if (!acl) return -1;
    int found = -1;
    acl_entry_t entry;
    for (int which = ACL_FIRST_ENTRY; acl_get_entry(acl, which, &entry) == 1; which = ACL_NEXT_ENTRY) {
        acl_tag_t t;
        acl_get_tag_type(entry, &t);
        if (t != tag) continue;
        if (tag == ACL_GROUP) {
            auto* q = static_cast<gid_t*>(acl_get_qualifier(entry));
            bool match = q && *q == qualifier;
            acl_free(q);
            if (!match) continue;
        }
        acl_permset_t ps;
        acl_get_permset(entry, &ps);
        found = (acl_get_perm(ps, ACL_READ) ? 4 : 0) | (acl_get_perm(ps, ACL_WRITE) ? 2 : 0) |
                (acl_get_perm(ps, ACL_EXECUTE) ? 1 : 0);
    }
    acl_free(acl);
    return found;
}

inline std::string aclText(const std::string& path, acl_type_t type) {
    acl_t acl = acl_get_file(path.c_str(), type);
    if (!acl) return "(none)";
    char* text = acl_to_any_text(acl, nullptr, ',', TEXT_NUMERIC_IDS);
    std::string s = text ? text : "";
    acl_free(text);
    acl_free(acl);
    return s;
}

}  // namespace vsl::test
