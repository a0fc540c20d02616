// The daemon's only way to touch the file system: directories with an exact mode,
// owner and protection class; moves, copies and removals of whole trees; listings and
// existence; unique temporary directories; the real location of a client-supplied path
// that must stay inside a base; and bringing a container tree to its standard owners,
// modes, ACLs and protection classes. Stateless: one shared instance, any thread.
// URLs are host paths; errors made here are POSIX-domain (code = errno) unless noted.
#pragma once

#include <fts.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/Core/VSLError.h"
#include "Platform/Acl.h"

namespace vsl {

// A data-protection class number. Its own type so that the creation forms taking an
// owner and those taking a class cannot be mixed up.
enum VSLDataProtectionClass : uint32_t {
    kVSLDataProtectionClassNotExplicit = 0,
    kVSLDataProtectionClassComplete = 1,
    kVSLDataProtectionClassCompleteUnlessOpen = 2,
    kVSLDataProtectionClassCompleteUntilFirstUserAuthentication = 3,
    kVSLDataProtectionClassNoProtection = 4,
    kVSLDataProtectionClassUnset = 0xFFFFFFFF,  // creation: leave the class alone
};

// One entry of a directory listing.
struct VSLItemURL {
    std::string path;
    bool isDirectory = false;
};

// The name of the metadata file inside a container; walks never touch it.
extern const char* const kVSLMetadataFileName;  // ".com.tarrow.vesselry.metadata.plist"

class VSLFileManager {
public:
    static VSLFileManager& defaultManager();

    // Home of `uid` from the password database, real path; "/private/var/mobile" below
    // the system root when there is none.
    static std::string homeDirectoryURLForPOSIXUID(uid_t uid);

    // ---- paths, creation and removal ----

    // Owner 0 leaves the owner alone; another owner is set as uid and gid. Class and owner
    // are re-applied (where they differ) also when the directory already existed.
    bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode, uid_t owner,
                              VSLDataProtectionClass protectionClass, VSLErrorRef* error) const;
    bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode, uid_t owner,
                              VSLErrorRef* error) const;
    bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                              VSLDataProtectionClass protectionClass, VSLErrorRef* error) const;
    bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                              VSLErrorRef* error) const;

    bool moveItemAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const;
    bool moveItemIfExistsAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const;
    bool copyItemAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const;
    bool copyItemIfExistsAtURL(const std::string& from, const std::string& to, VSLErrorRef* error) const;
    bool _moveItemAtURL(const std::string& from, const std::string& to, bool failIfSrcMissing,
                        VSLErrorRef* error) const;
    bool _copyItemAtURL(const std::string& from, const std::string& to, bool failIfSrcMissing,
                        VSLErrorRef* error) const;

    // A file or a whole tree; missing is success. An empty URL fails with EFAULT.
    bool removeItemAtURL(const std::string& url, VSLErrorRef* error) const;
    // The same for `relativePath` (plain names, no "." or "..") below `directory`,
    // reached through descriptors that follow no link. A missing item is success, a
    // directory missing (or a link) on the way to it is not.
    bool removeItemBelowDirectoryAtURL(const std::string& directory, const std::string& relativePath,
                                       VSLErrorRef* error) const;

    // Existence of the item itself (a final link is not followed).
    bool itemExistsAtURL(const std::string& url) const;
    bool itemDoesNotExistAtURL(const std::string& url) const;

    // Entries whose names do not begin with ".", in directory order.
    std::optional<std::vector<VSLItemURL>> urlsForItemsInDirectoryAtURL(const std::string& url,
                                                                        VSLErrorRef* error) const;

    std::optional<std::string> createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                      const std::string& prefix,
                                                                      VSLErrorRef* error) const;
    std::optional<std::string> createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                      VSLErrorRef* error) const;  // "temp."

    // Depth-first, physical, one file system; every node (directories before and after
    // their contents) goes to `block`, which returns whether to go on.
    using TraverseBlock = std::function<bool(FTSENT* node, VSLErrorRef* error)>;
    bool _traverseDirectory(const std::string& url, VSLErrorRef* error, const TraverseBlock& block) const;

    // The real location of `suspicious` when it lies inside `base` (or is the base);
    // none otherwise, with a code-10 error saying why. Callers must use the returned
    // path, not `suspicious`: the check holds for what it returns.
    std::optional<std::string> realPathForURL(const std::string& suspicious, const std::string& base,
                                              VSLErrorRef* error = nullptr) const;
    std::optional<std::string> _realPathForURL(const std::string& url, bool allowNonExistentPathComponents) const;
    std::optional<std::string> _realPathWhatExistsInPath(const std::string& path) const;
    bool _validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth) const;

    // ---- ownership, ACLs, protection classes, disk usage ----

    // Every item to `uid`/`gid` with 0755 (directories, executables) or 0644; the
    // metadata file is left alone. Writes only what differs.
    bool standardizeOwnershipAtURL(const std::string& url, uid_t uid, gid_t gid, VSLErrorRef* error) const;
    bool standardizeACLsAtURL(const std::string& url, bool isSystemContainer, VSLErrorRef* error) const;
    bool standardizeACLsForSystemContainerAtURL(const std::string& url, VSLErrorRef* error) const;
    bool standardizeAllSystemContainerACLsAtURL(const std::string& url, VSLErrorRef* error) const;
    bool setTopLevelSystemContainerACLAtURL(const std::string& url, VSLErrorRef* error) const;

    // The system-container ACLs; failures are code 63 errors.
    std::optional<ExtendedAcl> _CopySystemContainerACLWithNumACEs(int numACEs, bool isDir, bool inheritOnly,
                                                                  VSLErrorRef* error) const;
    std::optional<ExtendedAcl> _CopyTopLevelSystemContainerACLWithError(VSLErrorRef* error) const;
    bool _CreateSystemUserACEInACL(ExtendedAcl& acl, uint32_t permissions, uint32_t flags,
                                   VSLErrorRef* error) const;

    bool dataProtectionClassOfItemAtURL(const std::string& url, VSLDataProtectionClass* protectionClass,
                                        VSLErrorRef* error) const;
    // `predicate` (may be empty) sees the current class; when it declines, nothing changes.
    bool setDataProtectionClassOfItemAtURL(const std::string& url, VSLDataProtectionClass protectionClass,
                                           const std::function<bool(VSLDataProtectionClass)>& predicate,
                                           VSLErrorRef* error) const;

    // Bytes in regular files below `url`; 0 when unknown.
    uint64_t diskUsageForURL(const std::string& url) const;
    uint64_t fastDiskUsageForURL(const std::string& url) const;

    void printDirectoryStructureAtURL(const std::string& url) const;

private:
    VSLFileManager() = default;
};

}  // namespace vsl
