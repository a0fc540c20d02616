#include "Client/VSLNotification.h"

#include "Client/VSLUnixSocket.h"
#include "Platform/Notification.h"

namespace vsl::client {

bool waitForNotification(const std::string& root, const std::string& name, std::chrono::milliseconds timeout) {
    return waitForNotificationIn(pathBelowSystemRoot(root, "run/vesseld/notify"), name, timeout);
}

}  // namespace vsl::client
