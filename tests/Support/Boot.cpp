#include "Support/Boot.h"

#include <filesystem>

#include "Client/VSLNotification.h"
#include "Daemon/Service/VSLStartup.h"
#include "Platform/NamedSemaphore.h"

namespace vsl::test {

bool waitForNotification(const DaemonProcess& daemon, const std::string& name, std::chrono::seconds timeout) {
    return client::waitForNotification(daemon.root(), name, timeout);
}

std::string firstBootMarkerName(const DaemonProcess& daemon) {
    return semaphoreNameForSystemRoot(kFirstBootSemaphoreBase, daemon.root());
}

void simulateReboot(const DaemonProcess& daemon) {
    namespace fs = std::filesystem;
    removeSemaphore(firstBootMarkerName(daemon));
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(daemon.at("run/vesseld"), ec))
        if (entry.path().filename() != "keybag") fs::remove_all(entry.path(), ec);
}

}  // namespace vsl::test
