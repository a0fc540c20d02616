// Tree walks: fts with FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, so no symbolic link is
// followed, the working directory stays put (the daemon is multi-threaded) and other
// mounts are not entered. Directories come twice: FTS_D before their contents and
// FTS_DP after.
#pragma once

#include <fts.h>

#include <functional>
#include <string>

namespace vsl {

constexpr int kTreeWalkOptions = FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV;

enum class TreeWalkFailure { None, Open, Read, Close };

// Calls `visit` for every node until it returns false. Returns 0, or the errno of a
// failure of fts itself with `*where` telling which call failed.
int walkTree(const std::string& path, const std::function<bool(FTSENT*)>& visit, TreeWalkFailure* where = nullptr);

}  // namespace vsl
