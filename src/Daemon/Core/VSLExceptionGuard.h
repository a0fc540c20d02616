// Client operations never throw across their interface: an exception inside a
// guarded body becomes code 40 ("Got exception: %@ : %@"); on internal builds the
// process then records the report in its crash annotation and aborts.
#pragma once

#include <string>
#include <vector>

#include "Daemon/Core/VSLError.h"

namespace vsl {

struct VSLExceptionInfo {
    std::string name;    // the exception's type; may be empty
    std::string reason;  // what(); may be empty
    std::vector<std::string> callStackSymbols;
    std::string description() const;
};

// Builds the report text (see the implementation), stores it in the crash
// annotation and aborts. Never returns.
[[noreturn]] void printUncaughtException(const VSLExceptionInfo& exception);
std::string uncaughtExceptionReport(const VSLExceptionInfo& exception, const std::string& threadName);

// For the active exception inside a catch block.
VSLExceptionInfo currentExceptionInfo();

// The error for a caught exception; aborts instead on internal builds.
VSLErrorRef errorForCaughtException(const char* function, int line);

// Runs `body` (returning bool); on an exception sets *error to the code-40 error and
// returns false.
template <class F>
bool guardExceptions(const char* function, int line, VSLErrorRef* error, F&& body) {
    try {
        return body();
    } catch (...) {
        auto e = errorForCaughtException(function, line);
        if (error) *error = e;
        return false;
    }
}

}  // namespace vsl

#define VSL_GUARD_EXCEPTIONS(errorOut, body) ::vsl::guardExceptions(VSL_FUNCTION, __LINE__, (errorOut), (body))
