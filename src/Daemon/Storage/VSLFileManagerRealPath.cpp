// Resolving client-supplied paths that must stay inside a base directory.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

const char* const kRealPathFunction = "-[VSLFileManager realPathForURL:ifChildOfURL:]";

std::vector<std::string> pathComponents(const std::string& path) {
    std::vector<std::string> out;
    if (!path.empty() && path[0] == '/') out.push_back("/");
    size_t i = 0;
    while (i < path.size()) {
        size_t j = path.find('/', i);
        if (j == std::string::npos) j = path.size();
        if (j > i) out.push_back(path.substr(i, j - i));
        i = j + 1;
    }
    return out;
}

std::string describe(const std::vector<std::string>& components) {
    std::string s = "(";
    for (size_t i = 0; i < components.size(); i++) s += (i ? ", " : "") + components[i];
    return s + ")";
}

std::string withoutTrailingSlashes(std::string p) {
    while (p.size() > 1 && p.back() == '/') p.pop_back();
    return p;
}

// The "/private" alias: below the system root, "<root>/private/x" and "<root>/x" are
// compared as the same name (with the root "/" this is exactly "/private/x" vs "/x").
std::string withoutPrivatePrefix(const std::string& path) {
    const std::string& root = systemRootIsSlash() ? std::string() : systemRoot();
    std::string prefix = root + "/private/";
    if (path.compare(0, prefix.size(), prefix) == 0) return root + path.substr(root.size() + 8);
    return path;
}

// Components of a real path after the system root and a following "private".
std::vector<std::string> componentsBelowRoot(const std::string& realPath) {
    std::vector<std::string> all = pathComponents(realPath);
    size_t skip = 1 + (systemRootIsSlash() ? 0 : pathComponents(systemRoot()).size() - 1);
    if (skip < all.size() && all[skip] == "private") skip++;
    return std::vector<std::string>(all.begin() + static_cast<long>(std::min(skip, all.size())), all.end());
}

bool isSameOrBelow(const std::string& path, const std::string& dir) {
    if (path == dir) return true;
    if (dir == "/") return path.size() > 1 && path[0] == '/';
    return path.size() > dir.size() && path.compare(0, dir.size(), dir) == 0 && path[dir.size()] == '/';
}

}  // namespace

bool VSLFileManager::_validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth) const {
    if (path.empty()) return false;
    int64_t depth = startingDepth;
    for (const std::string& c : pathComponents(path)) {
        if (c == "..")
            depth--;
        else if (c != "." && c != "/")
            depth++;
        if (depth < startingDepth) return false;
    }
    if (endingDepth) *endingDepth = depth;
    return true;
}

std::optional<std::string> VSLFileManager::_realPathWhatExistsInPath(const std::string& path) const {
    std::vector<std::string> components = pathComponents(path);
    // Longest prefix first, never the root alone.
    for (size_t n = components.size(); n >= 2; n--) {
        std::string prefix;
        for (size_t i = 0; i < n; i++) prefix = i == 0 ? components[0] : joinPath(prefix, components[i]);
        char* real = ::realpath(prefix.c_str(), nullptr);
        if (!real) continue;
        std::string result = real, rest;
        std::free(real);
        for (size_t i = n; i < components.size(); i++) rest = rest.empty() ? components[i] : joinPath(rest, components[i]);
        LogWrite(kLogLevelDebug, "-[VSLFileManager _realPathWhatExistsInPath:]",
                 "Realpathed %@ ; appending non-existing components %@", result, rest);
        return rest.empty() ? result : joinPath(result, rest);
    }
    return std::nullopt;
}

std::optional<std::string> VSLFileManager::_realPathForURL(const std::string& url,
                                                           bool allowNonExistentPathComponents) const {
    char buf[PATH_MAX] = {0};
    int err = ENAMETOOLONG;
    if (!::realpath(url.c_str(), buf))
        err = errno;
    else if (std::strlen(buf) < 1024)
        return std::string(buf);
    if (err == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url);
    LogWrite(kLogLevelError, "-[VSLFileManager _realPathForURL:allowNonExistentPathComponents:]",
             "Failed to realpath %s : %s at %s", url, std::strerror(err), buf);
    return std::nullopt;
}

std::optional<std::string> VSLFileManager::realPathForURL(const std::string& suspiciousURL,
                                                          const std::string& baseURL, VSLErrorRef* error) const {
    auto reject = [&](std::string message) -> std::optional<std::string> {
        LogWrite(kLogLevelError, kRealPathFunction, "%@", message);
        if (error)
            *error = createVSLError(kRealPathFunction, __LINE__, kVSLErrorInvalidPath, nullptr, false, "%@", message);
        return std::nullopt;
    };
    if (suspiciousURL.empty() || baseURL.empty())
        return reject(formatLog("The base path %@ and/or suspicious path %@ were nil", baseURL, suspiciousURL));

    const std::string suspiciousPath = withoutTrailingSlashes(suspiciousURL);
    const std::string basePath = withoutTrailingSlashes(baseURL);
    const std::string suspicious = withoutPrivatePrefix(suspiciousPath);
    const std::string base = withoutPrivatePrefix(basePath);

    if (suspicious.compare(0, base.size(), base) != 0)
        return reject(formatLog("supiscious path %@ does not contain base path %@ as a prefix", suspicious, base));
    for (const std::string& c : pathComponents(suspicious))
        if (c == "..")
            return reject(formatLog("The suspicious path %@ contains '..' paths, which are invalid", suspicious));

    // A link as the final item may only point, relatively, to somewhere below the base.
    char target[1024];
    ssize_t n = ::readlink(suspiciousPath.c_str(), target, sizeof target);
    if (n < 0 && errno != EINVAL && errno != ENOENT)
        return reject(formatLog("Readlink failed: %s", std::strerror(errno)));
    if (n >= static_cast<ssize_t>(sizeof target)) return reject(formatLog("Readlink failed: %s", std::strerror(ENAMETOOLONG)));
    if (n >= 0) {
        std::string linkTarget(target, static_cast<size_t>(n));
        if (!linkTarget.empty() && linkTarget[0] == '/')
            return reject(formatLog("Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious, linkTarget));
        int64_t baseDepth = 0, linkDepth = 0;
        if (!_validateSymlink(base, 0, &baseDepth)) return reject(formatLog("Failed to retrieve depth of %@", base));
        std::string location = joinPath(parentPath("/" + suspicious.substr(base.size())), linkTarget);
        // Pointing at the base itself is refused too: a child was asked for.
        if (!_validateSymlink(location, baseDepth, &linkDepth) || linkDepth <= baseDepth)
            return reject(
                formatLog("Rejecting %@ -> %@, as it is points outside or to the base %@", suspicious, linkTarget, base));
    }

    auto realBase = _realPathForURL(basePath, false);
    if (!realBase) return reject(formatLog("Failed to retrieve realpath for base path %@ ", base));
    auto realSuspicious = _realPathForURL(suspiciousPath, true);
    if (!realSuspicious) return reject(formatLog("Failed to retrieve realpath for suspicious path %@", suspicious));

    // Compared on the resolved paths whatever the link check said: a relative link may
    // lead through further links, and only the resolved path tells where it ends.
    std::vector<std::string> baseAll = pathComponents(*realBase), suspiciousAll = pathComponents(*realSuspicious);
    if (baseAll.size() < 2 || suspiciousAll.size() < 2)
        return reject(formatLog("Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
                                suspicious, base, *realSuspicious, *realBase));
    std::vector<std::string> baseRest = componentsBelowRoot(*realBase);
    std::vector<std::string> suspiciousRest = componentsBelowRoot(*realSuspicious);
    if (baseRest.size() > suspiciousRest.size())
        return reject(formatLog(
            "Rejecting %@ with base %@ because base component count is greater than child component count (reals %@ ; %@)",
            suspicious, base, describe(suspiciousAll), describe(baseAll)));
    for (size_t i = 0; i < baseRest.size(); i++)
        if (baseRest[i] != suspiciousRest[i])
            return reject(formatLog("Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                                    suspicious, base, *realSuspicious, *realBase, suspiciousRest[i], baseRest[i]));
    // The "private" alias above is only a way of spelling; what is returned must lie
    // inside the base as the file system resolves it.
    if (!isSameOrBelow(*realSuspicious, *realBase))
        return reject(formatLog("Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                                suspicious, base, *realSuspicious, *realBase, *realSuspicious, *realBase));
    return realSuspicious;
}

}  // namespace vsl
