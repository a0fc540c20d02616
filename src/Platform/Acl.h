// Extended access control lists as the daemon speaks of them (entries of permission
// and inheritance bits granted to a group), mapped onto POSIX ACLs:
//  - read data -> r; write, append, delete child -> w; execute/search -> x; on a
//    directory w also brings x, since adding an entry needs search on Linux;
//  - an entry that is not inherit-only lands in the item's access ACL, merged with
//    what the item's "other" bits already allow (the extended model adds to the
//    mode, POSIX would replace it for group members);
//  - an entry with file or directory inheritance lands in a directory's default ACL
//    (POSIX cannot tell files from directories there); a default ACL gives the
//    creator of a new item rwx and everybody else nothing but the granted group.
// The mode bits of the item become the ACL's owner, group and other entries.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

namespace vsl {

constexpr uint32_t kAclPermReadData = 0x0002;
constexpr uint32_t kAclPermWriteData = 0x0004;
constexpr uint32_t kAclPermExecute = 0x0008;
constexpr uint32_t kAclPermDelete = 0x0010;
constexpr uint32_t kAclPermAppendData = 0x0020;
constexpr uint32_t kAclPermDeleteChild = 0x0040;
constexpr uint32_t kAclPermReadAttributes = 0x0080;
constexpr uint32_t kAclPermWriteAttributes = 0x0100;
constexpr uint32_t kAclPermReadExtAttributes = 0x0200;
constexpr uint32_t kAclPermWriteExtAttributes = 0x0400;
constexpr uint32_t kAclPermReadSecurity = 0x0800;
constexpr uint32_t kAclPermWriteSecurity = 0x1000;
constexpr uint32_t kAclPermChangeOwner = 0x2000;

constexpr uint32_t kAclFlagEntryInherited = 0x010;
constexpr uint32_t kAclFlagFileInherit = 0x020;
constexpr uint32_t kAclFlagDirectoryInherit = 0x040;
constexpr uint32_t kAclFlagOnlyInherit = 0x100;

struct GroupAce {
    gid_t group = 0;
    uint32_t permissions = 0;
    uint32_t flags = 0;
};

class ExtendedAcl {
public:
    void add(const GroupAce& ace) { entries_.push_back(ace); }
    const std::vector<GroupAce>& entries() const { return entries_; }

private:
    std::vector<GroupAce> entries_;
};

// POSIX rwx bits (4/2/1) an entry grants on a file or a directory.
unsigned posixPermissionsFor(uint32_t permissions, bool isDirectory);

// The item's own owner/group/other bits: `statMode`, except that with an extended ACL
// the group bits of the mode are the mask and the group's are in the ACL.
mode_t aclBaseMode(int fd, mode_t statMode);

// Replaces the ACLs of the item `fd` refers to (O_PATH is fine) with `acl`, the item's
// owner/group/other bits taken from `baseMode`. Writes only what differs; `*wrote`
// says whether anything was written. Returns 0 or an errno value.
int applyExtendedAcl(int fd, const std::string& path, const ExtendedAcl& acl, mode_t baseMode, bool isDirectory,
                     bool* wrote = nullptr);

}  // namespace vsl
