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

// Files larger than this are refused as unreadable rather than read into memory, and
// never written.
constexpr size_t kVSLMaxPropertyListFileSize = 16u << 20;

constexpr int64_t kGeneralErrorUnreadablePropertyList = 2049;

// Refuses, with EFBIG and before writing anything, a dictionary whose file would be
// larger than the read limit.
bool VSL_writeToURL(const Value& dictionary, const std::string& path, unsigned options, VSLErrorRef* error);

// None with an error when the file cannot be read (POSIX domain: a symlink, anything
// but a regular file, larger than the read limit, or an I/O failure), does not parse
// (general domain 2049) or its root is not a dictionary (general domain 2048).
// Opening never blocks, whatever node stands at `path`.
std::optional<Value> VSL_dictionaryWithContentsOfURL(const std::string& path, unsigned options,
                                                     VSLErrorRef* error);

// Whether `error`, or one it wraps, is a failure of the system rather than of the
// file's content (EIO, ENOMEM, EMFILE, ENFILE, EACCES): the file may well be whole,
// so it must not be taken for absent or damaged.
bool isReadFailure(const VSLErrorRef& error);

// True when any "/"-separated component is exactly "..".
bool containsDotDotPathComponents(const std::string& path);

}  // namespace vsl
