#include "Platform/DirectoryCursor.h"

#include <fcntl.h>

#include <cerrno>

namespace vsl {

namespace {
constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

bool sameNode(const struct stat& st, dev_t dev, ino_t ino) { return st.st_dev == dev && st.st_ino == ino; }
}  // namespace

int DirectoryCursor::descend(const char* name, const struct stat* expected, struct stat* opened) {
    UniqueFd child(::openat(fd(), name, kDirectoryFlags));
    if (!child.valid()) return errno;
    struct stat st;
    if (::fstat(child.get(), &st) != 0) return errno;
    if (expected && !sameNode(st, expected->st_dev, expected->st_ino)) return ESTALE;
    levels_.push_back({name, st.st_dev, st.st_ino});
    current_ = std::move(child);
    if (opened) *opened = st;
    return 0;
}

int DirectoryCursor::ascend() {
    levels_.pop_back();
    if (levels_.empty()) {
        current_.reset();
        return 0;
    }
    const Level& parent = levels_.back();
    UniqueFd up(::openat(current_.get(), "..", kDirectoryFlags));
    struct stat st;
    if (up.valid() && ::fstat(up.get(), &st) == 0 && sameNode(st, parent.dev, parent.ino)) {
        current_ = std::move(up);
        return 0;
    }
    return reopenFromTop();
}

int DirectoryCursor::reopenFromTop() {
    UniqueFd at;
    for (const Level& level : levels_) {
        UniqueFd next(::openat(at.valid() ? at.get() : top_, level.name.c_str(), kDirectoryFlags));
        if (!next.valid()) return errno;
        struct stat st;
        if (::fstat(next.get(), &st) != 0) return errno;
        if (!sameNode(st, level.dev, level.ino)) return ESTALE;
        at = std::move(next);
    }
    current_ = std::move(at);
    return 0;
}

}  // namespace vsl
