#include "Platform/PinnedNode.h"

#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

int openBeneath(int dirfd, const char* relative, int flags) {
    struct open_how how = {};
    how.flags = static_cast<uint64_t>(flags | O_NOFOLLOW | O_CLOEXEC);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    int fd = static_cast<int>(::syscall(SYS_openat2, dirfd, relative, &how, sizeof how));
    if (fd >= 0 || errno != ENOSYS) return fd;
    // Older kernels: the final component is still not followed and the identity
    // check below catches a swapped item.
    return ::openat(dirfd, relative, flags | O_NOFOLLOW | O_CLOEXEC);
}

}  // namespace

NodePinner::NodePinner(const std::string& top) : top_(top), parent_(parentPath(top)) {
    while (top_.size() > 1 && top_.back() == '/') top_.pop_back();
    parentFd_ = ::open(parent_.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
}

NodePinner::~NodePinner() {
    if (parentFd_ >= 0) ::close(parentFd_);
}

int NodePinner::open(const std::string& path, const struct stat& expected, int flags) const {
    if (parentFd_ < 0) {
        errno = EBADF;
        return -1;
    }
    size_t skip = parent_ == "/" ? 1 : parent_.size() + 1;
    bool belowTop = path.compare(0, top_.size(), top_) == 0 && (path.size() == top_.size() || path[top_.size()] == '/');
    if (!belowTop || path.size() <= skip) {
        errno = EXDEV;
        return -1;
    }
    int fd = openBeneath(parentFd_, path.c_str() + skip, flags);
    if (fd < 0) return -1;
    struct stat now;
    if (::fstat(fd, &now) != 0 || now.st_dev != expected.st_dev || now.st_ino != expected.st_ino) {
        ::close(fd);
        errno = ESTALE;
        return -1;
    }
    return fd;
}

}  // namespace vsl
