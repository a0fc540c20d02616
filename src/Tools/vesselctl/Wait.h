// vesselctl wait NAME [--timeout SECONDS]: returns once the daemon has posted a
// notification (exit 0), or after the timeout (exit 1).
#pragma once

#include <string>

inline constexpr const char* kWaitUsage =
    "\n"
    "wait NAME [--timeout SECONDS]: returns once vesseld has posted the notification\n"
    "  (com.tarrow.vesseld.cleanup-complete, com.tarrow.vesseld.reboot-cleanup-complete);\n"
    "  exit status 1 when it is not posted in time.\n";

// argv[0] is "wait". Returns the exit status.
int runWaitCommand(const std::string& root, long defaultTimeoutSeconds, int argc, char** argv);
