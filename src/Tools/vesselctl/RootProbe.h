// Read-only looks at a system root and its daemon, for status and doctor: nothing
// here writes, creates or sends a request that changes anything.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "Output.h"
#include "Platform/Value.h"

// The daemon's pid: the holder of its socket's lock file, else the peer credentials of
// the listening socket; none when nothing answers.
std::optional<pid_t> daemonPid(const std::string& socketPath);

// Whether the socket file exists while nothing listens on it.
bool socketIsStale(const std::string& socketPath);

// Entries of a directory below the root (an absolute path as the daemon sees it);
// -1 when it cannot be read, 0 when missing.
long entryCount(const std::string& absolute);

// The daemon's own directories, as the daemon sees them.
inline constexpr const char* kDeathRowDirectory = "/private/var/root/Library/Caches/com.tarrow.vesseld/Dead";
inline constexpr const char* kReplaceJournalDirectory = "/private/var/root/Library/Vesselry/Replace";
inline constexpr const char* kPendingProtectionDirectory = "/private/var/root/Library/Vesselry/PendingUpdates";

// A property-list file (a host path); none with a reason when missing or malformed.
std::optional<vsl::Value> readPropertyListFile(const std::string& path, std::string* error);

// Whether the daemon finished its first-boot work since the last boot: its marker, a
// named semaphore ("/vesseld.fb_check", suffixed per root other than "/"), exists.
bool firstBootWorkDone();
