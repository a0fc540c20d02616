// Validates protection-class requests for data containers and starts the changes;
// restarts the changes a crash or reboot left pending.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "Daemon/Concurrency/VSLDataProtectionChangeOperation.h"
#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"
#include "Platform/WorkQueue.h"

namespace vsl {

// The protection-level names entitlements carry ("com.tarrow.protection." + level)
// and the class each stands for (the table of docs/operations.md).
struct VSLProtectionLevelName {
    const char* name;
    int32_t protectionClass;
};
extern const VSLProtectionLevelName kVSLProtectionLevelNames[6];

class VSLDataProtectionManager {
public:
    static VSLDataProtectionManager& defaultManager();

    // "com.tarrow.Vesselry.ProtectionOperationFileQueue": every pending-update file
    // is read, written and deleted there.
    const std::shared_ptr<WorkQueue>& protectionOperationFileQueue() const { return queue_; }

    // `completion` is called exactly once, with 1 or an error code.
    void setDataProtectionOnDataContainerForContainerIdentity(const VSLContainerIdentityRef& identity,
                                                              int32_t dataProtectionClass,
                                                              bool isSecondOrThirdPartyApp, bool retryIfLocked,
                                                              std::function<void(uint64_t)> completion);
    bool restartPendingDataProtectionOperationsWithError(VSLErrorRef* error);
    int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier);
    void _startDataProtectionChangeOperation(const VSLDataProtectionChangeOperation::Ref& operation,
                                             std::function<void(uint64_t)> completion);

private:
    VSLDataProtectionManager();
    std::shared_ptr<WorkQueue> queue_;
};

}  // namespace vsl
