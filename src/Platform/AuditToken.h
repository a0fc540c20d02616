// The audit token of a peer process: eight 32-bit words that name one process for
// its whole life. Word 7 (the pid generation) is the process start time, so a
// recycled pid yields a different token. Tokens compare byte for byte.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>

namespace vsl {

struct AuditToken {
    // auid (= euid), euid, egid, ruid, rgid, pid, session id (0), pid generation.
    std::array<uint32_t, 8> words{};

    // The token of a live process, with the effective ids the kernel vouched for
    // (SO_PEERCRED); the real ids and start time come from /proc. None when the
    // process is gone.
    static std::optional<AuditToken> forProcess(pid_t pid, uid_t euid, gid_t egid);
    static AuditToken make(pid_t pid, uid_t euid, gid_t egid, uid_t ruid, gid_t rgid,
                           uint32_t pidGeneration);

    uid_t auid() const { return words[0]; }
    uid_t uid() const { return words[1]; }  // effective
    gid_t gid() const { return words[2]; }  // effective
    uid_t ruid() const { return words[3]; }
    gid_t rgid() const { return words[4]; }
    pid_t pid() const { return static_cast<pid_t>(words[5]); }
    uint32_t pidGeneration() const { return words[7]; }
    bool isZero() const;

    // True while the process named by the token still runs under that pid.
    bool processIsAlive() const;

    bool operator==(const AuditToken& other) const;  // byte-wise
    std::string description() const;
};

// Field 22 of /proc/<pid>/stat (clock ticks since boot); none when unreadable.
std::optional<uint64_t> processStartTime(pid_t pid);

// Real path of the executable of the process behind the token, read from
// /proc/<pid>/exe and checked against the token's start time afterwards, so a
// recycled pid never lends its new owner's executable. None (with a reason) when
// the process is gone, its pid was reused, or its image was deleted or replaced.
std::optional<std::string> processExecutablePath(const AuditToken& token,
                                                 std::string* error = nullptr);

}  // namespace vsl
