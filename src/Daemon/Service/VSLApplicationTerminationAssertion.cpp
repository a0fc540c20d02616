#include "Daemon/Service/VSLApplicationTerminationAssertion.h"

#include <condition_variable>
#include <mutex>
#include <optional>
#include <utility>

#include "Daemon/Core/VSLInvariant.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* _QuayApplicationTerminationReasonStringForReason(int8_t reason) {
    switch (reason) {
        case kVSLTerminationReasonCritical: return "critical";
        case kVSLTerminationReasonInstallation: return "installation";
        case kVSLTerminationReasonCacheDeletion: return "cache deletion";
    }
    LogWrite(kLogLevelError, "_QuayApplicationTerminationReasonStringForReason", "Unknown reason: %d",
             static_cast<int>(reason));
    VSLFatalError("_QuayApplicationTerminationReasonStringForReason", "Unknown reason");
}

constexpr const char* kInitFn = "-[VSLApplicationTerminationAssertion initWithBundleIdentifier:reason:]";

}  // namespace

std::shared_ptr<VSLApplicationTerminationAssertion> VSLApplicationTerminationAssertion::initWithBundleIdentifier(
    const std::string& bundleIdentifier, int8_t reason) {
    auto self = std::make_shared<VSLApplicationTerminationAssertion>(Passkey{});
    self->service_ = LifecycleService::shared();
    if (!self->service_->terminationAssertionsAvailable()) {
        LogWrite(kLogLevelError, kInitFn, "Attempted to use termation assertions with Quay not avaible");
        return self;
    }
    const char* lifecycleReason = _QuayApplicationTerminationReasonStringForReason(reason);

    struct Completion {
        std::mutex mutex;
        std::condition_variable signalled;
        bool done = false;
        bool failed = false;
    };
    auto completion = std::make_shared<Completion>();
    auto handler = [completion, bundleIdentifier](const std::optional<std::string>& error) {
        if (error)
            LogWrite(kLogLevelError, kInitFn, "Failed to acquire termination assertion for %@ : %@", bundleIdentifier,
                     *error);
        std::lock_guard<std::mutex> guard(completion->mutex);
        completion->failed = error.has_value();
        completion->done = true;
        completion->signalled.notify_all();
    };
    self->termAssertion_ = self->service_->acquireTerminationAssertion(bundleIdentifier, lifecycleReason, handler);
    if (!self->termAssertion_) {
        LogWrite(kLogLevelError, kInitFn, "Failed to get QuayApplicationTerminationAssertion");
        return nullptr;
    }
    std::unique_lock<std::mutex> lock(completion->mutex);
    completion->signalled.wait(lock, [&] { return completion->done; });
    if (completion->failed) {
        self->invalidate();
        return nullptr;
    }
    return self;
}

VSLApplicationTerminationAssertion::~VSLApplicationTerminationAssertion() {
    if (termAssertion_) VSLInvariantFailed("nil == self.termAssertion", __func__, __FILE__, __LINE__);
}

void VSLApplicationTerminationAssertion::invalidate() {
    std::shared_ptr<LifecycleService::Assertion> held;
    {
        std::lock_guard<std::mutex> guard(mutex_);
        held = std::exchange(termAssertion_, nullptr);
    }
    if (held) service_->invalidate(held);
}

std::shared_ptr<LifecycleService::Assertion> VSLApplicationTerminationAssertion::termAssertion() const {
    std::lock_guard<std::mutex> guard(mutex_);
    return termAssertion_;
}

void VSLApplicationTerminationAssertion::setTermAssertion(std::shared_ptr<LifecycleService::Assertion> assertion) {
    std::lock_guard<std::mutex> guard(mutex_);
    termAssertion_ = std::move(assertion);
}

}  // namespace vsl
