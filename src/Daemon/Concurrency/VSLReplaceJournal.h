// The journal of one container replacement: a property list in the Replace
// directory naming where the old container lives, where the new one comes from,
// where the old one is parked meanwhile and where the new one ends up. It is on
// disk before anything moves, so the next start can tell a half-done replacement
// (roll back) from a finished one (drop the journal).
#pragma once

#include <optional>
#include <string>

#include "Daemon/Core/VSLError.h"

namespace vsl {

extern const char* const kVSLReplaceOperationOldURL;      // "VSLReplaceOperationOldURL"
extern const char* const kVSLReplaceOperationNewURL;      // "VSLReplaceOperationNewURL"
extern const char* const kVSLReplaceOperationStagingURL;  // "VSLReplaceOperationStagingURL"
extern const char* const kVSLReplaceOperationDestURL;     // "VSLReplaceOperationDestURL"

struct VSLReplaceJournal {
    std::string oldURL;
    std::string newURL;
    std::string stagingURL;
    std::string destURL;
};

// Writes the four paths atomically (temporary file, fsync, rename, directory fsync).
// A missing path is code 33, a failed write code 34.
bool _writeToDiskReplaceAt(const std::string& journalURL, const std::optional<std::string>& oldURL,
                           const std::optional<std::string>& newURL, const std::optional<std::string>& stagingURL,
                           const std::optional<std::string>& destURL, VSLErrorRef* error);

// Code 35 for a file that cannot be read or whose four values are not all absolute
// paths without ".." components; the paths come back as directory paths.
std::optional<VSLReplaceJournal> _readAndValidateReplaceFileAtUrl(const std::string& url, VSLErrorRef* error);

}  // namespace vsl
