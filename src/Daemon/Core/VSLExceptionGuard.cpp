#include "Daemon/Core/VSLExceptionGuard.h"

#include <cxxabi.h>

#include <cstdlib>
#include <exception>
#include <mutex>
#include <typeinfo>

#include "Platform/CrashAnnotation.h"
#include "Platform/DeviceFacts.h"

namespace vsl {

std::string VSLExceptionInfo::description() const {
    if (name.empty()) return reason;
    if (reason.empty()) return name;
    return name + ": " + reason;
}

std::string uncaughtExceptionReport(const VSLExceptionInfo& exception, const std::string& threadName) {
    std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    if (!threadName.empty()) text += "<" + threadName + "> ";
    if (!exception.name.empty()) text += exception.name + ": ";
    text += exception.reason;
    text += "\nStack:\n";
    for (size_t i = 0; i < exception.callStackSymbols.size(); i++) {
        if (i) text += "\n";
        text += exception.callStackSymbols[i];
    }
    return text;
}

void printUncaughtException(const VSLExceptionInfo& exception) {
    static std::mutex reportMutex;
    std::string text = uncaughtExceptionReport(exception, currentThreadName());
    reportMutex.lock();  // never released: one report, then the end
    setCrashReportMessage(text);
    std::abort();
}

VSLExceptionInfo currentExceptionInfo() {
    VSLExceptionInfo info;
    if (auto* type = abi::__cxa_current_exception_type()) {
        int status = 0;
        char* demangled = abi::__cxa_demangle(type->name(), nullptr, nullptr, &status);
        info.name = (status == 0 && demangled) ? demangled : type->name();
        std::free(demangled);
    }
    try {
        throw;
    } catch (const std::exception& e) {
        info.reason = e.what();
    } catch (...) {
    }
    info.callStackSymbols = currentCallStackSymbols(1);
    return info;
}

VSLErrorRef errorForCaughtException(const char* function, int line) {
    VSLExceptionInfo info = currentExceptionInfo();
    std::string stack;
    for (const auto& s : info.callStackSymbols) stack += s + "\n";
    auto error = createVSLError(function, line, kVSLErrorException, nullptr, true, "Got exception: %@ : %@",
                                info.description(), stack);
    if (deviceFacts().internalBuild) printUncaughtException(info);
    return error;
}

}  // namespace vsl
