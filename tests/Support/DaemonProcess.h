// A real vesseld on a scratch system root, for end-to-end tests, and client
// programs with identities of their own (copies of vesselctl registered in the
// policy store under different signing identifiers).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "Platform/Value.h"

namespace vsl::test {

std::string vesseldPath();
std::string vesselctlPath();

class DaemonProcess {
public:
    // Makes a scratch root (removed on destruction) and lays down the default
    // configuration with `vesseld --init`-like files, without starting the daemon.
    DaemonProcess();
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    const std::string& root() const { return root_; }
    std::string at(const std::string& relative) const;
    std::string socketPath() const;

    // Starts vesseld --root ROOT --init and waits until it answers, or, given `ready`,
    // until that holds (so that no request reaches the daemon). False on failure.
    bool start(const std::vector<std::string>& extraEnvironment = {}, const std::function<bool()>& ready = {});
    // Soft and hard RLIMIT_NOFILE of the daemons started from now on (0: inherited).
    void setDescriptorLimit(unsigned long limit) { descriptorLimit_ = limit; }
    // SIGTERM and wait; returns the exit status (or -1).
    int stop();
    // SIGKILL and reap.
    void kill();
    // Reaps the daemon once it has exited by itself: its exit status (128 + signal when
    // killed), or -1 when it still runs after `timeout`.
    int waitForExit(std::chrono::milliseconds timeout);
    pid_t pid() const { return pid_; }
    bool running() const { return pid_ > 0; }

    // Copies vesselctl into the root under `name` and registers it with the given
    // signing identifier and entitlements. Returns the copy's path.
    std::string addClient(const std::string& name, const std::string& signingIdentifier, const Value& entitlements,
                          bool sandboxed = false);
    // Registers an existing program (e.g. "/proc/self/exe": the test itself, to send
    // requests vesselctl cannot) under `name` with that identity.
    bool registerProgram(const std::string& program, const std::string& name, const std::string& signingIdentifier,
                         const Value& entitlements, bool sandboxed = false);

    struct CtlResult {
        int exitCode = -1;
        std::string out;
        std::string err;
        Value reply;  // parsed back from the --plist output
        // "ReplyError", or 0 when there is no readable reply.
        uint64_t code() const;
        // A string of the reply, or empty.
        std::string string(const char* key) const;
        // "ReplyUUID" (16 bytes in the output) as a string, or empty.
        std::string uuid() const;
        // "ReplyExisted", false when absent.
        bool existed() const;
    };
    // Runs a client program (a path from addClient, or vesselctlPath()) with --root.
    CtlResult run(const std::string& client, const std::vector<std::string>& args) const;

private:
    std::string root_;
    std::string marker_;  // the root's first-boot marker
    pid_t pid_ = -1;
    unsigned long descriptorLimit_ = 0;
};

// Runs a program, capturing stdout and stderr; returns the exit status.
int runProgram(const std::vector<std::string>& argv, std::string* out, std::string* err,
               const std::vector<std::string>& extraEnvironment = {});

}  // namespace vsl::test
