// Shared by the end-to-end tests of one-container operations: a daemon on a scratch
// root, this test program registered as an entitled client, typed calls through
// libvessel.
#pragma once

#include <map>
#include <memory>
#include <string>

#include "Client/VSLContainerInfo.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "Support/TreeSnapshot.h"

namespace vsl::test {

extern const char* const kAllowedEntitlement;
extern const char* const kTestabilityEntitlement;

// Writes a file below the daemon's root, making its directory.
void writeDeviceFacts(const DaemonProcess& daemon, const Value& facts);
// Registers this test program with the general and the testability entitlement.
void registerSelf(const DaemonProcess& daemon);
std::shared_ptr<client::VSLConnection> connectTo(const DaemonProcess& daemon);

struct Created {
    client::VSLContainerRef ref;
    std::string path;
};
// Creates (or looks up) a container through the given connection; empty path on failure.
Created createContainer(client::VSLConnection& connection, const std::string& identifier, uint64_t containerClass);
uint64_t send(client::VSLConnection& connection, Dictionary request, Value* reply = nullptr);
std::string logText(const DaemonProcess& daemon);

// Waits (bounded) until the daemon's log holds `text` at least `count` times.
bool waitForLog(const DaemonProcess& daemon, const std::string& text, size_t count = 1);

}  // namespace vsl::test
