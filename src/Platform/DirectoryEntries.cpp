#include "Platform/DirectoryEntries.h"

#include <dirent.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace vsl {

namespace {
struct LinuxDirent64 {
    ino64_t d_ino;
    off64_t d_off;
    unsigned short d_reclen;
    unsigned char d_type;
    char d_name[];
};
}  // namespace

int readDirectoryEntries(int dirfd, std::vector<DirectoryEntry>* entries) {
    // getdents64 straight into a large buffer: no DIR allocation per directory.
    alignas(8) char buf[32768];
    for (;;) {
        long n = ::syscall(SYS_getdents64, dirfd, buf, sizeof buf);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        if (n == 0) return 0;
        for (long off = 0; off < n;) {
            auto* d = reinterpret_cast<LinuxDirent64*>(buf + off);
            off += d->d_reclen;
            const char* name = d->d_name;
            if (name[0] == '.' && (name[1] == 0 || (name[1] == '.' && name[2] == 0))) continue;
            entries->push_back({name, d->d_type});
        }
    }
}

}  // namespace vsl
