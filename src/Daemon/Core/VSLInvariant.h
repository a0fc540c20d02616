// Checks of conditions the code relies on. A failed check is a programming error:
// the process logs a report naming the expression as written, the function and the
// source file, stores it as the crash annotation and aborts. Checks are never
// compiled out, so the checked expression may have effects the code depends on.
#pragma once

#include <string>

namespace vsl {

// Logs `message` at level 3 under `function`, records it as the crash annotation
// and aborts.
[[noreturn]] void VSLFatalError(const char* function, const std::string& message);

// The report for a failed check; `file` is shortened to its path below "src/".
std::string VSLInvariantReport(const char* expression, const char* function, const char* file, int line);

[[noreturn]] void VSLInvariantFailed(const char* expression, const char* function, const char* file, int line);

}  // namespace vsl

#define VSL_INVARIANT(expression) \
    ((expression) ? (void)0 : ::vsl::VSLInvariantFailed(#expression, __func__, __FILE__, __LINE__))
