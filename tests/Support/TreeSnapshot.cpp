#include "Support/TreeSnapshot.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <climits>
#include <cstring>
#include <functional>
#include <vector>

#include "Support/TempRoot.h"

namespace vsl::test {

namespace {

std::string linkTarget(const std::string& path) {
    char target[PATH_MAX];
    ssize_t n = ::readlink(path.c_str(), target, sizeof target);
    return std::string(target, n > 0 ? static_cast<size_t>(n) : 0);
}

std::string xattrs(const std::string& path) {
    std::string s;
    std::vector<char> names(65536);
    ssize_t length = ::llistxattr(path.c_str(), names.data(), names.size());
    for (ssize_t at = 0; at < length; at += static_cast<ssize_t>(std::strlen(names.data() + at)) + 1) {
        std::vector<char> value(65536);
        ssize_t n = ::lgetxattr(path.c_str(), names.data() + at, value.data(), value.size());
        s += " " + std::string(names.data() + at) + "=" + std::string(value.data(), n > 0 ? static_cast<size_t>(n) : 0);
    }
    return s;
}

std::string owner(const struct stat& st) {
    return std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid);
}

// Walks with one open directory at a time per level, never following links.
void walk(const std::string& top, const std::string& relative, const std::function<void(const std::string&,
          const std::string&, const struct stat&)>& visit, const std::function<bool(const std::string&)>& skip) {
    const std::string path = top + relative;
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) return;
    visit(relative.empty() ? "." : relative, path, st);
    if (!S_ISDIR(st.st_mode)) return;
    std::vector<std::string> names;
    if (DIR* d = ::opendir(path.c_str())) {
        while (dirent* e = ::readdir(d))
            if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) names.push_back(e->d_name);
        ::closedir(d);
    }
    for (const std::string& name : names) {
        const std::string child = relative + "/" + name;
        if (skip && skip(child)) continue;
        walk(top, child, visit, skip);
    }
}

}  // namespace

std::map<std::string, std::string> treeState(const std::string& directory, bool full) {
    std::map<std::string, std::string> result;
    walk(directory, "", [&](const std::string& relative, const std::string& path, const struct stat& st) {
        std::string s = owner(st);
        if (S_ISLNK(st.st_mode)) s += " -> " + linkTarget(path);
        if (full) {
            s += " ino " + std::to_string(st.st_ino) + " ctime " + std::to_string(st.st_ctim.tv_sec) + "." +
                 std::to_string(st.st_ctim.tv_nsec) + xattrs(path);
            if (S_ISREG(st.st_mode)) s += " [" + readFile(path) + "]";
        }
        result[relative] = s;
    }, nullptr);
    return result;
}

TreeSnapshot snapshotTree(const std::string& directory, const std::function<bool(const std::string&)>& skip) {
    TreeSnapshot result;
    walk(directory, "", [&](const std::string& relative, const std::string& path, const struct stat& st) {
        std::string s = owner(st) + " size " + std::to_string(st.st_size) + " mtime " +
                        std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec);
        if (S_ISLNK(st.st_mode)) s += " -> " + linkTarget(path);
        // A digest, not the bytes: snapshots are taken often and trees hold large files.
        if (S_ISREG(st.st_mode)) s += " contents " + std::to_string(std::hash<std::string>{}(readFile(path)));
        result[relative] = s + xattrs(path);
    }, skip);
    return result;
}

std::string describeDifferences(const TreeSnapshot& before, const TreeSnapshot& after) {
    std::string out;
    for (const auto& [path, state] : before) {
        auto it = after.find(path);
        if (it == after.end())
            out += "gone:    " + path + " (" + state + ")\n";
        else if (it->second != state)
            out += "changed: " + path + " (" + state + ") -> (" + it->second + ")\n";
    }
    for (const auto& [path, state] : after)
        if (!before.count(path)) out += "new:     " + path + " (" + state + ")\n";
    return out;
}

}  // namespace vsl::test
