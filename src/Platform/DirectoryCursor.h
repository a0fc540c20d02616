// A walk's place in a directory tree, held by one descriptor at any depth. Going down
// opens the child without following a link; going up opens ".." and checks that it is
// the directory the walk came from (device and inode), else opens the way down again
// from the top, checking each level, so a directory moved meanwhile cannot take the
// walk anywhere else.
#pragma once

#include <sys/stat.h>

#include <string>
#include <vector>

#include "Platform/UniqueFd.h"

namespace vsl {

class DirectoryCursor {
public:
    // `top` is borrowed and must stay open while the cursor is used.
    explicit DirectoryCursor(int top) : top_(top) {}

    // The current directory: `top` until the first descend.
    int fd() const { return levels_.empty() ? top_ : current_.get(); }
    size_t depth() const { return levels_.size(); }

    // Makes the directory `name` of the current one current. With `expected`, it must
    // be that node (ESTALE otherwise): what a listing or an earlier stat saw. `opened`
    // receives its stat. Returns 0 or an errno value; on failure nothing changes.
    int descend(const char* name, const struct stat* expected = nullptr, struct stat* opened = nullptr);
    // Back to the parent of the current directory. On failure (the way back is gone)
    // the cursor is unusable.
    int ascend();

private:
    struct Level {
        std::string name;
        dev_t dev;
        ino_t ino;
    };
    int reopenFromTop();

    int top_;
    UniqueFd current_;
    std::vector<Level> levels_;
};

}  // namespace vsl
