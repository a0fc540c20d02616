#include "Daemon/Core/VSLInjectedFaults.h"

#include <cstdlib>

namespace vsl {

#ifdef VESSEL_KILLPOINTS
bool creationFailureInjectedFor(const std::string& identifier) {
    static const char* const failing = std::getenv("VESSELD_TEST_FAIL_CREATE");
    return failing && *failing && identifier == failing;
}
#else
bool creationFailureInjectedFor(const std::string&) { return false; }
#endif

}  // namespace vsl
