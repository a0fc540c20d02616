// The one narrow way the daemon changes the disk. Every durable step (mkdir, rename,
// unlink, rmdir, file write, fsync, owner/mode/ACL/flag/xattr change) passes
// through here so that crash tests can count them: in builds with
// VESSEL_KILLPOINTS, VESSELD_KILL_AT=N exits with status 86 just before the Nth step
// and VESSELD_DURABLE_TRACE=FILE appends "<n> <kind> <path>" for each (the path of a
// rename is "<from> -> <to>"). Steps are numbered from the first client message, or,
// with VESSELD_KILL_SCOPE=startup, from the beginning of start-up, so that a crash
// during the repair of an earlier one is exercised too. Functions return 0 or an
// errno value.
#pragma once

#include <sys/acl.h>
#include <sys/types.h>

#include <ctime>
#include <cstddef>
#include <cstdint>
#include <string>

namespace vsl::durable {

// Where the numbering of VESSELD_KILL_AT and the trace begins.
enum class Scope { Startup, ClientMessages };

#ifdef VESSEL_KILLPOINTS
void step(const char* kind, const std::string& path);
uint64_t stepCount();  // every step of the process, numbered or not
// Starts the numbering when `scope` is the one VESSELD_KILL_SCOPE selects; later
// calls change nothing.
void beginScope(Scope scope);
#else
inline void step(const char*, const std::string&) {}  // release builds count nothing
inline void beginScope(Scope) {}
#endif

int makeDirectory(const std::string& path, mode_t mode);
// Bare renames, for files that need not survive a power cut (under run/); anything
// else moves with renameDurably.
int renamePath(const std::string& from, const std::string& to);
int renameNoReplace(const std::string& from, const std::string& to);
int removeFile(const std::string& path);
int removeDirectory(const std::string& path);
int fsyncPath(const std::string& path);  // file or directory
int fsyncParent(const std::string& path);
int fsyncDescriptor(int fd, const std::string& path);
// The one durable move of a tree or file: fsync of the item itself (a directory or a
// regular file; links and special files carry nothing to flush), the rename, then
// fsync of the destination's and the source's directories, so that after a power cut
// the item is in exactly one of the two places, whole. The directories are opened
// without following a final link and the rename is made relative to them, so the
// fsyncs reach the directories that changed. EXDEV is returned untouched for the
// caller's copy.
int renameDurably(const std::string& from, const std::string& to);

// Creates or truncates `path`, writes all bytes and fsyncs the file.
int writeFile(const std::string& path, const void* data, size_t length, mode_t mode);
// Temporary file beside `path`, fsync, rename over `path`, fsync of the directory.
int writeFileAtomically(const std::string& path, const void* data, size_t length, mode_t mode);
// The temporary files of writeFileAtomically (".NAME.tmp-UUID"): hidden from the
// daemon's listings, so a crash between the write and the rename would leave one for
// ever. Removed at start-up from the directories of the daemon's own files.
bool isTemporaryFileName(const std::string& name);
int removeTemporaryFiles(const std::string& directory);  // 0 or the first errno
// mkdtemp: `templ` ends in "XXXXXX" and is filled in on success.
int makeTemporaryDirectory(std::string* templ);

// Descriptor-relative forms for walks: `path` only names the step in the trace. They
// never follow a final symbolic link.
int makeDirectoryAt(int dirfd, const char* name, mode_t mode, const std::string& path);
int createFileAt(int dirfd, const char* name, mode_t mode, const std::string& path, int* fd);  // O_EXCL
int makeSymlinkAt(const std::string& target, int dirfd, const char* name, const std::string& path);
int makeNodeAt(int dirfd, const char* name, mode_t mode, dev_t dev, const std::string& path);
int removeAt(int dirfd, const char* name, bool directory, const std::string& path);
// Whole contents of `from` (`length` bytes, -1 if unknown) into the empty file `to`: a
// clone where the file system can, else an in-kernel copy, else read/write. `*method`
// is where to start and comes back as what worked, so a tree copy stops retrying
// what this pair of file systems cannot do.
enum class CopyMethod { Clone, KernelCopy, ReadWrite };
int copyFileData(int from, int to, off_t length, const std::string& path, CopyMethod* method = nullptr);

// Attribute changes. `fd` may be an O_PATH descriptor that pinned the item, so a path
// swapped after the caller's check cannot redirect the write.
int changeOwner(const std::string& path, uid_t uid, gid_t gid);  // follows a final link
int changeOwnerOfNode(int fd, const std::string& path, uid_t uid, gid_t gid);
int changeOwnerAt(int dirfd, const char* name, uid_t uid, gid_t gid, const std::string& path);
int changeMode(const std::string& path, mode_t mode);
int changeModeOfNode(int fd, const std::string& path, mode_t mode);  // not for symbolic links
int setTimesOfNode(int fd, const std::string& path, const struct timespec times[2]);
int setTimesAt(int dirfd, const char* name, const struct timespec times[2], const std::string& path);
int setXattr(int fd, const std::string& path, const char* name, const void* value, size_t size);
int removeXattr(int fd, const std::string& path, const char* name);
int setACL(int fd, const std::string& path, acl_type_t type, acl_t acl);
int removeDefaultACL(int fd, const std::string& path);
// FS_IOC_SETFLAGS: needs an ordinary (not O_PATH) descriptor.
int setFlags(int fd, const std::string& path, unsigned flags);

// Directories reached without trusting what a user could have put on the way. The
// path is walked one component at a time with O_NOFOLLOW. A symbolic link is followed
// only where nobody but root can have placed it (its directory and every one above it
// owned by root and not writable by group or others, or sticky with a root-owned link);
// anywhere else it fails with ELOOP, and a component that is no directory with
// ENOTDIR. `*fd` comes back as an O_PATH descriptor of the directory, checked with
// fstat: the f* forms above act on it.
int openDirectoryNoFollow(const std::string& path, int* fd);
// The same walk making what is missing: every missing component when `intermediates`,
// else only the last one. New directories get exactly `mode`, whatever the umask;
// an existing directory is left as it is and is no error.
int makeDirectoryNoFollow(const std::string& path, mode_t mode, bool intermediates, int* fd);

// "/proc/self/fd/N": names what `fd` refers to, whatever happened to its path since.
std::string descriptorPath(int fd);

}  // namespace vsl::durable
