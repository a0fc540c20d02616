#include "Support/Boot.h"

#include "Client/VSLNotification.h"

namespace vsl::test {

bool waitForNotification(const DaemonProcess& daemon, const std::string& name, std::chrono::seconds timeout) {
    return client::waitForNotification(daemon.root(), name, timeout);
}

}  // namespace vsl::test
