#include "Platform/TreeRemove.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "Platform/DirectoryEntries.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

class TreeRemover {
public:
    explicit TreeRemover(const std::function<void(const RemoveFailure&)>& onError) : onError_(onError) {}

    // `type` is the directory entry's type; DT_UNKNOWN is settled by trying.
    void remove(int parentFd, const char* name, unsigned char type, const std::string& path) {
        if (type != DT_DIR && type != DT_UNKNOWN) {
            int rc = durable::removeAt(parentFd, name, false, path);
            if (rc) report(path, rc, parentFd, name, false);
            return;
        }
        int fd = ::openat(parentFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (fd < 0) {
            int err = errno;
            if (type == DT_UNKNOWN && (err == ENOTDIR || err == ELOOP)) {
                remove(parentFd, name, DT_REG, path);
                return;
            }
            report(path, err, parentFd, name, true);
        } else {
            std::vector<DirectoryEntry> entries;
            int rc = readDirectoryEntries(fd, &entries);
            if (rc) report(path, rc, parentFd, name, true);
            for (const DirectoryEntry& e : entries) remove(fd, e.name.c_str(), e.type, joinPath(path, e.name));
            ::close(fd);
        }
        int rc = durable::removeAt(parentFd, name, true, path);
        if (rc) report(path, rc, parentFd, name, true);
    }

private:
    void report(const std::string& path, int error, int parentFd, const char* name, bool isDirectory) {
        onError_(RemoveFailure{path, error, parentFd, name, isDirectory});
    }

    const std::function<void(const RemoveFailure&)>& onError_;
};

}  // namespace

int removeTree(const std::string& path, const std::function<void(const RemoveFailure&)>& onError) {
    std::string name = lastPathComponent(path);
    int parentFd = ::open(parentPath(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (parentFd < 0) return errno;
    struct stat st;
    if (::fstatat(parentFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        int err = errno;
        ::close(parentFd);
        return err;
    }
    TreeRemover(onError).remove(parentFd, name.c_str(), S_ISDIR(st.st_mode) ? DT_DIR : DT_REG, path);
    ::close(parentFd);
    return 0;
}

}  // namespace vsl
