#include "Daemon/CodeSigning/VSLCallerEntitlementsCache.h"

#include "Daemon/CodeSigning/VSLPropertyListCompare.h"

namespace vsl {

bool VSLCallerEntitlementsCache::isUnchanged(const std::string& identifier, const Value* entitlements,
                                             uint64_t generation) const {
    std::lock_guard lock(mutex_);
    auto it = known_.find(identifier);
    if (it == known_.end() || it->second.generation != generation) return false;
    if (it->second.installerOwned) return true;
    const auto& stored = it->second.entitlements;
    return stored && entitlements ? propertyListValuesEqual(*stored, *entitlements) : !stored && !entitlements;
}

void VSLCallerEntitlementsCache::remember(const std::string& identifier, const Value* entitlements,
                                          bool installerOwned, uint64_t generation) {
    std::lock_guard lock(mutex_);
    if (known_.size() >= kMaxEntries && !known_.count(identifier)) known_.clear();
    Known& k = known_[identifier];
    k.entitlements = entitlements ? std::optional<Value>(*entitlements) : std::nullopt;
    k.installerOwned = installerOwned;
    k.generation = generation;
}

}  // namespace vsl
