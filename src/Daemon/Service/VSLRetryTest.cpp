// The retry test: the daemon ends itself a requested number of times in a row, so that
// a client's retry logic meets a restarting daemon. The count of crashes still to come
// lives in the retry container's metadata and so survives each restart.
#include <unistd.h>

#include <chrono>
#include <thread>

#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"

namespace vsl {

namespace {
const char* const kRetryFn = "-[VSLClientConnection retryTestWithNumCrashes:withError:]";
const char* const kCrashCounterKey = "CrashCounter";
}  // namespace

bool VSLClientConnection::retryTestWithNumCrashes(uint64_t numCrashes, uint64_t* code) {
    VSLErrorRef error;
    uint64_t result = kVSLSuccess;
    bool ok = guardExceptions(kRetryFn, __LINE__, &error, [&]() -> bool {
        clientIdentity_ = VSLClientIdentity::anonymousPrivilegedClientIdentity();
        auto user = VSLUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, std::string("com.tarrow.retryTest"),
                                                                                kVSLClassApplicationData, &result);
        VSLMetadataRef container;
        if (identity) container = createOrLookupContainerWithContainerIdentity(identity, true, false, true, &result);
        if (!container) {
            LogWrite(kLogLevelError, kRetryFn, "Failed to create or lookup lookup existing container for retry test: %@",
                     identity);
            return true;
        }
        auto concrete = container->containerIdentity();
        uint64_t remaining = numCrashes;
        if (const Value* counter = container->info() ? container->info()->find(kCrashCounterKey) : nullptr)
            remaining = counter->uint64Value().value_or(1) - 1;
        LogWrite(kLogLevelError, kRetryFn, "Crashes Remaining in retry test: %llu", remaining);
        setInfoValue(Value::uint64(remaining), Value::string(kCrashCounterKey), concrete, true, &result);
        if (remaining != 0) {
            LogWrite(kLogLevelError, kRetryFn, "Crashing");
            std::this_thread::sleep_for(std::chrono::seconds(2));
            ::_exit(0);
        }
        commandQueue_->insertCommand(
            VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities({concrete}, true, nullptr));
        if (result == kVSLSuccess)
            LogWrite(kLogLevelError, kRetryFn, "Returning Successfully");
        else
            LogWrite(kLogLevelError, kRetryFn, "Failed to delete retry container at : %@", container->url());
        return true;
    });
    if (!ok) result = codeForError(error, kVSLErrorException);
    if (result != kVSLSuccess && code) *code = result;
    return result == kVSLSuccess;
}

}  // namespace vsl
