// Every absolute path of the daemon's world lives below one system root: "/" in
// production, a scratch directory in tests and demos.
#pragma once

#include <string>
#include <string_view>

namespace vsl {

// Set once at start-up, before any other thread runs. Stored as a real path
// without a trailing slash ("" stands for "/").
void setSystemRoot(const std::string& root);
const std::string& systemRoot();  // "/" when none was set
bool systemRootIsSlash();

// "/private/var/x" -> "<root>/private/var/x"; relative paths are taken from the root too.
std::string rootedPath(std::string_view absolute);

// Inverse of rootedPath for paths below the root; others come back unchanged.
std::string unrootedPath(std::string_view hostPath);

// Path helpers shared by everything that builds paths.
std::string joinPath(std::string_view dir, std::string_view name);
std::string parentPath(std::string_view path);
std::string lastPathComponent(std::string_view path);
// One plain name component: not empty, ".", "..", nor longer than a file name may
// be, and without "/" or NUL.
bool isPlainPathComponent(std::string_view name);

}  // namespace vsl
