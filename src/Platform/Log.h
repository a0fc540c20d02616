// The daemon's two logs.
//  - LogWrite: the rotating file "vesseld.log" at numeric levels 3 (error), 5 (notice)
//    and 7 (debug), each line carrying the writer's function name.
//  - osLog: the structured log, subsystem "com.tarrow.vessel" with one category per
//    area (journald fields SUBSYSTEM/CATEGORY; stderr when no journal).
// Format strings are the daemon's own texts as they stand: %@ prints an object's
// description, the printf conversions (%s %d %u %ld %lld %llu %c %p %x %f, flags,
// width, precision) print their values, and %{public}/%{private} annotations are
// accepted and dropped. Debug lines are formatted only when debug logging is on.
// What is written follows one verbosity (LogVerbosity below): errors always, the
// rest only when asked for, so that serving a request costs no log line by default.
#pragma once

#include <concepts>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace vsl {

// One argument of a log format, already reduced to what a conversion can print.
struct LogArg {
    enum class Kind { Signed, Unsigned, Double, String, Pointer, Object };
    Kind kind = Kind::Object;
    int64_t i = 0;
    uint64_t u = 0;
    double d = 0;
    const void* p = nullptr;
    std::string s;  // String: the text; Object: the description ("(null)" for none)
};

template <class T>
concept Describable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

template <class T>
LogArg makeLogArg(const T& v) {
    LogArg a;
    using D = std::decay_t<T>;
    if constexpr (std::is_array_v<std::remove_reference_t<T>>) {  // string literals
        a.kind = LogArg::Kind::String;
        a.s = std::string(v);
        a.p = v;
    } else if constexpr (std::is_same_v<D, bool>) {
        a.kind = LogArg::Kind::Signed;
        a.i = v ? 1 : 0;
    } else if constexpr (std::is_integral_v<D> && std::is_signed_v<D>) {
        a.kind = LogArg::Kind::Signed;
        a.i = static_cast<int64_t>(v);
    } else if constexpr (std::is_integral_v<D>) {
        a.kind = LogArg::Kind::Unsigned;
        a.u = static_cast<uint64_t>(v);
    } else if constexpr (std::is_enum_v<D>) {
        a.kind = LogArg::Kind::Signed;
        a.i = static_cast<int64_t>(v);
    } else if constexpr (std::is_floating_point_v<D>) {
        a.kind = LogArg::Kind::Double;
        a.d = v;
    } else if constexpr (std::is_same_v<D, std::string> || std::is_same_v<D, std::string_view>) {
        a.kind = LogArg::Kind::String;
        a.s = std::string(v);
    } else if constexpr (std::is_same_v<D, const char*> || std::is_same_v<D, char*>) {
        a.kind = LogArg::Kind::String;
        a.s = v ? v : "(null)";
        a.p = v;
    } else if constexpr (std::is_same_v<D, std::nullptr_t>) {
        a.kind = LogArg::Kind::Object;
        a.s = "(null)";
    } else if constexpr (Describable<D>) {
        a.kind = LogArg::Kind::Object;
        a.s = v.description();
        a.p = &v;
    } else if constexpr (requires { v.get(); *v; }) {  // shared_ptr / unique_ptr
        if (!v) {
            a.kind = LogArg::Kind::Object;
            a.s = "(null)";
            return a;
        }
        a = makeLogArg(*v);
        a.p = v.get();
    } else if constexpr (requires { v.has_value(); *v; }) {  // optional
        if (!v.has_value()) {
            a.kind = LogArg::Kind::Object;
            a.s = "(null)";
            return a;
        }
        a = makeLogArg(*v);
    } else if constexpr (std::is_pointer_v<D>) {
        using P = std::remove_cv_t<std::remove_pointer_t<D>>;
        if constexpr (Describable<P>) {
            if (v) {
                a = makeLogArg(*v);
            } else {
                a.kind = LogArg::Kind::Object;
                a.s = "(null)";
            }
        } else {
            a.kind = LogArg::Kind::Pointer;
        }
        a.p = v;
    } else {
        static_assert(sizeof(D) == 0, "no log rendering for this type");
    }
    return a;
}

// Renders a format with already-converted arguments. Never fails: a missing
// argument prints "(null)", an unknown conversion prints as written.
std::string formatLogMessage(std::string_view format, const std::vector<LogArg>& args);

template <class... Args>
std::string formatLog(std::string_view format, const Args&... args) {
    return formatLogMessage(format, std::vector<LogArg>{makeLogArg(args)...});
}

// ---- verbosity ----

// Error: errors and faults in the structured log; levels 3 and 5 in the file.
// Default: also the structured log's default-level lines. Info: also its info lines
// and signposts (one pair per request). Debug: also debug lines in both logs.
enum class LogVerbosity { Error, Default, Info, Debug };

// Error unless VESSELD_DEBUG=1 (Debug) until set otherwise.
LogVerbosity logVerbosity();
void setLogVerbosity(LogVerbosity verbosity);
// "error", "default" (or "notice"), "info", "debug"; none for anything else.
std::optional<LogVerbosity> logVerbosityNamed(std::string_view name);
// 3, 5, 6, 7 as above; none for anything else.
std::optional<LogVerbosity> logVerbosityForLevel(int64_t level);

// ---- rotating file log ----

constexpr int kLogLevelError = 3;
constexpr int kLogLevelNotice = 5;
constexpr int kLogLevelDebug = 7;

struct LogFileOptions {
    std::string directory;             // created if missing
    std::string name = "vesseld.log";
    uint64_t maxBytes = 8 << 20;        // rotate when the next line would pass this
    int rotatedFiles = 3;               // vesseld.log.1 ... vesseld.log.N
};

// Opens (or re-opens) the rotating file. Before this, LogWrite goes to stderr only.
bool openLogFile(const LogFileOptions& options);
void closeLogFile();
// Also mirrors LogWrite lines to stderr (the daemon's foreground mode).
void setLogWriteToStderr(bool on);
void setDebugLogging(bool on);  // Debug, or back to Error
bool isDebugLogging();          // logVerbosity() is Debug

void logWriteLine(int level, const char* function, const std::string& message);

template <class... Args>
void LogWrite(int level, const char* function, std::string_view format, const Args&... args) {
    if (level >= kLogLevelDebug && !isDebugLogging()) return;
    logWriteLine(level, function, formatLog(format, args...));
}

// ---- structured log ----

enum class LogCategory {
    Unspecified, Cache, Sandbox, Ipc, Locking, Database, Upcall, Lifecycle, Fs, Startup, Test,
    Metadata, CodeSignMapping,
    Daemon,  // subsystem "com.tarrow.vesseld": the entry code's own handle
};
enum class OSLogLevel { Debug, Info, Default, Error, Fault };

const char* logCategoryName(LogCategory c);
const char* logSubsystemName(LogCategory c);
void osLogLine(LogCategory category, OSLogLevel level, const std::string& message);
// Whether a line of that level goes anywhere now (a test sink takes every line but
// debug ones, which need Debug verbosity).
bool osLogEnabled(OSLogLevel level);
bool signpostsEnabled();

template <class... Args>
void osLog(LogCategory category, OSLogLevel level, std::string_view format, const Args&... args) {
    if (!osLogEnabled(level)) return;
    osLogLine(category, level, formatLog(format, args...));
}

// ---- signposts: intervals as begin/end events with their attributes ----

class SignpostInterval {
public:
    template <class... Args>
    SignpostInterval(LogCategory category, const char* name, std::string_view format, const Args&... args)
        : SignpostInterval(category, name, signpostsEnabled() ? formatLog(format, args...) : std::string()) {}
    SignpostInterval(LogCategory category, const char* name, std::string attributes);
    ~SignpostInterval();  // emits the end event
    template <class... Args>
    void end(std::string_view format, const Args&... args) {
        endWith(signpostsEnabled() ? formatLog(format, args...) : std::string());
    }
    SignpostInterval(const SignpostInterval&) = delete;
    SignpostInterval& operator=(const SignpostInterval&) = delete;

private:
    void endWith(std::string attributes);
    LogCategory category_;
    const char* name_;
    uint64_t id_;
    bool ended_ = false;
};

// ---- test hook: what the structured log would send, instead of sending it ----

struct OSLogRecord {
    LogCategory category;
    OSLogLevel level;
    std::string message;
    const char* signpostEvent = nullptr;  // "begin" / "end" for signposts, else null
    const char* signpostName = nullptr;
    uint64_t signpostId = 0;
};
// While set, every structured-log record goes to the sink only, whatever the
// verbosity (debug lines still need Debug); an empty function restores the
// journal/stderr destination.
void setOSLogSink(std::function<void(const OSLogRecord&)> sink);

}  // namespace vsl
