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

// A reboot of a stopped daemon's root, as far as the daemon can tell: the first-boot
// marker (a named semaphore, in /dev/shm in production) is removed and run/vesseld/
// (a tmpfs in production) is emptied, except the keybag state, which is the device's.
void simulateReboot(const DaemonProcess& daemon);

// The first-boot marker's name for the daemon's root.
std::string firstBootMarkerName(const DaemonProcess& daemon);

}  // namespace vsl::test
