// The daemon's dictionary files: written as binary property lists (format 1.0),
// read in any property-list format.
#pragma once

#include <optional>
#include <string>

#include "Daemon/Core/VSLError.h"
#include "Platform/Value.h"

namespace vsl {

enum VSLWriteOptions : unsigned {
    kVSLWriteNone = 0,
    kVSLWriteAtomic = 1 << 0,          // temporary file, fsync, rename, directory fsync
    kVSLWriteNoFileProtection = 1 << 1,  // no protection class on the file
};

// Files larger than this are refused as unreadable rather than read into memory.
constexpr size_t kVSLMaxPropertyListFileSize = 16u << 20;

constexpr int64_t kGeneralErrorUnreadablePropertyList = 2049;

bool VSL_writeToURL(const Value& dictionary, const std::string& path, unsigned options, VSLErrorRef* error);

// None with an error when the file cannot be read (POSIX domain), does not parse
// (general domain 2049) or its root is not a dictionary (general domain 2048).
std::optional<Value> VSL_dictionaryWithContentsOfURL(const std::string& path, unsigned options,
                                                     VSLErrorRef* error);

// True when any "/"-separated component is exactly "..".
bool containsDotDotPathComponents(const std::string& path);

}  // namespace vsl
