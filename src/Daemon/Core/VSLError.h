// Error objects: a code in a domain plus the function and source line that raised
// it. Made where the failure happens (and logged there once), handed up by
// shared_ptr; callers that only need the number read `code`.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "Daemon/Core/VSLErrorCodes.h"
#include "Platform/Log.h"

namespace vsl {

extern const char* const VSLErrorDomain;      // "VSLErrorDomain"
extern const char* const VSLPOSIXErrorDomain;  // errno values of file-system calls
extern const char* const VSLGeneralErrorDomain;  // the platform's general failures (2048, ...)

struct VSLError;
using VSLErrorRef = std::shared_ptr<const VSLError>;

struct VSLError {
    std::string domain;
    int64_t code = 0;
    std::optional<std::string> localizedDescription;  // present when a format was given
    VSLErrorRef underlyingError;
    std::string functionName;  // "FunctionName"
    int32_t sourceFileLine = 0;  // "SourceFileLine"

    bool isVSLDomain() const { return domain == VSLErrorDomain; }
    std::string description() const;
};

VSLErrorRef makeVSLError(const char* function, int line, uint64_t code, VSLErrorRef underlying, bool log,
                         std::optional<std::string> message);

// createVSLError(function, line, code, underlying, log, format, args...): with the log
// flag and a format, writes "%d: %@ (%@)" or "%d: %@" at level 3 in the caller's name.
template <class... Args>
VSLErrorRef createVSLError(const char* function, int line, uint64_t code, VSLErrorRef underlying, bool log,
                           const char* format, const Args&... args) {
    std::optional<std::string> message;
    if (format) message = formatLog(format, args...);
    return makeVSLError(function, line, code, std::move(underlying), log, std::move(message));
}

inline VSLErrorRef createVSLError(const char* function, int line, uint64_t code, VSLErrorRef underlying,
                                  bool log) {
    return makeVSLError(function, line, code, std::move(underlying), log, std::nullopt);
}

// A POSIX-domain error: code = errno value; never logs.
template <class... Args>
VSLErrorRef createPOSIXError(const char* function, int line, int err, const char* format,
                             const Args&... args) {
    auto e = std::make_shared<VSLError>();
    e->domain = VSLPOSIXErrorDomain;
    e->code = err;
    e->localizedDescription = formatLog(format, args...);
    e->functionName = function;
    e->sourceFileLine = line;
    return e;
}

// The code a caller reports for an error object: VSL-domain codes pass through; any
// other domain maps to `fallback`.
uint64_t codeForError(const VSLErrorRef& error, uint64_t fallback);

// Whether `error` is present, of `domain` and carries `code`.
inline bool errorHasCode(const VSLErrorRef& error, int64_t code, const char* domain = VSLErrorDomain) {
    return error && error->code == code && error->domain == domain;
}
inline bool isPOSIXError(const VSLErrorRef& error, int err) { return errorHasCode(error, err, VSLPOSIXErrorDomain); }

// Never defined: calling it makes the build fail.
void aLogLineInsideALambdaMustNameItsMethod();

// The writer's name for a log line or an error. Inside a lambda __func__ is
// "operator()", which tells a reader nothing: there the build fails, and the call
// site names its method explicitly.
consteval const char* writerFunctionName(const char* name) {
    if (std::string_view(name) == "operator()") aLogLineInsideALambdaMustNameItsMethod();
    return name;
}

}  // namespace vsl

#define VSL_FUNCTION ::vsl::writerFunctionName(__func__)
#define VSL_ERROR(code, underlying, log, ...) \
    ::vsl::createVSLError(VSL_FUNCTION, __LINE__, (code), (underlying), (log), __VA_ARGS__)
#define VSL_POSIX_ERROR(err, ...) ::vsl::createPOSIXError(VSL_FUNCTION, __LINE__, (err), __VA_ARGS__)
