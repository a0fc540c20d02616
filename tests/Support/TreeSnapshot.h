// Everything about a directory tree that a read-only tool must leave alone: every
// node's type, mode, owner, size, modification time, contents (regular files), link
// target and extended attributes, keyed by relative path.
#pragma once

#include <map>
#include <string>

namespace vsl::test {

using TreeSnapshot = std::map<std::string, std::string>;

TreeSnapshot snapshotTree(const std::string& root);

}  // namespace vsl::test
