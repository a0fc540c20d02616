// Recursive copy of a file, link or directory tree that follows no symbolic link on
// either side: file data (cloned where the file system can, else copied in the
// kernel), mode, owner, access and modification times, extended attributes and POSIX
// ACLs. An existing destination directory is merged into; an existing destination
// file or link is replaced, as rename would. Owners are kept only when running as root.
#pragma once

#include <string>

namespace vsl {

// Returns 0 or the errno of the first failure; `failedPath` then names the item.
int copyTree(const std::string& from, const std::string& to, std::string* failedPath = nullptr);

}  // namespace vsl
