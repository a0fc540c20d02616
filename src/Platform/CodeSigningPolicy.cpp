#include "Platform/CodeSigningPolicy.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <unordered_map>

#include "Platform/IpcPeer.h"
#include "Platform/FileWatcher.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

constexpr off_t kMaxPolicyFile = 1 << 20;

void logSkip(const std::string& what, const std::string& why) {
    osLog(LogCategory::CodeSignMapping, OSLogLevel::Error, "code-signing policy: skipping %s: %s",
          what, why);
}

// Only root or the daemon's own user may speak for the store, and nobody else may
// have been able to change what they wrote.
bool isTrustworthy(const struct stat& st) {
    return (st.st_uid == 0 || st.st_uid == ::geteuid()) && (st.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

std::optional<std::string> readPolicyFile(int dirFd, const std::string& name, std::string* why) {
    const int fd = ::openat(dirFd, name.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    if (fd < 0) {
        *why = std::strerror(errno);
        return std::nullopt;
    }
    struct stat st;
    std::optional<std::string> out;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        *why = "not a regular file";
    } else if (!isTrustworthy(st)) {
        *why = "owned by another user or writable by group or others";
    } else if (st.st_size > kMaxPolicyFile) {
        *why = "too large";
    } else {
        std::string bytes(static_cast<size_t>(st.st_size), '\0');
        size_t done = 0;
        while (done < bytes.size()) {
            const ssize_t n = ::read(fd, bytes.data() + done, bytes.size() - done);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) break;
            done += static_cast<size_t>(n);
        }
        bytes.resize(done);
        out = std::move(bytes);
    }
    ::close(fd);
    return out;
}

std::optional<CodeSigningRecord> parseRecord(const Value& v, const std::string& file, std::string* why) {
    const Dictionary* d = v.dictionaryValue();
    if (!d) {
        *why = "record is not a dictionary";
        return std::nullopt;
    }
    CodeSigningRecord r;
    r.sourceFile = file;
    const Value* exe = v.find("Executable");
    if (!exe || !exe->stringValue() || !exe->stringValue()->starts_with('/')) {
        *why = "\"Executable\" is not an absolute path";
        return std::nullopt;
    }
    char real[PATH_MAX];
    r.executable = ::realpath(exe->stringValue()->c_str(), real) ? real : *exe->stringValue();
    const Value* ident = v.find("SigningIdentifier");
    if (!ident || !ident->stringValue() || ident->stringValue()->empty()) {
        *why = "\"SigningIdentifier\" is missing or not a string";
        return std::nullopt;
    }
    r.signingIdentifier = *ident->stringValue();
    if (const Value* ents = v.find("Entitlements")) {
        if (!ents->dictionaryValue()) {
            *why = "\"Entitlements\" is not a dictionary";
            return std::nullopt;
        }
        r.entitlements = *ents->dictionaryValue();
    }
    if (const Value* sandboxed = v.find("Sandboxed")) {
        if (sandboxed->type() != Value::Type::Bool) {
            *why = "\"Sandboxed\" is not a boolean";
            return std::nullopt;
        }
        r.sandboxed = *sandboxed->boolValue();
    }
    return r;
}

CodeSigningInfo infoFromRecord(const CodeSigningRecord& r) {
    CodeSigningInfo info;
    info.signingIdentifier = r.signingIdentifier;
    info.entitlements = r.entitlements;
    info.sandboxed = r.sandboxed;
    info.executable = r.executable;
    return info;
}

}  // namespace

std::vector<CodeSigningRecord> parsePolicyFile(const std::string& bytes, const std::string& file) {
    std::string why;
    auto root = decodePropertyList(bytes.data(), bytes.size(), &why);
    if (!root) {
        logSkip(file, why);
        return {};
    }
    std::vector<Value> items;
    if (const Array* a = root->arrayValue()) {
        items = *a;
    } else {
        items.push_back(*root);
    }
    std::vector<CodeSigningRecord> records;
    for (const Value& item : items) {
        auto record = parseRecord(item, file, &why);
        if (!record) {
            logSkip(file, why);
            continue;
        }
        records.push_back(std::move(*record));
    }
    return records;
}

struct CodeSigningPolicy::State {
    bool loaded = false;
    uint64_t watchToken = 0;
    std::atomic<bool> changed{true};  // set by the watcher thread
    std::unordered_map<std::string, CodeSigningRecord> byExecutable;
    std::vector<std::string> order;  // executables in file order, for listings
};

CodeSigningPolicy::CodeSigningPolicy(std::string directory)
    : directory_(std::move(directory)), state_(std::make_unique<State>()) {}

CodeSigningPolicy::~CodeSigningPolicy() {
    if (state_->watchToken) FileWatcher::shared().unwatch(state_->watchToken);
}

std::string CodeSigningPolicy::defaultDirectory() { return rootedPath("etc/vesseld/code-signatures"); }

CodeSigningPolicy& CodeSigningPolicy::shared() {
    // Never destroyed: lookups may still run on worker threads during exit.
    static CodeSigningPolicy* policy = new CodeSigningPolicy(defaultDirectory());
    return *policy;
}

void CodeSigningPolicy::watchLocked() {
    State& s = *state_;
    if (s.watchToken) return;
    s.watchToken = FileWatcher::shared().watch(directory_, "", [changed = &s.changed] { changed->store(true); });
    if (s.watchToken) s.changed = true;  // whatever happened before the watch
}

void CodeSigningPolicy::refreshLocked() {
    State& s = *state_;
    watchLocked();
    if (!s.watchToken) {
        // Not even the parent exists yet: look for the directory on each lookup, a stat only.
        struct stat st;
        if (!s.loaded || ::stat(directory_.c_str(), &st) == 0 || !s.byExecutable.empty()) loadLocked();
        return;
    }
    // A policy written just before this lookup counts for it.
    FileWatcher::shared().sync();
    if (s.changed.exchange(false)) loadLocked();
}

void CodeSigningPolicy::loadLocked() {
    State& s = *state_;
    s.loaded = true;
    s.byExecutable.clear();
    s.order.clear();
    const int dirFd = ::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd < 0) return;  // no store: nobody is known
    struct stat st;
    if (::fstat(dirFd, &st) != 0 || !isTrustworthy(st)) {
        logSkip(directory_, "owned by another user or writable by group or others");
        ::close(dirFd);
        return;
    }
    std::vector<std::string> names;
    if (DIR* dir = ::fdopendir(::dup(dirFd))) {
        while (const dirent* e = ::readdir(dir)) {
            const std::string name = e->d_name;
            if (name.size() > 6 && name.ends_with(".plist") && name[0] != '.') names.push_back(name);
        }
        ::closedir(dir);
    }
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) {
        const std::string file = joinPath(directory_, name);
        std::string why;
        auto bytes = readPolicyFile(dirFd, name, &why);
        if (!bytes) {
            logSkip(file, why);
            continue;
        }
        for (CodeSigningRecord& record : parsePolicyFile(*bytes, file)) {
            if (s.byExecutable.count(record.executable)) {
                logSkip(file, "a record for " + record.executable + " came first");
                continue;
            }
            s.order.push_back(record.executable);
            s.byExecutable.emplace(record.executable, std::move(record));
        }
    }
    ::close(dirFd);
    osLog(LogCategory::CodeSignMapping, OSLogLevel::Info, "code-signing policy: %llu records from %s",
          static_cast<unsigned long long>(s.byExecutable.size()), directory_);
}

void CodeSigningPolicy::reload() {
    std::lock_guard lock(mutex_);
    loadLocked();
}

std::optional<CodeSigningRecord> CodeSigningPolicy::recordForExecutable(const std::string& realPath) {
    std::lock_guard lock(mutex_);
    refreshLocked();
    auto it = state_->byExecutable.find(realPath);
    if (it == state_->byExecutable.end()) return std::nullopt;
    return it->second;
}

std::vector<CodeSigningRecord> CodeSigningPolicy::records() {
    std::lock_guard lock(mutex_);
    refreshLocked();
    std::vector<CodeSigningRecord> out;
    for (const std::string& exe : state_->order) out.push_back(state_->byExecutable.at(exe));
    return out;
}

std::vector<CodeSigningRecord> CodeSigningPolicy::recordsWithSigningIdentifier(const std::string& identifier) {
    std::vector<CodeSigningRecord> out = records();
    std::erase_if(out, [&](const CodeSigningRecord& r) { return r.signingIdentifier != identifier; });
    return out;
}

CodeSigningInfo CodeSigningPolicy::infoForExecutable(const std::string& realPath) {
    if (auto record = recordForExecutable(realPath)) return infoFromRecord(*record);
    CodeSigningInfo info;
    info.executable = realPath;
    info.error = "no code-signing record for " + realPath;
    return info;
}

CodeSigningInfo CodeSigningPolicy::infoForAuditToken(const AuditToken& token) {
    std::string why;
    auto exe = processExecutablePath(token, &why);
    if (!exe) {
        CodeSigningInfo info;
        info.error = why;
        return info;
    }
    return infoForExecutable(*exe);
}

CodeSigningInfo CodeSigningPolicy::infoForPeer(const IpcPeer& peer) {
    if (peer.executablePath().empty()) {
        CodeSigningInfo info;
        info.error = "executable of pid " + std::to_string(peer.pid()) + " is unknown";
        return info;
    }
    return infoForExecutable(peer.executablePath());
}

}  // namespace vsl
