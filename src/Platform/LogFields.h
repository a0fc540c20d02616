// Fields a log entry carries for the journal besides its text: the container a line
// concerns and the error code it reports. They are scoped to the writing thread, so
// code that knows the container sets them once and every line written below it,
// whoever writes it, carries them.
#pragma once

#include <functional>
#include <string_view>

namespace vsl {

constexpr const char* kLogFieldContainerIdentifier = "VSL_CONTAINER_IDENTIFIER";
constexpr const char* kLogFieldContainerUUID = "VSL_CONTAINER_UUID";
constexpr const char* kLogFieldErrorCode = "VSL_ERROR_CODE";

class LogFieldScope {
public:
    // `value` must outlive the scope; an empty one adds nothing.
    LogFieldScope(const char* name, std::string_view value);
    ~LogFieldScope();
    LogFieldScope(const LogFieldScope&) = delete;
    LogFieldScope& operator=(const LogFieldScope&) = delete;

private:
    friend void forEachLogField(const std::function<void(const char*, std::string_view)>& visit);
    LogFieldScope* outer_;
    const char* name_;
    std::string_view value_;
};

// The fields in force on this thread, innermost first; a name set again further in
// hides the outer value.
void forEachLogField(const std::function<void(const char*, std::string_view)>& visit);

}  // namespace vsl
