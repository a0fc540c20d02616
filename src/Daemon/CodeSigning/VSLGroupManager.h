// Group containers have no owner of their own: they exist because entitlements name
// them. The group manager answers which groups an owner may use, and finds the group
// containers nothing names any more (the full reconciliation, at start-up) and stages
// them for deletion. The one-change-at-a-time counting lives in the code-signing
// mapping; both reach the database only through copyReferenceCountSetOfType.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/Value.h"

namespace vsl {

class VSLUserIdentityCache;

class VSLGroupManager {
public:
    // Made once per process with the shared user-identity cache.
    static const std::shared_ptr<VSLGroupManager>& defaultManager();
    explicit VSLGroupManager(std::shared_ptr<VSLUserIdentityCache> userIdentityCache);

    const std::shared_ptr<VSLUserIdentityCache>& userIdentityCache() const { return userIdentityCache_; }

    // The group identifiers the owner's entitlements name for the class (system groups
    // for a class whose traits say so, application groups for any other). An owner
    // with no entitlements has none: an empty array, code 1. A non-string owner is
    // code 11. With `useLocking` the global write lock is held for the query.
    std::optional<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
        const Value& ownerIdentifier, VSLContainerClass groupContainerClass, bool useLocking, uint64_t* code);

    // Stages every group container of the type that no stored entry names: for each
    // user with a home when the class is per user, for the default user when it is
    // per device. Only queues stage-for-delete commands (with locking: the caller
    // drains `commandQueue` after the global write lock is released). With
    // `useLocking` the global write lock is taken here; without, the caller holds it.
    void reconcileGroupContainersOfType(VSLGroupType type, const std::shared_ptr<VSLCommandQueue>& commandQueue,
                                        bool useLocking);

    // One user's part of the reconciliation: containers whose identifier counts 0.
    void _cleanupUnreferencedGroupContainersForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                            VSLContainerClass containerClass,
                                                            const VSLCountedSet& referenceCounts,
                                                            const std::shared_ptr<VSLCommandQueue>& commandQueue);

private:
    std::shared_ptr<VSLUserIdentityCache> userIdentityCache_;
};

}  // namespace vsl
