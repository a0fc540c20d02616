// What a directory tree looks like on disk, to compare before and after an operation
// that must not have touched it.
#pragma once

#include <functional>
#include <map>
#include <string>

namespace vsl::test {

// Every node below `directory` (and the directory itself, as "."), by relative path,
// without following links: type, mode, owner and link target; with `full` also the
// inode, change time, extended attributes (ACLs) and file contents, so that anything
// moved, removed, re-owned or rewritten shows.
std::map<std::string, std::string> treeState(const std::string& directory, bool full = true);

// Every node below `directory` (itself as "."), without following links: type, mode,
// owner, size, modification time, a digest of a regular file's contents, link target
// and every extended attribute (ACLs included). Paths for which `skip` is true (relative, with a leading "/") are left
// out, their subtrees too: what the daemon may change by itself (its log, its database).
using TreeSnapshot = std::map<std::string, std::string>;
TreeSnapshot snapshotTree(const std::string& directory,
                          const std::function<bool(const std::string&)>& skip = nullptr);

// The differences, one line per path, for a failure message; empty when equal.
std::string describeDifferences(const TreeSnapshot& before, const TreeSnapshot& after);

}  // namespace vsl::test
