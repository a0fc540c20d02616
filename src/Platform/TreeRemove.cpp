#include "Platform/TreeRemove.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "Platform/DirectoryCursor.h"
#include "Platform/DirectoryEntries.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

// Depth first without recursion: one cursor descriptor at any depth, and per level
// only the names still to remove.
class TreeRemover {
public:
    TreeRemover(int topFd, const std::function<void(const RemoveFailure&)>& onError)
        : cursor_(topFd), onError_(onError) {}

    // `type` is the directory entry's type; DT_UNKNOWN is settled by trying.
    int remove(const std::string& name, unsigned char type, const std::string& path) {
        if (!enter(name, type, path)) return 0;
        while (!levels_.empty()) {
            Level& level = levels_.back();
            if (level.next < level.entries.size()) {
                DirectoryEntry e = level.entries[level.next++];  // levels_ may grow in enter
                enter(e.name, e.type, joinPath(level.path, e.name));
                continue;
            }
            Level done = std::move(level);
            levels_.pop_back();
            if (int rc = cursor_.ascend()) {
                // The way back up is gone (moved meanwhile): nothing above can be reached safely.
                report(done.path, rc, -1, done.name, true);
                return rc;
            }
            removeEntry(done.name, true, done.path);
        }
        return 0;
    }

private:
    struct Level {
        std::string name;
        std::string path;
        std::vector<DirectoryEntry> entries;
        size_t next = 0;
    };

    // Removes a non-directory, or goes into a directory (true). A directory that cannot
    // be opened is still tried with rmdir.
    bool enter(const std::string& name, unsigned char type, const std::string& path) {
        if (type != DT_DIR && type != DT_UNKNOWN) {
            removeEntry(name, false, path);
            return false;
        }
        if (int rc = cursor_.descend(name.c_str())) {
            if (type == DT_UNKNOWN && (rc == ENOTDIR || rc == ELOOP)) {
                removeEntry(name, false, path);
            } else {
                report(path, rc, cursor_.fd(), name, true);
                removeEntry(name, true, path);
            }
            return false;
        }
        Level level{name, path, {}, 0};
        if (int rc = readDirectoryEntries(cursor_.fd(), &level.entries)) report(path, rc, cursor_.fd(), name, true);
        levels_.push_back(std::move(level));
        return true;
    }

    void removeEntry(const std::string& name, bool directory, const std::string& path) {
        int parentFd = cursor_.fd();
        if (int rc = durable::removeAt(parentFd, name.c_str(), directory, path))
            report(path, rc, parentFd, name, directory);
    }

    void report(const std::string& path, int error, int parentFd, const std::string& name, bool isDirectory) {
        onError_(RemoveFailure{path, error, parentFd, name.c_str(), isDirectory});
    }

    DirectoryCursor cursor_;
    std::vector<Level> levels_;
    const std::function<void(const RemoveFailure&)>& onError_;
};

}  // namespace

int removeTree(const std::string& path, const std::function<void(const RemoveFailure&)>& onError) {
    UniqueFd parentFd(::open(parentPath(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!parentFd.valid()) return errno;
    return removeTreeAt(parentFd.get(), lastPathComponent(path), path, onError);
}

int removeTreeAt(int parentFd, const std::string& name, const std::string& path,
                 const std::function<void(const RemoveFailure&)>& onError) {
    struct stat st;
    if (::fstatat(parentFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    TreeRemover(parentFd, onError).remove(name, S_ISDIR(st.st_mode) ? DT_DIR : DT_REG, path);
    return 0;
}

}  // namespace vsl
