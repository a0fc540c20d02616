#include "Platform/TreeCopy.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "Platform/DirectoryCursor.h"
#include "Platform/DirectoryEntries.h"
#include "Platform/DurableIO.h"
#include "Platform/UniqueFd.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

const char* const kAccessAclName = "system.posix_acl_access";
const char* const kDefaultAclName = "system.posix_acl_default";


bool unsupported(int err) { return err == ENOTSUP || err == EOPNOTSUPP; }

// Whether `path` is `tree` or lies below it, by real paths: a copy into itself never ends.
bool isWithin(const std::string& path, const std::string& tree) {
    char* realTree = ::realpath(tree.c_str(), nullptr);
    char* realParent = ::realpath(parentPath(path).c_str(), nullptr);
    bool within = false;
    if (realTree && realParent) {
        std::string p = joinPath(realParent, lastPathComponent(path)), t = realTree;
        within = p == t || (p.size() > t.size() && p.compare(0, t.size(), t) == 0 && (t == "/" || p[t.size()] == '/'));
    }
    std::free(realTree);
    std::free(realParent);
    return within;
}

class TreeCopier {
public:
    TreeCopier(std::string* failedPath, CopySync sync)
        : failedPath_(failedPath), sync_(sync), euid_(::geteuid()), egid_(::getegid()), umask_(processUmask()) {}

    int copyTop(const std::string& from, const std::string& to) {
        UniqueFd srcDir(::open(parentPath(from).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (srcDir.get() < 0) return fail(errno, from);
        UniqueFd dstDir(::open(parentPath(to).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (dstDir.get() < 0) return fail(errno, to);
        if (isWithin(to, from)) return fail(EINVAL, to);
        std::string srcName = lastPathComponent(from), dstName = lastPathComponent(to);
        struct stat st;
        if (::fstatat(srcDir.get(), srcName.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return fail(errno, from);
        // Only the top item can inherit a default ACL of the destination: the copy's own
        // directories get theirs after their contents are made.
        char probe;
        stripInheritedAcl_ = ::fgetxattr(dstDir.get(), kDefaultAclName, &probe, 0) > 0;
        // What is made in the caller's directory may take its group or ACL; below, only
        // what this copy made holds the new items.
        DirectoryCursor src(srcDir.get()), dst(dstDir.get());
        return copyEntry(src, srcName.c_str(), st, dst, dstName.c_str(), from, to, false);
    }

private:
    // One directory being copied: the cursors stand in it (source and copy) while its
    // entries are worked through.
    struct Level {
        struct stat st;
        std::string from, to;
        bool made, parentIsOurs, childrenOurs, strip;
        std::vector<DirectoryEntry> entries;
        size_t next = 0;
    };

    int fail(int err, const std::string& path) {
        if (failedPath_) *failedPath_ = path;
        return err;
    }

    // The umask, to know when a new file is born with its final mode; -1 when unknown.
    static int processUmask() {
        FILE* f = std::fopen("/proc/self/status", "re");
        if (!f) return -1;
        char line[256];
        int mask = -1;
        while (std::fgets(line, sizeof line, f))
            if (std::sscanf(line, "Umask: %o", &mask) == 1) break;
        std::fclose(f);
        return mask;
    }

    // `parentIsOurs`: the destination directory was made by this copy, so a new item in
    // it is owned by this process and gets its mode from the umask alone. A directory
    // is copied depth first without recursion, the cursors holding one descriptor each.
    int copyEntry(DirectoryCursor& src, const char* srcName, const struct stat& st, DirectoryCursor& dst,
                  const char* dstName, const std::string& from, const std::string& to, bool parentIsOurs) {
        if (!S_ISDIR(st.st_mode)) return copyNonDirectory(src.fd(), srcName, st, dst.fd(), dstName, from, to, parentIsOurs);
        if (int rc = enterDirectory(src, srcName, st, dst, dstName, from, to, parentIsOurs)) return rc;
        while (!levels_.empty()) {
            Level& level = levels_.back();
            if (level.next == level.entries.size()) {
                if (int rc = leaveDirectory(src, dst)) return rc;
                continue;
            }
            std::string name = level.entries[level.next++].name;  // levels_ may grow below
            std::string childFrom = joinPath(level.from, name), childTo = joinPath(level.to, name);
            struct stat child;
            if (::fstatat(src.fd(), name.c_str(), &child, AT_SYMLINK_NOFOLLOW) != 0) return fail(errno, childFrom);
            bool ours = level.childrenOurs;
            int rc = S_ISDIR(child.st_mode)
                         ? enterDirectory(src, name.c_str(), child, dst, name.c_str(), childFrom, childTo, ours)
                         : copyNonDirectory(src.fd(), name.c_str(), child, dst.fd(), name.c_str(), childFrom, childTo, ours);
            if (rc) return rc;
        }
        return 0;
    }

    int copyNonDirectory(int srcDir, const char* srcName, const struct stat& st, int dstDir, const char* dstName,
                         const std::string& from, const std::string& to, bool parentIsOurs) {
        if (S_ISREG(st.st_mode)) return copyFile(srcDir, srcName, st, dstDir, dstName, from, to, parentIsOurs);
        return copySpecial(srcDir, srcName, st, dstDir, dstName, from, to);
    }

    bool ownerMatches(const struct stat& st, bool parentIsOurs) const {
        return parentIsOurs && st.st_uid == euid_ && st.st_gid == egid_;
    }

    // Makes the item with `make`, replacing a non-directory that stands in the way.
    template <class Make>
    int makeReplacing(int dstDir, const char* dstName, const std::string& to, Make make) {
        int rc = make();
        if (rc != EEXIST) return rc;
        struct stat existing;
        if (::fstatat(dstDir, dstName, &existing, AT_SYMLINK_NOFOLLOW) != 0) return errno;
        if (S_ISDIR(existing.st_mode)) return EEXIST;
        if (int r = durable::removeAt(dstDir, dstName, false, to)) return r;
        return make();
    }

    int copyFile(int srcDir, const char* srcName, const struct stat& st, int dstDir, const char* dstName,
                 const std::string& from, const std::string& to, bool parentIsOurs) {
        // Non-blocking, and checked to be the file listed: a FIFO or device swapped in
        // since would block the copy or be read for the file.
        UniqueFd src(::openat(srcDir, srcName, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        if (src.get() < 0) return fail(errno, from);
        struct stat opened;
        if (::fstat(src.get(), &opened) != 0) return fail(errno, from);
        if (!S_ISREG(opened.st_mode) || opened.st_dev != st.st_dev || opened.st_ino != st.st_ino)
            return fail(ESTALE, from);
        mode_t mode = st.st_mode & 07777;
        // Born with its final mode when nothing (umask, set-id bits) can change it.
        bool exact = parentIsOurs && umask_ >= 0 && (mode & 07000) == 0 && (mode & ~static_cast<mode_t>(umask_)) == mode;
        UniqueFd dst;
        int rc = makeReplacing(dstDir, dstName, to,
                               [&] { return durable::createFileAt(dstDir, dstName, exact ? mode : 0600, to, dst.out()); });
        if (rc) return fail(rc, to);
        if ((rc = durable::copyFileData(src.get(), dst.get(), opened.st_size, to, &method_))) return fail(rc, to);
        if ((rc = copyAttributes(src.get(), dst.get(), st, to, ownerMatches(st, parentIsOurs), exact))) return rc;
        if (sync_ == CopySync::EachItem && (rc = durable::fsyncDescriptor(dst.get(), to))) return fail(rc, to);
        return 0;
    }

    // Makes the copy of a directory and steps both cursors into it.
    int enterDirectory(DirectoryCursor& src, const char* srcName, const struct stat& st, DirectoryCursor& dst,
                       const char* dstName, const std::string& from, const std::string& to, bool parentIsOurs) {
        if (int rc = src.descend(srcName, &st)) return fail(rc, from);
        int rc = durable::makeDirectoryAt(dst.fd(), dstName, 0700, to);
        bool made = rc == 0;
        if (rc == EEXIST) {
            struct stat existing;
            if (::fstatat(dst.fd(), dstName, &existing, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(existing.st_mode)) rc = 0;
        }
        if (rc) return fail(rc, to);
        struct stat madeStat;
        if ((rc = dst.descend(dstName, nullptr, &madeStat))) return fail(rc, to);
        Level level{st, from, to, made, parentIsOurs, false, stripInheritedAcl_, {}, 0};
        stripInheritedAcl_ = false;
        // An inherited default ACL must go before the contents are made, or they inherit it.
        if (level.strip && (rc = removeAclXattr(dst.fd(), kDefaultAclName, to))) return fail(rc, to);
        // A set-group-id directory (inherited from the caller's) hands its group on.
        level.childrenOurs = made && !(madeStat.st_mode & S_ISGID);
        if ((rc = readDirectoryEntries(src.fd(), &level.entries))) return fail(rc, from);
        levels_.push_back(std::move(level));
        return 0;
    }

    // The directory's contents are done: its own attributes (times last), then back up.
    int leaveDirectory(DirectoryCursor& src, DirectoryCursor& dst) {
        Level level = std::move(levels_.back());
        levels_.pop_back();
        stripInheritedAcl_ = level.strip;
        int rc = copyAttributes(src.fd(), dst.fd(), level.st, level.to,
                                level.made && ownerMatches(level.st, level.parentIsOurs), false);
        if (rc) return rc;
        if (sync_ == CopySync::EachItem && (rc = durable::fsyncDescriptor(dst.fd(), level.to))) return fail(rc, level.to);
        if ((rc = src.ascend())) return fail(rc, level.from);
        if ((rc = dst.ascend())) return fail(rc, level.to);
        return 0;
    }

    int copySpecial(int srcDir, const char* srcName, const struct stat& st, int dstDir, const char* dstName,
                    const std::string& from, const std::string& to) {
        int rc;
        if (S_ISLNK(st.st_mode)) {
            std::string target(static_cast<size_t>(st.st_size) + 1, '\0');
            ssize_t n = ::readlinkat(srcDir, srcName, target.data(), target.size());
            if (n < 0) return fail(errno, from);
            target.resize(static_cast<size_t>(n));
            rc = makeReplacing(dstDir, dstName, to, [&] { return durable::makeSymlinkAt(target, dstDir, dstName, to); });
        } else {
            rc = makeReplacing(dstDir, dstName, to,
                               [&] { return durable::makeNodeAt(dstDir, dstName, st.st_mode, st.st_rdev, to); });
        }
        if (rc) return fail(rc, to);
        // Links carry no mode, no ACL and (here) no extended attributes worth keeping.
        if (euid_ == 0 && (rc = durable::changeOwnerAt(dstDir, dstName, st.st_uid, st.st_gid, to))) return fail(rc, to);
        if (!S_ISLNK(st.st_mode)) {
            UniqueFd node(::openat(dstDir, dstName, O_PATH | O_NOFOLLOW | O_CLOEXEC));
            if (node.get() < 0) return fail(errno, to);
            if ((rc = durable::changeModeOfNode(node.get(), to, st.st_mode & 07777))) return fail(rc, to);
            if (stripInheritedAcl_ && (rc = removeAclXattr(node.get(), kAccessAclName, to))) return fail(rc, to);
        }
        struct timespec times[2] = {st.st_atim, st.st_mtim};
        if ((rc = durable::setTimesAt(dstDir, dstName, times, to))) return fail(rc, to);
        return 0;
    }

    // Owner before mode (a change of owner clears set-id bits), extended attributes
    // (ACLs among them) after the mode, times last. What the new item already has is
    // not written again.
    int copyAttributes(int src, int dst, const struct stat& st, const std::string& to, bool ownerIsRight,
                       bool modeIsRight) {
        int rc;
        if (euid_ == 0 && !ownerIsRight && (rc = durable::changeOwnerOfNode(dst, to, st.st_uid, st.st_gid)))
            return fail(rc, to);
        if (!modeIsRight && (rc = durable::changeModeOfNode(dst, to, st.st_mode & 07777))) return fail(rc, to);
        if ((rc = copyXattrs(src, dst, to))) return fail(rc, to);
        struct timespec times[2] = {st.st_atim, st.st_mtim};
        if ((rc = durable::setTimesOfNode(dst, to, times))) return fail(rc, to);
        return 0;
    }

    int copyXattrs(int src, int dst, const std::string& to) {
        ssize_t len = ::flistxattr(src, nullptr, 0);
        if (len < 0) return unsupported(errno) ? 0 : errno;
        bool hadAccess = false, hadDefault = false;
        if (len > 0) {
            std::vector<char> names(static_cast<size_t>(len));
            if ((len = ::flistxattr(src, names.data(), names.size())) < 0) return errno;
            std::vector<char> value;
            for (const char* name = names.data(); name < names.data() + len; name += std::strlen(name) + 1) {
                ssize_t size = ::fgetxattr(src, name, nullptr, 0);
                if (size < 0) return errno;
                value.resize(static_cast<size_t>(size));
                if (size > 0 && (size = ::fgetxattr(src, name, value.data(), value.size())) < 0) return errno;
                int rc = durable::setXattr(dst, to, name, value.data(), static_cast<size_t>(size));
                // The destination's file system may not hold this kind of attribute.
                if (rc && !unsupported(rc)) return rc;
                hadAccess |= std::strcmp(name, kAccessAclName) == 0;
                hadDefault |= std::strcmp(name, kDefaultAclName) == 0;
            }
        }
        if (!stripInheritedAcl_) return 0;
        if (int rc = hadAccess ? 0 : removeAclXattr(dst, kAccessAclName, to)) return rc;
        return hadDefault ? 0 : removeAclXattr(dst, kDefaultAclName, to);
    }

    // Drops an ACL the item got from its parent rather than from the source; probes
    // first so that the usual case, nothing inherited, writes nothing.
    static int removeAclXattr(int fd, const char* name, const std::string& to) {
        if (::getxattr(durable::descriptorPath(fd).c_str(), name, nullptr, 0) < 0) return 0;
        int rc = durable::removeXattr(fd, to, name);
        return rc == ENODATA || unsupported(rc) ? 0 : rc;
    }

    std::string* failedPath_;
    CopySync sync_;
    std::vector<Level> levels_;
    uid_t euid_;
    gid_t egid_;
    int umask_;
    bool stripInheritedAcl_ = false;
    durable::CopyMethod method_ = durable::CopyMethod::Clone;
};

}  // namespace

int copyTree(const std::string& from, const std::string& to, std::string* failedPath, CopySync sync) {
    return TreeCopier(failedPath, sync).copyTop(from, to);
}

}  // namespace vsl
