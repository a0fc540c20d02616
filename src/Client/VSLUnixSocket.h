// Connecting to the daemon's Unix stream sockets, shared by libvessel's clients.
#pragma once

#include <string>

#include "Platform/UniqueFd.h"

namespace vsl::client {

// A non-blocking, close-on-exec connection to the socket at `path`; invalid with a
// reason on failure, errno as connect(2) left it (ENOENT or ECONNREFUSED: no server).
UniqueFd connectUnixStream(const std::string& path, std::string* error);

// `relative` below a system root ("/" in production).
std::string pathBelowSystemRoot(const std::string& root, const std::string& relative);

}  // namespace vsl::client
