// Following a test daemon's start-up clean-ups.
#pragma once

#include <chrono>
#include <string>

#include "Client/VSLNotification.h"  // the names
#include "Support/DaemonProcess.h"

namespace vsl::test {

// True once the daemon of `daemon`'s root has posted `name` (a liveness bound, not a
// speed check: a loaded machine may take long).
bool waitForNotification(const DaemonProcess& daemon, const std::string& name,
                         std::chrono::seconds timeout = std::chrono::seconds(120));

}  // namespace vsl::test
