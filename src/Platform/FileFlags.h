// Inode flags (FS_IOC_GETFLAGS / FS_IOC_SETFLAGS); the immutable flag blocks unlink
// even for root. Setting it needs CAP_LINUX_IMMUTABLE and a file system with flags.
#pragma once

#include <string>

namespace vsl {

extern const unsigned kFileFlagImmutable;

// `fd` is an ordinary (not O_PATH) descriptor. Return 0 or an errno value.
int getFileFlags(int fd, unsigned* flags);
int setFileFlags(int fd, const std::string& path, unsigned flags);  // a durable step

// Opens `name` in `dirfd` without following a link and clears the immutable flag.
// `*wasSet` tells whether it was set; nothing is written when it was not.
int clearImmutableFlagAt(int dirfd, const char* name, const std::string& path, bool* wasSet);

}  // namespace vsl
