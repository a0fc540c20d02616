#include "Daemon/Core/VSLInjectedFaults.h"

#include <cstdlib>
#include <set>
#include <sstream>

namespace vsl {

#ifdef VESSEL_KILLPOINTS
bool creationFailureInjectedFor(const std::string& identifier) {
    static const char* const failing = std::getenv("VESSELD_TEST_FAIL_CREATE");
    return failing && *failing && identifier == failing;
}

bool databaseWriteFailureInjectedFor(const std::string& identifier) {
    static const std::set<std::string> failing = [] {
        std::set<std::string> names;
        const char* value = std::getenv("VESSELD_TEST_FAIL_DB_WRITES");
        std::istringstream list(value ? value : "");
        for (std::string name; std::getline(list, name, ',');)
            if (!name.empty()) names.insert(name);
        return names;
    }();
    return failing.count("*") != 0 || failing.count(identifier) != 0;
}
#else
bool creationFailureInjectedFor(const std::string&) { return false; }
#endif

}  // namespace vsl
