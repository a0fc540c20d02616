#include "Platform/DurableIO.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>
#include <vector>

#include "Platform/DirectoryEntries.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Platform/Value.h"

namespace vsl::durable {

namespace {
#ifdef VESSEL_KILLPOINTS
std::atomic<uint64_t> gSteps{0};
// Steps numbered since the selected scope began; 0 while it has not.
std::atomic<uint64_t> gNumbered{0};
std::atomic<bool> gScopeBegun{false};

struct KillConfig {
    uint64_t killAt = 0;
    std::string traceFile;
    std::string dropFsync;  // "item" or "parent": a fault the rename audit must catch
    Scope scope = Scope::ClientMessages;
};
const KillConfig& killConfig() {
    static const KillConfig c = [] {
        KillConfig k;
        if (const char* s = std::getenv("VESSELD_KILL_AT")) k.killAt = std::strtoull(s, nullptr, 10);
        if (const char* s = std::getenv("VESSELD_DURABLE_TRACE")) k.traceFile = s;
        if (const char* s = std::getenv("VESSELD_TEST_DROP_FSYNC")) k.dropFsync = s;
        if (const char* s = std::getenv("VESSELD_KILL_SCOPE"); s && std::string(s) == "startup")
            k.scope = Scope::Startup;
        return k;
    }();
    return c;
}
bool dropsFsync(const char* which) { return killConfig().dropFsync == which; }
#else
constexpr bool dropsFsync(const char*) { return false; }
#endif

int writeAllAndSync(int fd, const void* data, size_t length) {
    const char* p = static_cast<const char*>(data);
    while (length > 0) {
        ssize_t n = ::write(fd, p, length);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        p += n;
        length -= static_cast<size_t>(n);
    }
    return ::fsync(fd) == 0 ? 0 : errno;
}

int result(int rc) { return rc == 0 ? 0 : errno; }

// An f* call on an O_PATH descriptor fails with EBADF; the /proc name of the
// descriptor then reaches the same inode.
template <class FdCall, class PathCall>
int onNode(int fd, FdCall fdCall, PathCall pathCall) {
    if (fdCall(fd) == 0) return 0;
    if (errno != EBADF) return errno;
    return result(pathCall(descriptorPath(fd).c_str()));
}

int copyByReadWrite(int from, int to) {
    char buf[1 << 16];
    for (;;) {
        ssize_t n = ::read(from, buf, sizeof buf);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        if (n == 0) return 0;
        for (ssize_t done = 0; done < n;) {
            ssize_t w = ::write(to, buf + done, static_cast<size_t>(n - done));
            if (w < 0) {
                if (errno == EINTR) continue;
                return errno;
            }
            done += w;
        }
    }
}
}  // namespace

std::string descriptorPath(int fd) { return "/proc/self/fd/" + std::to_string(fd); }

#ifdef VESSEL_KILLPOINTS
void beginScope(Scope scope) {
    if (scope == killConfig().scope) gScopeBegun.store(true);
}

void step(const char* kind, const std::string& path) {
    ++gSteps;
    if (!gScopeBegun.load()) return;
    uint64_t n = ++gNumbered;
    const KillConfig& k = killConfig();
    if (!k.traceFile.empty()) {
        static std::mutex traceMutex;
        std::lock_guard<std::mutex> g(traceMutex);
        if (FILE* f = std::fopen(k.traceFile.c_str(), "ae")) {
            std::fprintf(f, "%llu %s %s\n", static_cast<unsigned long long>(n), kind, path.c_str());
            std::fclose(f);
        }
    }
    if (k.killAt != 0 && n == k.killAt) ::_exit(86);
}

uint64_t stepCount() { return gSteps.load(); }
#endif

int makeDirectory(const std::string& path, mode_t mode) {
    step("mkdir", path);
    return result(::mkdir(path.c_str(), mode));
}

int renamePath(const std::string& from, const std::string& to) {
    step("rename", from + " -> " + to);
    return result(::rename(from.c_str(), to.c_str()));
}

int renameNoReplace(const std::string& from, const std::string& to) {
    step("rename", from + " -> " + to);
    return result(::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE));
}

int removeFile(const std::string& path) {
    step("unlink", path);
    return result(::unlink(path.c_str()));
}

int removeDirectory(const std::string& path) {
    step("rmdir", path);
    return result(::rmdir(path.c_str()));
}

int fsyncPath(const std::string& path) {
    step("fsync", path);
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return errno;
    int rc = ::fsync(fd) == 0 ? 0 : errno;
    ::close(fd);
    return rc;
}

int fsyncParent(const std::string& path) { return fsyncPath(parentPath(path)); }

int fsyncDescriptor(int fd, const std::string& path) {
    step("fsync", path);
    return result(::fsync(fd));
}

namespace {
// Both ends of a move are reached by the directory walk: a link that a user put in
// place of any component is refused, not followed (so a container never lands in a
// directory the user chose).
int openDirectory(const std::string& path, UniqueFd* fd, struct stat* st) {
    UniqueFd pinned;
    if (int rc = openDirectoryNoFollow(path, pinned.out())) return rc;
    fd->reset(::open(descriptorPath(pinned.get()).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd->valid()) return errno;
    return result(::fstat(fd->get(), st));
}

// A directory's entries reach the disk only with an fsync of the directory; a file's
// writer syncs its data itself (writeFile), and links and special files hold none.
int syncMovedItem(int dirfd, const std::string& name, const std::string& path) {
    UniqueFd node(::openat(dirfd, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    if (!node.valid()) return errno == ENOENT ? 0 : errno;  // the rename reports a missing source
    struct stat st;
    if (::fstat(node.get(), &st) != 0) return errno;
    if (!S_ISDIR(st.st_mode) || dropsFsync("item")) return 0;
    UniqueFd dir(::open(descriptorPath(node.get()).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!dir.valid()) return errno;
    return fsyncDescriptor(dir.get(), path);
}

int renameAndSync(const std::string& from, const std::string& to, bool syncItem) {
    UniqueFd fromDir, toDir;
    struct stat fromSt, toSt;
    if (int rc = openDirectory(parentPath(from), &fromDir, &fromSt)) return rc;
    if (int rc = openDirectory(parentPath(to), &toDir, &toSt)) return rc;
    std::string fromName = lastPathComponent(from), toName = lastPathComponent(to);
    if (syncItem)
        if (int rc = syncMovedItem(fromDir.get(), fromName, from)) return rc;
    step("rename", from + " -> " + to);
    if (::renameat(fromDir.get(), fromName.c_str(), toDir.get(), toName.c_str()) != 0) return errno;
    if (int rc = fsyncDescriptor(toDir.get(), parentPath(to))) return rc;
    bool sameDirectory = fromSt.st_dev == toSt.st_dev && fromSt.st_ino == toSt.st_ino;
    if (sameDirectory || dropsFsync("parent")) return 0;
    return fsyncDescriptor(fromDir.get(), parentPath(from));
}
}  // namespace

int renameDurably(const std::string& from, const std::string& to) { return renameAndSync(from, to, true); }

int writeFile(const std::string& path, const void* data, size_t length, mode_t mode) {
    step("write", path);
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode);
    if (fd < 0) return errno;
    int rc = writeAllAndSync(fd, data, length);
    ::close(fd);
    return rc;
}

namespace {
constexpr const char* kTemporarySuffix = ".tmp-";
constexpr size_t kUuidLength = 36;
}  // namespace

int writeFileAtomically(const std::string& path, const void* data, size_t length, mode_t mode) {
    // Appended piece by piece: GCC 12 at -O3 warns (falsely) about operator+ chains here.
    std::string name = ".";
    name += lastPathComponent(path);
    name += kTemporarySuffix;
    name += Uuid::random().string();
    std::string temp = joinPath(parentPath(path), name);
    if (int rc = writeFile(temp, data, length, mode)) return rc;
    int rc = renameAndSync(temp, path, false);  // writeFile synced the data
    if (rc) ::unlink(temp.c_str());
    return rc;
}

bool isTemporaryFileName(const std::string& name) {
    const size_t suffix = std::char_traits<char>::length(kTemporarySuffix) + kUuidLength;
    return name.size() > suffix + 1 && name[0] == '.' &&
           name.compare(name.size() - suffix, suffix - kUuidLength, kTemporarySuffix) == 0 &&
           Uuid::parse(name.substr(name.size() - kUuidLength)).has_value();
}

int removeTemporaryFiles(const std::string& directory) {
    UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd.valid()) return errno == ENOENT ? 0 : errno;
    std::vector<DirectoryEntry> entries;
    if (int rc = readDirectoryEntries(fd.get(), &entries)) return rc;
    int first = 0;
    for (const DirectoryEntry& e : entries) {
        if (!isTemporaryFileName(e.name)) continue;
        int rc = removeAt(fd.get(), e.name.c_str(), false, joinPath(directory, e.name));
        if (rc != 0 && rc != ENOENT && first == 0) first = rc;
    }
    return first;
}

int makeTemporaryDirectory(std::string* templ) {
    step("mkdir", *templ);
    return ::mkdtemp(templ->data()) ? 0 : errno;
}

int makeDirectoryAt(int dirfd, const char* name, mode_t mode, const std::string& path) {
    step("mkdir", path);
    return result(::mkdirat(dirfd, name, mode));
}

int createFileAt(int dirfd, const char* name, mode_t mode, const std::string& path, int* fd) {
    step("create", path);
    *fd = ::openat(dirfd, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
    return *fd < 0 ? errno : 0;
}

int makeSymlinkAt(const std::string& target, int dirfd, const char* name, const std::string& path) {
    step("symlink", path);
    return result(::symlinkat(target.c_str(), dirfd, name));
}

int makeNodeAt(int dirfd, const char* name, mode_t mode, dev_t dev, const std::string& path) {
    step("mknod", path);
    return result(::mknodat(dirfd, name, mode, dev));
}

int removeAt(int dirfd, const char* name, bool directory, const std::string& path) {
    step(directory ? "rmdir" : "unlink", path);
    return result(::unlinkat(dirfd, name, directory ? AT_REMOVEDIR : 0));
}

int copyFileData(int from, int to, off_t length, const std::string& path, CopyMethod* method) {
    step("write", path);
    CopyMethod m = method ? *method : CopyMethod::Clone;
    if (length == 0) return 0;
    if (m == CopyMethod::Clone) {
        if (::ioctl(to, FICLONE, from) == 0) return 0;
        if (errno != EOPNOTSUPP && errno != EXDEV && errno != EINVAL && errno != ENOTTY) return errno;
        m = CopyMethod::KernelCopy;
    }
    if (m == CopyMethod::KernelCopy) {
        off_t copied = 0;
        while (length < 0 || copied < length) {
            ssize_t n = ::copy_file_range(from, nullptr, to, nullptr, length < 0 ? (1 << 30) : length - copied, 0);
            if (n > 0) {
                copied += n;
                continue;
            }
            if (n == 0) break;
            if (errno == EINTR) continue;
            // Not possible between these files: both offsets stand where the kernel
            // stopped, so a plain copy carries on from there.
            if (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP) return errno;
            m = CopyMethod::ReadWrite;
            break;
        }
        if (m == CopyMethod::KernelCopy) {
            if (method) *method = m;
            return 0;
        }
    }
    if (method) *method = m;
    return copyByReadWrite(from, to);
}

int changeOwner(const std::string& path, uid_t uid, gid_t gid) {
    step("chown", path);
    return result(::chown(path.c_str(), uid, gid));
}

int changeOwnerOfNode(int fd, const std::string& path, uid_t uid, gid_t gid) {
    step("chown", path);
    return result(::fchownat(fd, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW));
}

int changeOwnerAt(int dirfd, const char* name, uid_t uid, gid_t gid, const std::string& path) {
    step("chown", path);
    return result(::fchownat(dirfd, name, uid, gid, AT_SYMLINK_NOFOLLOW));
}

int changeMode(const std::string& path, mode_t mode) {
    step("chmod", path);
    return result(::chmod(path.c_str(), mode));
}

int changeModeOfNode(int fd, const std::string& path, mode_t mode) {
    step("chmod", path);
    return onNode(fd, [&](int f) { return ::fchmod(f, mode); },
                  [&](const char* p) { return ::chmod(p, mode); });
}

int setTimesOfNode(int fd, const std::string& path, const struct timespec times[2]) {
    step("utimes", path);
    return onNode(fd, [&](int f) { return ::futimens(f, times); },
                  [&](const char* p) { return ::utimensat(AT_FDCWD, p, times, 0); });
}

int setTimesAt(int dirfd, const char* name, const struct timespec times[2], const std::string& path) {
    step("utimes", path);
    return result(::utimensat(dirfd, name, times, AT_SYMLINK_NOFOLLOW));
}

int setXattr(int fd, const std::string& path, const char* name, const void* value, size_t size) {
    step("xattr", path);
    return onNode(fd, [&](int f) { return ::fsetxattr(f, name, value, size, 0); },
                  [&](const char* p) { return ::setxattr(p, name, value, size, 0); });
}

int removeXattr(int fd, const std::string& path, const char* name) {
    step("xattr", path);
    return onNode(fd, [&](int f) { return ::fremovexattr(f, name); },
                  [&](const char* p) { return ::removexattr(p, name); });
}

int setACL(int fd, const std::string& path, acl_type_t type, acl_t acl) {
    step("acl", path);
    if (type == ACL_TYPE_ACCESS && ::acl_set_fd(fd, acl) == 0) return 0;
    if (type == ACL_TYPE_ACCESS && errno != EBADF) return errno;
    return result(::acl_set_file(descriptorPath(fd).c_str(), type, acl));
}

int removeDefaultACL(int fd, const std::string& path) {
    step("acl", path);
    return result(::acl_delete_def_file(descriptorPath(fd).c_str()));
}

int setFlags(int fd, const std::string& path, unsigned flags) {
    step("flags", path);
    int f = static_cast<int>(flags);
    return result(::ioctl(fd, FS_IOC_SETFLAGS, &f));
}

}  // namespace vsl::durable
