#include "Platform/FileFlags.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>

#include "Platform/DurableIO.h"

namespace vsl {

const unsigned kFileFlagImmutable = FS_IMMUTABLE_FL;

int getFileFlags(int fd, unsigned* flags) {
    int f = 0;
    if (::ioctl(fd, FS_IOC_GETFLAGS, &f) != 0) return errno;
    *flags = static_cast<unsigned>(f);
    return 0;
}

int setFileFlags(int fd, const std::string& path, unsigned flags) { return durable::setFlags(fd, path, flags); }

int clearImmutableFlagAt(int dirfd, const char* name, const std::string& path, bool* wasSet) {
    *wasSet = false;
    // O_NONBLOCK: a FIFO must not hang the open.
    int fd = ::openat(dirfd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) return errno;
    unsigned flags = 0;
    int rc = getFileFlags(fd, &flags);
    if (rc == 0 && (flags & kFileFlagImmutable)) {
        *wasSet = true;
        rc = setFileFlags(fd, path, flags & ~kFileFlagImmutable);
    }
    ::close(fd);
    return rc;
}

}  // namespace vsl
