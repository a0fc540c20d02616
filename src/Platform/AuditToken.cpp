#include "Platform/AuditToken.h"

#include <fcntl.h>
#include <limits.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

namespace vsl {

namespace {

// Whole small /proc file in one read; none when it cannot be opened.
std::optional<std::string> readProcFile(pid_t pid, const char* name) {
    char path[64];
    std::snprintf(path, sizeof path, "/proc/%d/%s", static_cast<int>(pid), name);
    const int fd = ::open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    std::string out;
    char buf[4096];
    for (;;) {
        const ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        out.append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return out;
}

// Second field of a "Uid:" or "Gid:" line of /proc/<pid>/status is the effective
// id, the first the real one.
std::optional<uint32_t> realIdFromStatus(const std::string& status, std::string_view label) {
    const size_t at = status.find(label);
    if (at == std::string::npos) return std::nullopt;
    char* end = nullptr;
    const unsigned long v = std::strtoul(status.c_str() + at + label.size(), &end, 10);
    if (end == status.c_str() + at + label.size()) return std::nullopt;
    return static_cast<uint32_t>(v);
}

}  // namespace

std::optional<uint64_t> processStartTime(pid_t pid) {
    if (pid <= 0) return std::nullopt;
    auto stat = readProcFile(pid, "stat");
    if (!stat) return std::nullopt;
    // The command name may hold spaces and parentheses: fields resume after the last ')'.
    const size_t close = stat->rfind(')');
    if (close == std::string::npos) return std::nullopt;
    const char* p = stat->c_str() + close + 1;
    // Field 3 (state) follows; the start time is field 22.
    for (int field = 3; field < 22; ++field) {
        while (*p == ' ') ++p;
        while (*p && *p != ' ') ++p;
        if (!*p) return std::nullopt;
    }
    char* end = nullptr;
    const unsigned long long v = std::strtoull(p, &end, 10);
    if (end == p) return std::nullopt;
    return v;
}

AuditToken AuditToken::make(pid_t pid, uid_t euid, gid_t egid, uid_t ruid, gid_t rgid,
                            uint32_t pidGeneration) {
    AuditToken t;
    t.words = {euid, euid, egid, ruid, rgid, static_cast<uint32_t>(pid), 0, pidGeneration};
    return t;
}

std::optional<AuditToken> AuditToken::forProcess(pid_t pid, uid_t euid, gid_t egid) {
    auto start = processStartTime(pid);
    if (!start) return std::nullopt;
    uid_t ruid = euid;
    gid_t rgid = egid;
    if (auto status = readProcFile(pid, "status")) {
        ruid = realIdFromStatus(*status, "\nUid:").value_or(euid);
        rgid = realIdFromStatus(*status, "\nGid:").value_or(egid);
    }
    // The start time must still be the same process after reading its status.
    if (processStartTime(pid) != start) return std::nullopt;
    return make(pid, euid, egid, ruid, rgid, static_cast<uint32_t>(*start));
}

bool AuditToken::isZero() const {
    for (uint32_t w : words)
        if (w) return false;
    return true;
}

bool AuditToken::processIsAlive() const {
    auto start = processStartTime(pid());
    return start && static_cast<uint32_t>(*start) == pidGeneration();
}

bool AuditToken::operator==(const AuditToken& other) const {
    return std::memcmp(words.data(), other.words.data(), sizeof words) == 0;
}

std::string AuditToken::description() const {
    char buf[160];
    std::snprintf(buf, sizeof buf, "<audit token: pid %d, uid %u, gid %u, ruid %u, rgid %u, generation %u>",
                  static_cast<int>(pid()), uid(), gid(), ruid(), rgid(), pidGeneration());
    return buf;
}

std::optional<std::string> processExecutablePath(const AuditToken& token, std::string* error) {
    auto fail = [&](std::string why) -> std::optional<std::string> {
        if (error) *error = std::move(why);
        return std::nullopt;
    };
    if (token.pid() <= 0) return fail("no process");
    char link[64];
    std::snprintf(link, sizeof link, "/proc/%d/exe", static_cast<int>(token.pid()));
    char target[PATH_MAX];
    const ssize_t n = ::readlink(link, target, sizeof target - 1);
    if (n < 0) return fail(std::string("cannot read ") + link + ": " + std::strerror(errno));
    std::string path(target, static_cast<size_t>(n));
    // Verified only now: had the pid been reused, the start time would differ.
    if (!token.processIsAlive()) return fail("process " + std::to_string(token.pid()) + " is gone");
    constexpr std::string_view kDeleted = " (deleted)";
    if (path.size() > kDeleted.size() && path.ends_with(kDeleted)) {
        return fail("executable " + path + " was replaced since the process started");
    }
    return path;
}

}  // namespace vsl
