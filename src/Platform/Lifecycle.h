// The application lifecycle service: termination assertions. Holding one for a bundle
// identifier means every process whose policy-store record carries that signing
// identifier has been killed (never this process) and a launch-block marker
// run/vesseld/launch-block/<encoded identifier> below the system root, holding the
// reason name, tells launchers not to start it again until the assertion is
// invalidated.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace vsl {

class LifecycleService {
public:
    class Assertion {
    public:
        virtual ~Assertion() = default;
    };
    // None, or why the acquisition failed.
    using AcquisitionHandler = std::function<void(const std::optional<std::string>& error)>;

    virtual ~LifecycleService() = default;

    virtual bool terminationAssertionsAvailable() = 0;
    // An assertion object at once, or none; the handler is called exactly once, on any
    // thread (possibly before this returns), when the assertion is held or has failed.
    virtual std::shared_ptr<Assertion> acquireTerminationAssertion(const std::string& bundleIdentifier,
                                                                   const std::string& reason,
                                                                   AcquisitionHandler handler) = 0;
    // Releases the hold; calling it again does nothing.
    virtual void invalidate(const std::shared_ptr<Assertion>& assertion) = 0;

    // The service in use: the Linux one unless a test put another in its place.
    static std::shared_ptr<LifecycleService> shared();
    static void setShared(std::shared_ptr<LifecycleService> service);
};

// The Linux service described above.
std::shared_ptr<LifecycleService> makeProcessLifecycleService();

std::string launchBlockDirectory();
// The marker's file name: "%", "/", NUL and a leading "." percent-encoded, so that no
// identifier names anything but a plain entry of the launch-block directory. None for
// an empty identifier.
std::optional<std::string> launchBlockMarkerName(const std::string& bundleIdentifier);

}  // namespace vsl
