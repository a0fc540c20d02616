// Small helpers shared by the mapping's source files.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Daemon/CodeSigning/VSLCodeSigningEntry.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLError.h"
#include "Platform/Value.h"

namespace vsl {

// The global write lock for one scope; taken before the mapping's queue is entered.
class VSLGlobalWriteLock {
public:
    VSLGlobalWriteLock() { lock_all_identifiers_for_writing(); }
    ~VSLGlobalWriteLock() { unlock_all_identifiers(); }
    VSLGlobalWriteLock(const VSLGlobalWriteLock&) = delete;
    VSLGlobalWriteLock& operator=(const VSLGlobalWriteLock&) = delete;
};

inline bool isNotInDatabase(const VSLErrorRef& e) {
    return e && e->isVSLDomain() && static_cast<uint64_t>(e->code) == kVSLErrorNotInDatabase;
}

// A value that is there and not null.
inline const Value* presentValue(const std::optional<Value>& v) {
    return v && !v->isNull() ? &*v : nullptr;
}

// A member of an options dictionary that is there and not null.
inline const Value* optionValue(const std::optional<Value>& options, const char* key) {
    if (!options || !options->isDictionary()) return nullptr;
    const Value* v = options->find(key);
    return v && !v->isNull() ? v : nullptr;
}

inline std::optional<Value> listValue(const std::optional<std::vector<std::string>>& list) {
    if (!list) return std::nullopt;
    return stringListValue(list);
}

}  // namespace vsl
