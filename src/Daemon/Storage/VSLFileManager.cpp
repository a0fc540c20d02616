#include "Daemon/Storage/VSLFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "Platform/DirectoryEntries.h"
#include "Platform/DurableIO.h"
#include "Platform/FileFlags.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/ProtectionClass.h"
#include "Platform/SystemRoot.h"
#include "Platform/TreeCopy.h"
#include "Platform/TreeRemove.h"
#include "Platform/TreeWalk.h"
#include "Platform/UniqueFd.h"

namespace vsl {

const char* const kVSLMetadataFileName = ".com.tarrow.vesselry.metadata.plist";

namespace {

const char* const kRemoveFunction = "-[VSLFileManager removeItemAtURL:error:]";

void setError(VSLErrorRef* out, VSLErrorRef error) {
    if (out) *out = std::move(error);
}

// An item the removal could not unlink because it is immutable: clear the flag and
// remove it. True when it is gone.
bool removeImmutableItem(const RemoveFailure& failure) {
    struct stat st;
    if (::fstatat(failure.parentFd, failure.name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
        LogWrite(kLogLevelError, kRemoveFunction, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", failure.path,
                 std::strerror(errno));
        return false;
    }
    if (S_ISLNK(st.st_mode)) return false;  // links carry no inode flags here
    bool wasSet = false;
    if (int rc = clearImmutableFlagAt(failure.parentFd, failure.name, failure.path, &wasSet)) {
        LogWrite(kLogLevelError, kRemoveFunction, "Failed to lchflags %s: %s", failure.path, std::strerror(rc));
        return false;
    }
    if (!wasSet) return false;
    LogWrite(kLogLevelNotice, kRemoveFunction, "Unset UF_IMMUTABLE on %s", failure.path);
    if (int rc = durable::removeAt(failure.parentFd, failure.name, S_ISDIR(st.st_mode), failure.path)) {
        LogWrite(kLogLevelError, kRemoveFunction, "unlink of %s failed: %s", failure.path, std::strerror(rc));
        return false;
    }
    return true;
}

}  // namespace

VSLFileManager& VSLFileManager::defaultManager() {
    static VSLFileManager manager;
    return manager;
}

std::string VSLFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
    static const char* const fn = "+[VSLFileManager homeDirectoryURLForPOSIXUID:]";
    auto entry = passwordEntryForUID(uid);
    if (!entry) {
        LogWrite(kLogLevelError, fn, "Failed to getpwuid for uid: %u", uid);
    } else {
        char buf[PATH_MAX];
        if (entry->home.size() < 1025 && ::realpath(entry->home.c_str(), buf) && std::strlen(buf) < 1025) return buf;
    }
    LogWrite(kLogLevelError, fn, "Failed to get home dir using getpwuid for uid: %u", uid);
    return rootedPath("/private/var/mobile");
}

// ---- creation ----

bool VSLFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          uid_t owner, VSLDataProtectionClass protectionClass,
                                          VSLErrorRef* error) const {
    // Class and owner go through the descriptor the walk checked: a link put in place
    // of any component by a user is refused, never followed.
    UniqueFd dir;
    if (int rc = durable::makeDirectoryNoFollow(url, mode, withIntermediateDirectories, dir.out())) {
        setError(error, VSL_POSIX_ERROR(rc, withIntermediateDirectories ? "mkpath_np of %s failed: %s"
                                                                        : "mkdir of %s failed: %s",
                                        url, std::strerror(rc)));
        return false;
    }
    if (protectionClass != kVSLDataProtectionClassUnset) {
        if (int rc = setProtectionClass(dir.get(), url, static_cast<int>(protectionClass))) {
            setError(error, VSL_POSIX_ERROR(rc, "Failed to setclass(%d) on directory %s: %s",
                                            static_cast<int>(protectionClass), url, std::strerror(rc)));
            return false;
        }
    }
    if (owner != 0) {
        struct stat st;
        int rc = ::fstat(dir.get(), &st) != 0 ? errno : 0;
        if (rc == 0 && (st.st_uid != owner || st.st_gid != owner))
            rc = durable::changeOwnerOfNode(dir.get(), url, owner, owner);
        if (rc) {
            setError(error, VSL_POSIX_ERROR(rc, "Failed to chown(%d,%d) %s: %s", static_cast<int>(owner),
                                            static_cast<int>(owner), url, std::strerror(rc)));
            return false;
        }
    }
    return true;
}

bool VSLFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          uid_t owner, VSLErrorRef* error) const {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner, kVSLDataProtectionClassUnset, error);
}

bool VSLFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          VSLDataProtectionClass protectionClass, VSLErrorRef* error) const {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, protectionClass, error);
}

bool VSLFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          VSLErrorRef* error) const {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, kVSLDataProtectionClassUnset, error);
}

// ---- move and copy ----

namespace {
// With `failIfSrcMissing` off, a missing source means there is nothing to do.
bool sourceMissing(const std::string& from, bool failIfSrcMissing, VSLErrorRef* error, bool* failed) {
    *failed = false;
    if (failIfSrcMissing) return false;
    struct stat st;
    if (::lstat(from.c_str(), &st) == 0) return false;
    int err = errno;
    if (err == ENOENT) return true;
    setError(error, VSL_POSIX_ERROR(err, "stat of %@ failed: %s", from, std::strerror(err)));
    *failed = true;
    return true;
}
}  // namespace

bool VSLFileManager::_moveItemAtURL(const std::string& from, const std::string& to, bool failIfSrcMissing,
                                    VSLErrorRef* error) const {
    bool failed = false;
    if (sourceMissing(from, failIfSrcMissing, error, &failed)) return !failed;
    int rc = durable::renameDurably(from, to);
    if (rc == 0) return true;
    if (rc != EXDEV) {
        setError(error, VSL_POSIX_ERROR(rc, "rename of %@ to %@ failed: %s", from, to, std::strerror(rc)));
        return false;
    }
    // Across devices: a synced copy, then the source goes. A copy that fails halfway
    // is removed, or it would pass for the item.
    struct stat st;
    bool destinationExisted = ::lstat(to.c_str(), &st) == 0;
    rc = copyTree(from, to, nullptr, CopySync::EachItem);
    if (rc == 0) rc = durable::fsyncParent(to);
    if (rc) {
        VSLErrorRef cleanUpError;
        if (!destinationExisted && !removeItemAtURL(to, &cleanUpError))
            LogWrite(kLogLevelError, "-[VSLFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]",
                     "Failed to remove partial copy at %@ : %@", to, cleanUpError);
        setError(error, VSL_POSIX_ERROR(rc, "copyfile of %@ to %@ failed: %s", from, to, std::strerror(rc)));
        return false;
    }
    VSLErrorRef removeError;
    if (!removeItemAtURL(from, &removeError))
        LogWrite(kLogLevelError, "-[VSLFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]",
                 "Failed to remove move source after copy at %@ : %@", from, removeError);
    else
        durable::fsyncParent(from);  // best effort: a source back after a power cut is a duplicate, not a loss
    return true;
}

bool VSLFileManager::_copyItemAtURL(const std::string& from, const std::string& to, bool failIfSrcMissing,
                                    VSLErrorRef* error) const {
    bool failed = false;
    if (sourceMissing(from, failIfSrcMissing, error, &failed)) return !failed;
    if (int rc = copyTree(from, to)) {
        setError(error, VSL_POSIX_ERROR(rc, "copyfile of %@ to %@ failed: %s", from, to, std::strerror(rc)));
        return false;
    }
    return true;
}

bool VSLFileManager::moveItemAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const {
    return _moveItemAtURL(from, to, true, error);
}

bool VSLFileManager::moveItemIfExistsAtURL(const std::string& from, const std::string& to,
                                           VSLErrorRef* error) const {
    return _moveItemAtURL(from, to, false, error);
}

bool VSLFileManager::copyItemAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const {
    return _copyItemAtURL(from, to, true, error);
}

bool VSLFileManager::copyItemIfExistsAtURL(const std::string& from, const std::string& to,
                                           VSLErrorRef* error) const {
    return _copyItemAtURL(from, to, false, error);
}

// ---- removal ----

namespace {

// The removal's per-item failures: the first one is the one reported; an item that
// vanished meanwhile is none.
int removeWith(const std::function<int(const std::function<void(const RemoveFailure&)>&)>& remove) {
    int firstError = 0;
    int rc = remove([&](const RemoveFailure& failure) {
        if (failure.error != ENOENT)
            LogWrite(kLogLevelError, kRemoveFunction, "removefile hit error for %s : %s", failure.path,
                     std::strerror(failure.error));
        if (failure.error == EPERM && removeImmutableItem(failure)) return;
        if (firstError == 0 && failure.error != ENOENT) firstError = failure.error;
    });
    if (rc == ENOENT) rc = 0;
    return rc ? rc : firstError;
}

}  // namespace

bool VSLFileManager::removeItemAtURL(const std::string& url, VSLErrorRef* error) const {
    if (url.empty()) {
        setError(error, VSL_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
        return false;
    }
    int rc = removeWith([&](const auto& onError) { return removeTree(url, onError); });
    if (rc) {
        setError(error, VSL_POSIX_ERROR(rc, "removefile of %@ failed: %s", url, std::strerror(rc)));
        return false;
    }
    return true;
}

bool VSLFileManager::removeItemBelowDirectoryAtURL(const std::string& directory, const std::string& relativePath,
                                                   VSLErrorRef* error) const {
    const std::string path = joinPath(directory, relativePath);
    auto fail = [&](int rc) {
        setError(error, createPOSIXError("-[VSLFileManager removeItemBelowDirectoryAtURL:relativePath:error:]",
                                         __LINE__, rc, "removefile of %@ failed: %s", path, std::strerror(rc)));
        return false;
    };
    std::vector<std::string> names;
    for (size_t at = 0; at <= relativePath.size();) {
        size_t end = std::min(relativePath.find('/', at), relativePath.size());
        std::string name = relativePath.substr(at, end - at);
        if (name.empty() || name == "." || name == "..") return fail(EINVAL);
        names.push_back(std::move(name));
        at = end + 1;
    }
    // Every step is relative to the one before and follows no link: a directory
    // swapped for a link on the way ends the removal (ELOOP, ENOTDIR).
    UniqueFd parent;
    if (int rc = durable::openDirectoryNoFollow(directory, parent.out())) return fail(rc);
    for (size_t i = 0; i + 1 < names.size(); i++) {
        UniqueFd next(::openat(parent.get(), names[i].c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!next.valid()) return fail(errno);
        parent = std::move(next);
    }
    int rc = removeWith([&](const auto& onError) { return removeTreeAt(parent.get(), names.back(), path, onError); });
    return rc ? fail(rc) : true;
}

// ---- existence and listing ----

bool VSLFileManager::itemExistsAtURL(const std::string& url) const {
    struct stat st;
    if (::lstat(url.c_str(), &st) == 0) return true;
    if (errno != ENOENT)
        LogWrite(kLogLevelError, "-[VSLFileManager itemExistsAtURL:]", "Failed to determine if %@ exists: %s", url,
                 std::strerror(errno));
    return false;
}

bool VSLFileManager::itemDoesNotExistAtURL(const std::string& url) const {
    struct stat st;
    if (::lstat(url.c_str(), &st) == 0) return false;
    if (errno == ENOENT) return true;
    LogWrite(kLogLevelError, "-[VSLFileManager itemDoesNotExistAtURL:]", "Failed to determine if %@ exists: %s", url,
             std::strerror(errno));
    return false;
}

std::optional<std::vector<VSLItemURL>> VSLFileManager::urlsForItemsInDirectoryAtURL(const std::string& url,
                                                                                     VSLErrorRef* error) const {
    const char* const writer = VSL_FUNCTION;
    auto failure = [&](int err) {
        setError(error, createPOSIXError(writer, __LINE__, err, "_IterateDirectory for %@ returned %s", url,
                                         std::strerror(err)));
        return std::nullopt;
    };
    int fd = ::open(url.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        int err = errno;
        if (err != ENOENT)
            LogWrite(kLogLevelError, "-[VSLFileManager urlsForItemsInDirectoryAtURL:error:]",
                     "opendir of %s failed: %s", url, std::strerror(err));
        return failure(err);
    }
    std::vector<DirectoryEntry> entries;
    int rc = readDirectoryEntries(fd, &entries);
    std::vector<VSLItemURL> urls;
    for (const DirectoryEntry& e : entries) {
        if (rc || e.name[0] == '.') continue;
        bool isDirectory = e.type == DT_DIR;
        if (e.type == DT_UNKNOWN) {
            struct stat st;
            if (::fstatat(fd, e.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
                rc = errno;
                continue;
            }
            isDirectory = S_ISDIR(st.st_mode);
        }
        urls.push_back({joinPath(url, e.name), isDirectory});
    }
    ::close(fd);
    if (rc) return failure(rc);
    return urls;
}

// ---- temporary directories ----

std::optional<std::string> VSLFileManager::createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                                  const std::string& prefix,
                                                                                  VSLErrorRef* error) const {
    std::string path = joinPath(directory, prefix + "XXXXXX");
    if (int rc = durable::makeTemporaryDirectory(&path)) {
        setError(error, VSL_POSIX_ERROR(rc, "Failed to create temp dir at path %s : %s", path, std::strerror(rc)));
        return std::nullopt;
    }
    return path;
}

std::optional<std::string> VSLFileManager::createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                                  VSLErrorRef* error) const {
    return createTemporaryDirectoryInDirectoryURL(directory, "temp.", error);
}

// ---- traversal ----

bool VSLFileManager::_traverseDirectory(const std::string& url, VSLErrorRef* error,
                                        const TraverseBlock& block) const {
    SignpostInterval signpost(LogCategory::Fs, "TraversingDirectory", " path=%{private, signpost.description:attribute}@ ",
                              url);
    uint64_t nodes = 0;
    bool completed = true;
    TreeWalkFailure where;
    const char* const writer = VSL_FUNCTION;
    int rc = walkTree(
        url,
        [&](FTSENT* node) {
            nodes++;
            if (node->fts_info == FTS_ERR || node->fts_info == FTS_DNR) {
                setError(error, createPOSIXError(writer, __LINE__, node->fts_errno, "Error for path %s: %s",
                                                 node->fts_path, std::strerror(node->fts_errno)));
                completed = false;
                return false;
            }
            if (!block(node, error)) completed = false;
            return completed;
        },
        &where);
    if (rc && completed) {
        const char* format = where == TreeWalkFailure::Open    ? "fts_open failed for %s with error %s"
                             : where == TreeWalkFailure::Close ? "fts_close failed for %s with error %s"
                                                               : "Error for path %s: %s";
        setError(error, VSL_POSIX_ERROR(rc, format, url, std::strerror(rc)));
        completed = false;
    }
    signpost.end(" path=%{private, signpost.description:attribute}@  numNodes=%{public, signpost.description:attribute}llu ",
                 url, static_cast<unsigned long long>(nodes));
    return completed;
}

}  // namespace vsl
