#include "Support/TreeSnapshot.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include "Support/TempRoot.h"

namespace vsl::test {

namespace {

std::string describe(const std::string& path) {
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) return "unreadable";
    std::string d = "mode " + std::to_string(st.st_mode) + " owner " + std::to_string(st.st_uid) + ":" +
                    std::to_string(st.st_gid) + " size " + std::to_string(st.st_size) + " mtime " +
                    std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec);
    if (S_ISREG(st.st_mode)) d += " contents " + readFile(path);
    if (S_ISLNK(st.st_mode)) {
        char target[4096];
        ssize_t n = ::readlink(path.c_str(), target, sizeof target);
        d += " -> " + std::string(target, n > 0 ? static_cast<size_t>(n) : 0);
    }
    char names[4096];
    ssize_t n = ::llistxattr(path.c_str(), names, sizeof names);
    for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(std::strlen(names + i)) + 1) {
        char value[512];
        ssize_t m = ::lgetxattr(path.c_str(), names + i, value, sizeof value);
        d += std::string(" xattr ") + (names + i) + "=" + (m < 0 ? std::string("?") : std::string(value, m));
    }
    return d;
}

}  // namespace

TreeSnapshot snapshotTree(const std::string& root) {
    namespace fs = std::filesystem;
    TreeSnapshot out;
    out["."] = describe(root);
    std::error_code ec;
    for (fs::recursive_directory_iterator it(root, fs::directory_options::none, ec), end; !ec && it != end;
         it.increment(ec))
        out[fs::relative(it->path(), root).string()] = describe(it->path().string());
    return out;
}

}  // namespace vsl::test
