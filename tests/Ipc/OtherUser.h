// Clients running as another user, for the tests of per-user limits. The suite runs
// as root; a forked child takes the uid with setuid() before it connects, and the
// server knows it from SO_PEERCRED.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "Platform/IpcWire.h"

namespace vsl::test {

constexpr uid_t kOtherUid = 501;

// Whether the process can act as another user (it runs as root).
bool canSwitchUser();

// A child process, running as `uid`, that opens `count` connections to the socket
// at `path`, sends `request` (a whole frame with message id 1) on each and keeps
// them open until this object goes away.
class HeldConnections {
public:
    HeldConnections(const std::string& path, uid_t uid, size_t count, const std::string& request);
    ~HeldConnections();  // closes them all and reaps the child
    HeldConnections(const HeldConnections&) = delete;
    HeldConnections& operator=(const HeldConnections&) = delete;

    // One per connection, in order: the first frame the server sent back (the
    // reply, or its refusal notice), or none when it sent nothing in time.
    const std::vector<std::optional<IpcFrame>>& frames() const { return frames_; }
    size_t replies() const;    // frames with message id 1
    size_t refusals() const;   // refusal notices

private:
    pid_t pid_ = -1;
    int release_ = -1;
    std::vector<std::optional<IpcFrame>> frames_;
};

// Runs argv as `uid`; returns the exit status and what it wrote to stderr.
int runProgramAs(uid_t uid, const std::vector<std::string>& argv, std::string* err);

}  // namespace vsl::test
