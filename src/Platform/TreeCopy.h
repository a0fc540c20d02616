// Recursive copy of a file, link or directory tree that follows no symbolic link on
// either side: file data (cloned where the file system can, else copied in the
// kernel), mode, owner, access and modification times, extended attributes and POSIX
// ACLs. An existing destination directory is merged into; an existing destination
// file or link is replaced, as rename would. Owners are kept only when running as root.
// It holds one descriptor per tree (plus the file being copied) at any depth, and
// refuses (ESTALE) a source item that is not the node it listed.
#pragma once

#include <string>

namespace vsl {

// EachItem fsyncs every file and directory made, directories after their contents;
// the caller syncs the directory that holds the copy.
enum class CopySync { None, EachItem };

// Returns 0 or the errno of the first failure; `failedPath` then names the item.
int copyTree(const std::string& from, const std::string& to, std::string* failedPath = nullptr,
             CopySync sync = CopySync::None);

}  // namespace vsl
