// The rotating log file, the structured log and signposts.
// Both logs are written with raw system calls: the durable-I/O helpers log themselves.
#include "Platform/Log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>

#include "Platform/DurableIO.h"
#include "Platform/JournalSink.h"
#include "Platform/UniqueFd.h"

namespace vsl {
namespace {

void writeAll(int fd, const std::string& data) {
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = ::write(fd, data.data() + done, data.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return;
        done += static_cast<size_t>(n);
    }
}

// 2024-05-01T12:34:56.789Z
std::string timestamp() {
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    tm parts{};
    gmtime_r(&now.tv_sec, &parts);
    char buffer[40];
    size_t n = strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &parts);
    std::snprintf(buffer + n, sizeof buffer - n, ".%03ldZ", now.tv_nsec / 1000000);
    return buffer;
}

// A LogVerbosity, or -1 until the environment has been read.
std::atomic<int> gVerbosity{-1};
std::atomic<bool> gMirrorToStderr{false};

struct FileLog {
    std::mutex mutex;
    int fd = -1;
    LogFileOptions options;
    std::string path;
    uint64_t size = 0;
};

// Never destroyed: code running in static destructors may still log.
FileLog& fileLog() {
    static FileLog* log = new FileLog;
    return *log;
}

bool makeDirectories(const std::string& path) {
    UniqueFd dir;
    return durable::makeDirectoryNoFollow(path, 0755, true, dir.out()) == 0;
}

bool openLocked(FileLog& log) {
    log.fd = ::open(log.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (log.fd < 0) return false;
    struct stat st{};
    log.size = ::fstat(log.fd, &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
    return true;
}

// vesseld.log.(N-1) -> .N ... vesseld.log -> .1; the old .N is replaced and so dropped.
void rotateLocked(FileLog& log) {
    ::close(log.fd);
    log.fd = -1;
    int keep = log.options.rotatedFiles;
    if (keep <= 0) {
        ::unlink(log.path.c_str());
    } else {
        for (int k = keep; k >= 1; k--) {
            std::string from = k == 1 ? log.path : log.path + "." + std::to_string(k - 1);
            ::rename(from.c_str(), (log.path + "." + std::to_string(k)).c_str());
        }
    }
    openLocked(log);
}

// ---- structured log ----

enum class OSLogMode { Journal, Stderr, Off };

OSLogMode decideOSLogMode() {
    const char* forced = std::getenv("VESSELD_OSLOG");
    if (forced && std::strcmp(forced, "stderr") == 0) return OSLogMode::Stderr;
    if (forced && std::strcmp(forced, "off") == 0) return OSLogMode::Off;
    if (forced && std::strcmp(forced, "journal") == 0) return OSLogMode::Journal;
    return ::access(journalSocketPath().c_str(), F_OK) == 0 ? OSLogMode::Journal : OSLogMode::Stderr;
}

OSLogMode osLogMode() {
    static const OSLogMode mode = decideOSLogMode();
    return mode;
}

std::atomic<bool> gHasSink{false};
std::mutex gSinkMutex;
std::function<void(const OSLogRecord&)>& sinkSlot() {
    static auto* sink = new std::function<void(const OSLogRecord&)>;
    return *sink;
}

std::atomic<uint64_t> gNextSignpostId{1};

int journalPriority(OSLogLevel level) {
    switch (level) {
    case OSLogLevel::Debug: return 7;
    case OSLogLevel::Info: return 6;
    case OSLogLevel::Default: return 5;
    case OSLogLevel::Error: return 3;
    case OSLogLevel::Fault: return 2;
    }
    return 5;
}

const char* levelName(OSLogLevel level) {
    switch (level) {
    case OSLogLevel::Debug: return "debug";
    case OSLogLevel::Info: return "info";
    case OSLogLevel::Default: return "default";
    case OSLogLevel::Error: return "error";
    case OSLogLevel::Fault: return "fault";
    }
    return "default";
}

// The text a reader sees: the message, or the signpost event with its attributes.
std::string recordText(const OSLogRecord& r) {
    if (!r.signpostEvent) return r.message;
    return std::string("signpost ") + r.signpostEvent + " " + (r.signpostName ? r.signpostName : "") + " #" +
           std::to_string(r.signpostId) + ": " + r.message;
}

void writeRecordToStderr(const OSLogRecord& r) {
    std::string line = timestamp() + " " + logSubsystemName(r.category) + "[" + logCategoryName(r.category) + "] ";
    if (!r.signpostEvent) line += std::string(levelName(r.level)) + ": ";
    line += recordText(r);
    line += '\n';
    writeAll(STDERR_FILENO, line);
}

void sendRecordToJournal(const OSLogRecord& r) {
    const std::string text = recordText(r);
    const std::string priority = std::to_string(journalPriority(r.level));
    std::vector<JournalField> fields = {{"MESSAGE", text},
                                        {"PRIORITY", priority},
                                        {"SUBSYSTEM", logSubsystemName(r.category)},
                                        {"CATEGORY", logCategoryName(r.category)}};
    const std::string id = std::to_string(r.signpostId);
    if (r.signpostEvent) {
        fields.push_back({"SIGNPOST_ID", id});
        fields.push_back({"SIGNPOST_NAME", r.signpostName ? r.signpostName : ""});
        fields.push_back({"SIGNPOST_EVENT", r.signpostEvent});
    }
    if (!journalSend(fields)) writeRecordToStderr(r);  // the journal went away: keep the line
}

// The rotating log's entry in the journal as well, when the service manager started us.
bool sendLogWriteToJournal(int level, const char* function, const std::string& message) {
    if (!journalTakesLogWrite()) return false;
    const std::string priority = std::to_string(level);
    return journalSend({{"MESSAGE", message},
                        {"PRIORITY", priority},
                        {"SUBSYSTEM", logSubsystemName(LogCategory::Unspecified)},
                        {"CATEGORY", logCategoryName(LogCategory::Unspecified)},
                        {"CODE_FUNC", function ? function : "(null)"}});
}

LogVerbosity verbosityForOSLogLevel(OSLogLevel level) {
    switch (level) {
    case OSLogLevel::Debug: return LogVerbosity::Debug;
    case OSLogLevel::Info: return LogVerbosity::Info;
    case OSLogLevel::Default: return LogVerbosity::Default;
    case OSLogLevel::Error:
    case OSLogLevel::Fault: return LogVerbosity::Error;
    }
    return LogVerbosity::Default;
}

void emitRecord(const OSLogRecord& r) {
    if (gHasSink.load(std::memory_order_acquire)) {
        std::function<void(const OSLogRecord&)> sink;
        {
            std::lock_guard lock(gSinkMutex);
            sink = sinkSlot();
        }
        if (sink) {
            sink(r);
            return;
        }
    }
    switch (osLogMode()) {
    case OSLogMode::Journal: sendRecordToJournal(r); break;
    case OSLogMode::Stderr: writeRecordToStderr(r); break;
    case OSLogMode::Off: break;
    }
}

}  // namespace

// ---- rotating file log ----

bool openLogFile(const LogFileOptions& options) {
    FileLog& log = fileLog();
    std::lock_guard lock(log.mutex);
    if (log.fd >= 0) ::close(log.fd);
    log.fd = -1;
    log.options = options;
    log.path = options.directory.empty() ? options.name : options.directory + "/" + options.name;
    if (!options.directory.empty() && !makeDirectories(options.directory)) return false;
    return openLocked(log);
}

void closeLogFile() {
    FileLog& log = fileLog();
    std::lock_guard lock(log.mutex);
    if (log.fd >= 0) ::close(log.fd);
    log.fd = -1;
}

void setLogWriteToStderr(bool on) { gMirrorToStderr.store(on, std::memory_order_relaxed); }

LogVerbosity logVerbosity() {
    int state = gVerbosity.load(std::memory_order_relaxed);
    if (state >= 0) return static_cast<LogVerbosity>(state);
    const char* env = std::getenv("VESSELD_DEBUG");
    const auto fromEnv = env && *env && std::strcmp(env, "0") != 0 ? LogVerbosity::Debug : LogVerbosity::Error;
    gVerbosity.compare_exchange_strong(state, static_cast<int>(fromEnv), std::memory_order_relaxed);
    return static_cast<LogVerbosity>(gVerbosity.load(std::memory_order_relaxed));
}

void setLogVerbosity(LogVerbosity verbosity) {
    gVerbosity.store(static_cast<int>(verbosity), std::memory_order_relaxed);
}

std::optional<LogVerbosity> logVerbosityNamed(std::string_view name) {
    if (name == "error") return LogVerbosity::Error;
    if (name == "default" || name == "notice") return LogVerbosity::Default;
    if (name == "info") return LogVerbosity::Info;
    if (name == "debug") return LogVerbosity::Debug;
    return std::nullopt;
}

std::optional<LogVerbosity> logVerbosityForLevel(int64_t level) {
    switch (level) {
    case kLogLevelError: return LogVerbosity::Error;
    case kLogLevelNotice: return LogVerbosity::Default;
    case 6: return LogVerbosity::Info;
    case kLogLevelDebug: return LogVerbosity::Debug;
    }
    return std::nullopt;
}

void setDebugLogging(bool on) { setLogVerbosity(on ? LogVerbosity::Debug : LogVerbosity::Error); }

bool isDebugLogging() { return logVerbosity() == LogVerbosity::Debug; }

void logWriteLine(int level, const char* function, const std::string& message) {
    if (level >= kLogLevelDebug && !isDebugLogging()) return;
    std::string line = timestamp();
    line += ' ';
    line += std::to_string(::getpid());
    line += ' ';
    line += std::to_string(level);
    line += ' ';
    line += function ? function : "(null)";
    line += ": ";
    line += message;
    line += '\n';
    // Under the service manager stderr is the journal too: an entry sent needs no copy there.
    const bool journaled = sendLogWriteToJournal(level, function, message);

    FileLog& log = fileLog();
    std::lock_guard lock(log.mutex);
    if (log.fd < 0) {
        if (!journaled) writeAll(STDERR_FILENO, line);
        return;
    }
    if (log.size > 0 && log.size + line.size() > log.options.maxBytes) rotateLocked(log);
    if (log.fd >= 0) {
        writeAll(log.fd, line);
        log.size += line.size();
    }
    if ((log.fd < 0 && !journaled) || gMirrorToStderr.load(std::memory_order_relaxed)) writeAll(STDERR_FILENO, line);
}

// ---- structured log ----

const char* logCategoryName(LogCategory c) {
    switch (c) {
    case LogCategory::Unspecified: return "unspecified";
    case LogCategory::Cache: return "cache";
    case LogCategory::Sandbox: return "sandbox";
    case LogCategory::Ipc: return "ipc";
    case LogCategory::Locking: return "locking";
    case LogCategory::Database: return "database";
    case LogCategory::Upcall: return "upcall";
    case LogCategory::Lifecycle: return "lifecycle";
    case LogCategory::Fs: return "fs";
    case LogCategory::Startup: return "startup";
    case LogCategory::Test: return "test";
    case LogCategory::Metadata: return "metadata";
    case LogCategory::CodeSignMapping: return "codesignmapping";
    case LogCategory::Daemon: return "daemon";
    }
    return "unspecified";
}

const char* logSubsystemName(LogCategory c) {
    return c == LogCategory::Daemon ? "com.tarrow.vesseld" : "com.tarrow.vessel";
}

bool osLogEnabled(OSLogLevel level) {
    if (level == OSLogLevel::Debug && !isDebugLogging()) return false;
    if (gHasSink.load(std::memory_order_acquire)) return true;
    return osLogMode() != OSLogMode::Off && logVerbosity() >= verbosityForOSLogLevel(level);
}

// Signposts trace every request: they are written from Info on.
bool signpostsEnabled() { return osLogEnabled(OSLogLevel::Info); }

void osLogLine(LogCategory category, OSLogLevel level, const std::string& message) {
    if (!osLogEnabled(level)) return;
    OSLogRecord record{category, level, message};
    emitRecord(record);
}

void setOSLogSink(std::function<void(const OSLogRecord&)> sink) {
    std::lock_guard lock(gSinkMutex);
    bool has = static_cast<bool>(sink);
    sinkSlot() = std::move(sink);
    gHasSink.store(has, std::memory_order_release);
}

// ---- signposts ----

SignpostInterval::SignpostInterval(LogCategory category, const char* name, std::string attributes)
    : category_(category), name_(name ? name : ""), id_(gNextSignpostId.fetch_add(1, std::memory_order_relaxed)) {
    if (!signpostsEnabled()) return;
    OSLogRecord record{category_, OSLogLevel::Default, std::move(attributes)};
    record.signpostEvent = "begin";
    record.signpostName = name_;
    record.signpostId = id_;
    emitRecord(record);
}

SignpostInterval::~SignpostInterval() { endWith(std::string()); }

void SignpostInterval::endWith(std::string attributes) {
    if (ended_) return;
    ended_ = true;
    if (!signpostsEnabled()) return;
    OSLogRecord record{category_, OSLogLevel::Default, std::move(attributes)};
    record.signpostEvent = "end";
    record.signpostName = name_;
    record.signpostId = id_;
    emitRecord(record);
}

}  // namespace vsl
