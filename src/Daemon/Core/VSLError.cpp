#include "Daemon/Core/VSLError.h"

#include "Platform/LogFields.h"

namespace vsl {

const char* const VSLErrorDomain = "VSLErrorDomain";
const char* const VSLPOSIXErrorDomain = "POSIXErrorDomain";
const char* const VSLGeneralErrorDomain = "GeneralErrorDomain";

VSLErrorRef makeVSLError(const char* function, int line, uint64_t code, VSLErrorRef underlying, bool log,
                         std::optional<std::string> message) {
    auto e = std::make_shared<VSLError>();
    e->domain = VSLErrorDomain;
    e->code = static_cast<int64_t>(code);
    e->localizedDescription = std::move(message);
    e->underlyingError = std::move(underlying);
    e->functionName = function ? function : "";
    e->sourceFileLine = line;
    if (log && e->localizedDescription) {
        const std::string codeText = std::to_string(code);
        LogFieldScope codeField(kLogFieldErrorCode, codeText);
        if (e->underlyingError)
            LogWrite(kLogLevelError, e->functionName.c_str(), "%d: %@ (%@)", line, *e->localizedDescription,
                     e->underlyingError);
        else
            LogWrite(kLogLevelError, e->functionName.c_str(), "%d: %@", line, *e->localizedDescription);
    }
    return e;
}

std::string VSLError::description() const {
    std::string s = "Error Domain=" + domain + " Code=" + std::to_string(code);
    if (localizedDescription) s += " \"" + *localizedDescription + "\"";
    s += " UserInfo={FunctionName=" + functionName + ", SourceFileLine=" + std::to_string(sourceFileLine);
    if (underlyingError) s += ", UnderlyingError=" + underlyingError->description();
    return s + "}";
}

uint64_t codeForError(const VSLErrorRef& error, uint64_t fallback) {
    if (error && error->isVSLDomain() && error->code > 0) return static_cast<uint64_t>(error->code);
    return fallback;
}

}  // namespace vsl
