// What every vesselctl subcommand shares: the global options, sending one request,
// and printing a reply or a failure for people, as JSON or as a property list.
//
// Exit statuses: 0 success, 1 the daemon answered with another result (or a check
// failed), 2 usage error, 3 the daemon cannot be reached or does not answer.
// Failures under --json print {"error": CODE, "name": NAME, "message": TEXT} on
// stdout: CODE is the daemon's result code, or 0 when none came.
#pragma once

#include <optional>
#include <string>

#include "Platform/Value.h"

struct CtlOptions {
    std::string root;
    std::string socketPath;  // empty: the root's
    bool json = false;
    bool plist = false;
    long timeoutSeconds = 60;

    std::string daemonSocketPath() const;
};

enum : int { kExitSuccess = 0, kExitFailed = 1, kExitUsage = 2, kExitUnreachable = 3 };

// Prints a failure (stderr; and the JSON error object on stdout under --json) and
// returns `status`.
int printFailure(const CtlOptions& options, int status, uint64_t code, const std::string& name,
                 const std::string& message);
// A usage error: the usage line, exit status 2.
int printUsageError(const CtlOptions& options, const std::string& usage);

// Sends one request. None after printing why when no reply came (status 3 in *status).
std::optional<vsl::Value> exchange(const CtlOptions& options, const vsl::Dictionary& request, int* status);

// Prints a reply: its keys as they are, or the error object for a result other than 1.
// Returns 0 for result 1, else 1.
int printReply(const CtlOptions& options, const vsl::Value& reply);

// exchange, then printReply.
int sendAndPrint(const CtlOptions& options, const vsl::Dictionary& request);

// The JSON text of a string.
std::string jsonString(const std::string& text);
