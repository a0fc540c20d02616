// What the per-message check of a caller's own entitlements already found in the
// database: an identifier whose stored entitlements equal the ones its executable
// carries, or whose entry the installer registered, needs no database read and no
// hop onto the code-signing queue while the database is unchanged. Every write to
// the database moves its generation, which voids every remembered answer at once.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

#include "Platform/Value.h"

namespace vsl {

class VSLCallerEntitlementsCache {
public:
    // Whether the stored entry, as of database generation `generation`, is known to
    // need no re-registration for a caller carrying `entitlements`.
    bool isUnchanged(const std::string& identifier, const Value* entitlements, uint64_t generation) const;
    // Records what a check on the code-signing queue found; `generation` is read on
    // that queue before the entry was read. `installerOwned`: any entitlements do.
    void remember(const std::string& identifier, const Value* entitlements, bool installerOwned, uint64_t generation);

private:
    struct Known {
        std::optional<Value> entitlements;
        bool installerOwned = false;
        uint64_t generation = 0;
    };
    // Callers are the executables of the policy store; the bound only stops growth.
    static constexpr size_t kMaxEntries = 4096;
    mutable std::mutex mutex_;
    std::unordered_map<std::string, Known> known_;
};

}  // namespace vsl
