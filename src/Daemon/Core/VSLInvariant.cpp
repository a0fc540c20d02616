#include "Daemon/Core/VSLInvariant.h"

#include <cstdlib>
#include <mutex>

#include "Platform/CrashAnnotation.h"
#include "Platform/Log.h"

namespace vsl {

void VSLFatalError(const char* function, const std::string& message) {
    // Two threads failing at once would interleave their reports: the first one wins
    // and the others wait for the end. A failure while reporting just stops.
    static std::mutex reportMutex;
    static thread_local bool reporting = false;
    if (reporting) std::abort();
    reporting = true;
    reportMutex.lock();
    LogWrite(kLogLevelError, function, "%s", message);
    setCrashReportMessage(message);
    std::abort();
}

std::string VSLInvariantReport(const char* expression, const char* function, const char* file, int line) {
    std::string path = file ? file : "";
    size_t below = path.rfind("src/");
    if (below != std::string::npos) path.erase(0, below + 4);
    return "Assertion failed: (" + std::string(expression) + "), function " + function + ", file " + path +
           ", line " + std::to_string(line) + ".";
}

void VSLInvariantFailed(const char* expression, const char* function, const char* file, int line) {
    VSLFatalError(function, VSLInvariantReport(expression, function, file, line));
}

}  // namespace vsl
