// Faults that end-to-end tests inject into a real daemon; kill-point builds only,
// every other build answers false.
#pragma once

#include <string>

namespace vsl {

// VESSELD_TEST_FAIL_CREATE=IDENTIFIER: every creation of a container with exactly
// that identifier fails after its staging directory was made.
bool creationFailureInjectedFor(const std::string& identifier);

}  // namespace vsl
