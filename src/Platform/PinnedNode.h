// Re-opening an item a path walk has seen, for a write, so that a symbolic link
// swapped into its path since the walk looked cannot redirect the write elsewhere:
// no link is followed below the walk's top (openat2 RESOLVE_BENEATH and
// RESOLVE_NO_SYMLINKS) and the item must still be the one the walk saw.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>

#include <string>

namespace vsl {

class NodePinner {
public:
    explicit NodePinner(const std::string& top);  // the walk's starting path
    ~NodePinner();
    NodePinner(const NodePinner&) = delete;
    NodePinner& operator=(const NodePinner&) = delete;

    // `path` is the top or below it. Returns a descriptor opened with `flags` (a final
    // link is opened itself with O_PATH and refused otherwise), or -1 with errno:
    // ESTALE when another item now stands at `path`.
    int open(const std::string& path, const struct stat& expected, int flags = O_PATH) const;

private:
    int parentFd_ = -1;
    std::string top_;
    std::string parent_;
};

}  // namespace vsl
