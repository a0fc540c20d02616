// Keeps an application terminated and unable to launch while its container is changed
// under it (a protection-class change retried after unlock). Made over the lifecycle
// service; must be invalidated before it is released.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "Platform/Lifecycle.h"

namespace vsl {

constexpr int8_t kVSLTerminationReasonCritical = -1;
constexpr int8_t kVSLTerminationReasonInstallation = 0;
constexpr int8_t kVSLTerminationReasonCacheDeletion = 1;

class VSLApplicationTerminationAssertion {
    struct Passkey {};

public:
    // Blocks until the service has acquired the assertion. None when the acquisition
    // failed; an object without an assertion when the service offers none. Must not be
    // called where the service's handler needs to run.
    static std::shared_ptr<VSLApplicationTerminationAssertion> initWithBundleIdentifier(
        const std::string& bundleIdentifier, int8_t reason);

    explicit VSLApplicationTerminationAssertion(Passkey) {}
    ~VSLApplicationTerminationAssertion();  // stops the process while an assertion is held
    VSLApplicationTerminationAssertion(const VSLApplicationTerminationAssertion&) = delete;
    VSLApplicationTerminationAssertion& operator=(const VSLApplicationTerminationAssertion&) = delete;

    // Releases the assertion, if any; again does nothing. Any thread.
    void invalidate();

    std::shared_ptr<LifecycleService::Assertion> termAssertion() const;
    void setTermAssertion(std::shared_ptr<LifecycleService::Assertion> assertion);

private:
    mutable std::mutex mutex_;
    std::shared_ptr<LifecycleService> service_;
    std::shared_ptr<LifecycleService::Assertion> termAssertion_;
};

}  // namespace vsl
