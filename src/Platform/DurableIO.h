// The one narrow way the daemon changes the disk. Every durable step (mkdir, rename,
// unlink, rmdir, file write, fsync, owner/mode/ACL/flag/xattr change) passes
// through here so that crash tests can count them: in builds with
// VESSEL_KILLPOINTS, VESSELD_KILL_AT=N exits with status 86 just before the Nth step
// and VESSELD_DURABLE_TRACE=FILE appends "<n> <kind> <path>" for each.
// Functions return 0 or an errno value.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>

namespace vsl::durable {

void step(const char* kind, const std::string& path);
uint64_t stepCount();

int makeDirectory(const std::string& path, mode_t mode);
int renamePath(const std::string& from, const std::string& to);
int renameNoReplace(const std::string& from, const std::string& to);
int removeFile(const std::string& path);
int removeDirectory(const std::string& path);
int fsyncPath(const std::string& path);  // file or directory
int fsyncParent(const std::string& path);

// Creates or truncates `path`, writes all bytes and fsyncs the file.
int writeFile(const std::string& path, const void* data, size_t length, mode_t mode);
// Temporary file beside `path`, fsync, rename over `path`, fsync of the directory.
int writeFileAtomically(const std::string& path, const void* data, size_t length, mode_t mode);

}  // namespace vsl::durable
