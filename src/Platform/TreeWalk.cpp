#include "Platform/TreeWalk.h"

#include <cerrno>

namespace vsl {

int walkTree(const std::string& path, const std::function<bool(FTSENT*)>& visit, TreeWalkFailure* where) {
    if (where) *where = TreeWalkFailure::None;
    std::string top = path;
    while (top.size() > 1 && top.back() == '/') top.pop_back();
    char* paths[] = {top.data(), nullptr};
    FTS* fts = ::fts_open(paths, kTreeWalkOptions, nullptr);
    if (!fts) {
        if (where) *where = TreeWalkFailure::Open;
        return errno;
    }
    int rc = 0;
    for (;;) {
        errno = 0;
        FTSENT* node = ::fts_read(fts);
        if (!node) {
            if (errno != 0) {
                rc = errno;
                if (where) *where = TreeWalkFailure::Read;
            }
            break;
        }
        if (!visit(node)) break;
    }
    if (::fts_close(fts) != 0 && rc == 0) {
        rc = errno;
        if (where) *where = TreeWalkFailure::Close;
    }
    return rc;
}

}  // namespace vsl
