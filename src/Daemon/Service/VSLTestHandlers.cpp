// The test controls: retryTest (25) and setTestLock (31), internal builds only.
#include <bitset>
#include <mutex>

#include "Daemon/Concurrency/VSLTestLocks.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLInfoHandlers.h"
#include "Daemon/Service/VSLRequestDecoding.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/Log.h"

namespace vsl {

namespace {
// Locks acquired through the command and not yet released: keeps repeated requests
// idempotent and releases balanced.
std::mutex gHeldMutex;
std::bitset<VSLTestLocks::kLockCount> gHeldTestLocks;
}  // namespace

void handleRetryTest(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                     uint64_t* code) {
    if (!VSLGlobalConfiguration::sharedInstance()->isInternalImage()) {
        LogWrite(kLogLevelError, "retryTest", "People really shouldn't be calling this on non-internal installs!");
        return;
    }
    connection->retryTestWithNumCrashes(uint64FromRequest(request, "NumRetryCrashes").value_or(0), code);
}

void handleSetTestLock(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef&, uint64_t* code) {
    if (!VSLGlobalConfiguration::sharedInstance()->isInternalImage()) {
        LogWrite(kLogLevelError, "setTestLock", "Unsupported call to set lock!");
        return;
    }
    const uint64_t lock = uint64FromRequest(request, "TestLock").value_or(0);
    const bool enable = boolFromRequest(request, "Enable").value_or(false);
    auto& locks = VSLTestLocks::sharedInstance();
    // Held across the lock change so that two clients cannot interleave bit and count.
    std::lock_guard<std::mutex> guard(gHeldMutex);
    if (lock == VSLTestLocks::kLockCount && !enable) {
        locks.setEnabled(false);
        gHeldTestLocks.reset();
        return;
    }
    if (lock >= VSLTestLocks::kLockCount) {
        *code = kVSLErrorInvalidArgument;
        return;
    }
    if (enable) {
        if (gHeldTestLocks.test(lock)) return;
        gHeldTestLocks.set(lock);
        locks.setEnabled(true);
        locks.acquireLock(lock);
        return;
    }
    if (!gHeldTestLocks.test(lock)) return;
    gHeldTestLocks.reset(lock);
    if (lock < 2) gHeldTestLocks.reset(1 - lock);
    locks.releaseLock(lock);
    if (gHeldTestLocks.none()) locks.setEnabled(false);
}

}  // namespace vsl
