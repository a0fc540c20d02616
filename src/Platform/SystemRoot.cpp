#include "Platform/SystemRoot.h"

#include <climits>
#include <cstdlib>

namespace vsl {

namespace {
std::string& rootStorage() {
    static std::string root;  // "" means "/"
    return root;
}
}  // namespace

void setSystemRoot(const std::string& root) {
    char buf[PATH_MAX];
    std::string r = realpath(root.c_str(), buf) ? std::string(buf) : root;
    while (r.size() > 1 && r.back() == '/') r.pop_back();
    rootStorage() = (r == "/") ? "" : r;
}

const std::string& systemRoot() {
    static const std::string slash = "/";
    return rootStorage().empty() ? slash : rootStorage();
}

bool systemRootIsSlash() { return rootStorage().empty(); }

std::string rootedPath(std::string_view absolute) {
    std::string p(absolute);
    if (p.empty() || p[0] != '/') p.insert(p.begin(), '/');
    return rootStorage() + p;
}

std::string unrootedPath(std::string_view hostPath) {
    const std::string& r = rootStorage();
    if (r.empty()) return std::string(hostPath);
    if (hostPath.size() >= r.size() && hostPath.substr(0, r.size()) == r &&
        (hostPath.size() == r.size() || hostPath[r.size()] == '/')) {
        std::string rest(hostPath.substr(r.size()));
        return rest.empty() ? "/" : rest;
    }
    return std::string(hostPath);
}

std::string joinPath(std::string_view dir, std::string_view name) {
    std::string out(dir);
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    while (!name.empty() && name.front() == '/') name.remove_prefix(1);
    if (name.empty()) return out;
    if (out != "/") out += '/';
    out += name;
    return out;
}

std::string parentPath(std::string_view path) {
    std::string p(path);
    while (p.size() > 1 && p.back() == '/') p.pop_back();
    auto slash = p.rfind('/');
    if (slash == std::string::npos) return ".";
    if (slash == 0) return "/";
    return p.substr(0, slash);
}

std::string lastPathComponent(std::string_view path) {
    std::string p(path);
    while (p.size() > 1 && p.back() == '/') p.pop_back();
    auto slash = p.rfind('/');
    return slash == std::string::npos ? p : p.substr(slash + 1);
}

bool isPlainPathComponent(std::string_view name) {
    return !name.empty() && name.size() <= NAME_MAX && name != "." && name != ".." &&
           name.find('/') == std::string_view::npos &&
           name.find('\0') == std::string_view::npos;
}

}  // namespace vsl
