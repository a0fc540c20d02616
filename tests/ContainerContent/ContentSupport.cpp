#include "ContainerContent/ContentSupport.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <thread>

#include "Platform/PropertyList.h"
#include "Support/TempRoot.h"

namespace vsl::test {

const char* const kAllowedEntitlement = "com.tarrow.private.Vesselry.allowed";
const char* const kTestabilityEntitlement = "com.tarrow.private.Vesselry.testability";

void writeDeviceFacts(const DaemonProcess& daemon, const Value& facts) {
    writeRootFile(daemon, "etc/vesseld/device.plist", *encodeBinaryPropertyList(facts, nullptr));
}

void registerSelf(const DaemonProcess& daemon) {
    char exe[PATH_MAX];
    ASSERT_TRUE(::realpath("/proc/self/exe", exe));
    auto bytes = encodeBinaryPropertyList(
        dict({{"Executable", Value::string(exe)},
              {"SigningIdentifier", Value::string("com.example.tester")},
              {"Entitlements",
               dict({{kAllowedEntitlement, Value::boolean(true)}, {kTestabilityEntitlement, Value::boolean(true)}})},
              {"Sandboxed", Value::boolean(false)}}),
        nullptr);
    ASSERT_TRUE(bytes);
    writeRootFile(daemon, "etc/vesseld/code-signatures/tester.plist", *bytes);
}

std::shared_ptr<client::VSLConnection> connectTo(const DaemonProcess& daemon) {
    std::string error;
    auto c = client::VSLConnection::connect(daemon.socketPath(), &error);
    EXPECT_TRUE(c) << error;
    return c;
}

uint64_t send(client::VSLConnection& connection, Dictionary request, Value* reply) {
    auto r = connection.sendRequest(Value::dictionary(std::move(request)), std::chrono::seconds(60));
    if (reply) *reply = r.body;
    return client::replyCode(r);
}

Created createContainer(client::VSLConnection& connection, const std::string& identifier, uint64_t containerClass) {
    Value reply;
    uint64_t code = send(connection,
                         {{"Command", Value::uint64(0)},
                          {"Identifier", Value::string(identifier)},
                          {"ContainerClass", Value::uint64(containerClass)},
                          {"CreateIfNecessary", Value::boolean(true)}},
                         &reply);
    EXPECT_EQ(1u, code) << identifier;
    Created c;
    c.ref.identifier = identifier;
    c.ref.containerClass = containerClass;
    if (const Value* u = reply.find("ReplyUUID"); u && u->uuidValue()) c.ref.uuid = *u->uuidValue();
    if (const Value* p = reply.find("ReplyPath"); p && p->stringValue()) c.path = *p->stringValue();
    return c;
}

std::string logText(const DaemonProcess& daemon) {
    return readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
}

bool waitForLog(const DaemonProcess& daemon, const std::string& text, size_t count) {
    for (int i = 0; i < 2000; i++) {
        std::string log = logText(daemon);
        size_t found = 0;
        for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) found++;
        if (found >= count) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

}  // namespace vsl::test
