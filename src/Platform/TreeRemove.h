// Recursive removal that follows no symbolic link and keeps going past items it
// cannot remove: each failure goes to a callback, which may repair and retry the
// item itself (for example clear an immutable flag). Works relative to the descriptor
// of the directory it is in (one at any depth, see DirectoryCursor), so a link
// swapped into the tree cannot send it outside and no depth runs out of descriptors.
#pragma once

#include <functional>
#include <string>

namespace vsl {

struct RemoveFailure {
    const std::string& path;
    int error;
    int parentFd;      // the directory holding the item
    const char* name;  // the item's name in it
    bool isDirectory;
};

// Returns 0 when the walk ran (per-item failures only reach `onError`), or the errno
// that kept it from starting: ENOENT when nothing is at `path`.
int removeTree(const std::string& path, const std::function<void(const RemoveFailure&)>& onError);
// The same for the entry `name` of the directory `parentFd` (which may be an O_PATH
// descriptor): nothing on the way to it is looked up by path. `path` only names it.
int removeTreeAt(int parentFd, const std::string& name, const std::string& path,
                 const std::function<void(const RemoveFailure&)>& onError);

}  // namespace vsl
