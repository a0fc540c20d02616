// Directory paths walked one component at a time, so that a symbolic link or a
// swapped entry in a directory some user can write never redirects the daemon.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <deque>
#include <string_view>
#include <vector>

#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl::durable {

namespace {

constexpr int kMaxLinks = 40;  // as the kernel's own limit
constexpr int kOpenFlags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Nobody but root can add, remove or rename entries here (in a sticky directory,
// nobody but root can touch root's entries).
bool onlyRootChanges(const struct stat& dir) {
    return dir.st_uid == 0 && ((dir.st_mode & 022) == 0 || (dir.st_mode & S_ISVTX));
}

// `entry` of `dir` cannot have been put or swapped there by anyone but root.
bool placedByRoot(const struct stat& dir, const struct stat& entry) {
    return dir.st_uid == 0 && ((dir.st_mode & 022) == 0 || ((dir.st_mode & S_ISVTX) && entry.st_uid == 0));
}

struct Level {
    struct stat st;
    bool trusted;  // this directory and every one above it change only by root's hand
    std::string path;
};

void appendComponents(std::string_view path, std::deque<std::string>* out, bool front) {
    std::vector<std::string> parts;
    size_t i = 0;
    while (i < path.size()) {
        size_t j = path.find('/', i);
        if (j == std::string_view::npos) j = path.size();
        std::string_view c = path.substr(i, j - i);
        if (!c.empty() && c != ".") parts.emplace_back(c);
        i = j + 1;
    }
    if (front)
        out->insert(out->begin(), parts.begin(), parts.end());
    else
        out->insert(out->end(), parts.begin(), parts.end());
}

int startAt(bool absolute, UniqueFd* dir, std::vector<Level>* levels) {
    dir->reset(::open(absolute ? "/" : ".", kOpenFlags));
    if (!dir->valid()) return errno;
    Level top;
    if (::fstat(dir->get(), &top.st) != 0) return errno;
    // The working directory's parents are unknown: nothing below it is trusted.
    top.trusted = absolute && onlyRootChanges(top.st);
    top.path.assign(1, absolute ? '/' : '.');
    levels->assign(1, top);
    return 0;
}

int walk(const std::string& path, bool create, mode_t mode, bool intermediates, int* fd) {
    if (path.empty()) return ENOENT;
    UniqueFd dir;
    std::vector<Level> levels;
    if (int rc = startAt(path[0] == '/', &dir, &levels)) return rc;
    std::deque<std::string> rest;
    appendComponents(path, &rest, false);
    int links = 0;
    while (!rest.empty()) {
        std::string name = std::move(rest.front());
        rest.pop_front();
        bool last = rest.empty();
        if (name == "..") {
            UniqueFd up(::openat(dir.get(), "..", kOpenFlags));
            if (!up) return errno;
            dir = std::move(up);
            if (levels.size() > 1) {
                levels.pop_back();
            } else if (::fstat(dir.get(), &levels[0].st) != 0) {
                return errno;
            }
            continue;
        }
        const Level& here = levels.back();
        std::string childPath = joinPath(here.path, name);
        bool made = false;
        UniqueFd child(::openat(dir.get(), name.c_str(), kOpenFlags));
        if (!child && errno == ENOENT && create && (intermediates || last)) {
            int rc = makeDirectoryAt(dir.get(), name.c_str(), mode, childPath);
            if (rc != 0 && rc != EEXIST) return rc;
            made = rc == 0;
            child.reset(::openat(dir.get(), name.c_str(), kOpenFlags));
        }
        if (!child) {
            int err = errno;
            if (err != ENOTDIR && err != ELOOP) return err;
            struct stat link;
            if (::fstatat(dir.get(), name.c_str(), &link, AT_SYMLINK_NOFOLLOW) != 0) return errno;
            if (!S_ISLNK(link.st_mode)) return ENOTDIR;
            if (!here.trusted || !placedByRoot(here.st, link) || ++links > kMaxLinks) return ELOOP;
            char target[PATH_MAX];
            ssize_t n = ::readlinkat(dir.get(), name.c_str(), target, sizeof target);
            if (n < 0) return errno;
            if (n == 0 || static_cast<size_t>(n) >= sizeof target) return ELOOP;
            std::string_view t(target, static_cast<size_t>(n));
            appendComponents(t, &rest, true);
            if (t[0] == '/')
                if (int rc = startAt(true, &dir, &levels)) return rc;
            continue;
        }
        Level next;
        if (::fstat(child.get(), &next.st) != 0) return errno;
        if (!S_ISDIR(next.st.st_mode)) return ENOTDIR;
        if (made && (next.st.st_mode & 07777) != mode) {
            if (int rc = changeModeOfNode(child.get(), childPath, mode)) return rc;
            next.st.st_mode = (next.st.st_mode & ~07777) | mode;
        }
        next.trusted = here.trusted && placedByRoot(here.st, next.st) && onlyRootChanges(next.st);
        next.path = std::move(childPath);
        levels.push_back(std::move(next));
        dir = std::move(child);
    }
    *fd = dir.release();
    return 0;
}

}  // namespace

int openDirectoryNoFollow(const std::string& path, int* fd) { return walk(path, false, 0, false, fd); }

int makeDirectoryNoFollow(const std::string& path, mode_t mode, bool intermediates, int* fd) {
    return walk(path, true, mode, intermediates, fd);
}

}  // namespace vsl::durable
