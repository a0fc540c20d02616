// End to end on an internal-build root: test locks hold what they name and nothing
// else; the retry test ends the daemon the requested number of times.
#include <gtest/gtest.h>
#include <unistd.h>

#include <future>

#include "ContainerContent/ContentSupport.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using namespace vsl::client;

namespace {

void startInternal(DaemonProcess& daemon, bool internal = true) {
    writeDeviceFacts(daemon, dict({{"InternalBuild", Value::boolean(internal)}}));
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
}

std::future<uint64_t> sendAsync(const DaemonProcess& daemon, Dictionary request) {
    auto c = connectTo(daemon);
    return std::async(std::launch::async, [c, request]() mutable { return c ? send(*c, std::move(request)) : 0; });
}

Dictionary createRequest(const std::string& identifier) {
    return {{"Command", Value::uint64(0)},
            {"Identifier", Value::string(identifier)},
            {"ContainerClass", Value::uint64(2)},
            {"CreateIfNecessary", Value::boolean(true)}};
}

}  // namespace

TEST(TestLocksEndToEnd, HeldLocksHoldWhatTheyNameAndReleasingAllWorks) {
    DaemonProcess daemon;
    std::string general = daemon.addClient("general", "com.example.general",
                                           dict({{kAllowedEntitlement, Value::boolean(true)}}));
    startInternal(daemon);
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created bundle = createContainer(*c, "com.example.bundle", 1);
    Created data = createContainer(*c, "com.example.data", 2);

    // The general entitlement alone is not enough for either control.
    EXPECT_EQ(55u, daemon.run(general, {"test-lock", "1", "on"}).code());
    EXPECT_EQ(55u, daemon.run(general, {"retry-test", "0"}).code());
    EXPECT_EQ(38u, replyCode(setTestLock(*c, 8, true)));
    EXPECT_EQ(38u, replyCode(setTestLock(*c, 7, true)));

    // Lock 1 (the global write lock): a create waits until the release.
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 1, true)));
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 1, true)));  // held once
    auto created = sendAsync(daemon, createRequest("com.example.waiting"));
    EXPECT_EQ(std::future_status::timeout, created.wait_for(std::chrono::milliseconds(300)));
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 1, false)));
    EXPECT_EQ(1u, created.get());
    EXPECT_NE(std::string::npos, logText(daemon).find("Acquired test lock: 1; count: 1"));
    EXPECT_EQ(std::string::npos, logText(daemon).find("Acquired test lock: 1; count: 2"));
    EXPECT_TRUE(waitForLog(daemon, "Disabled test locks feature."));

    // Gate 2 holds disk usage and nothing else.
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 2, true)));
    ASSERT_TRUE(waitForLog(daemon, "Blocking waiters for lock: 2"));
    auto measured = sendAsync(daemon, identityRequest(23, data.ref));
    ASSERT_TRUE(waitForLog(daemon, "Waiting on lock: 2"));
    EXPECT_EQ(1u, replyCode(metadata(*c, data.ref, true)));
    EXPECT_EQ(1u, replyCode(setInfoValue(*c, data.ref, "k", Value::string("v"))));
    EXPECT_FALSE(createContainer(*c, "com.example.other", 2).path.empty());
    EXPECT_EQ(std::future_status::timeout, measured.wait_for(std::chrono::milliseconds(0)));
    // Lock 7 off releases everything at once.
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 7, false)));
    EXPECT_EQ(1u, measured.get());
    EXPECT_TRUE(waitForLog(daemon, "Released all test locks."));

    // A later acquisition works again.
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 2, true)));
    ASSERT_TRUE(waitForLog(daemon, "Blocking waiters for lock: 2", 2));
    auto again = sendAsync(daemon, identityRequest(23, bundle.ref));
    ASSERT_TRUE(waitForLog(daemon, "Waiting on lock: 2", 2));
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 2, false)));
    EXPECT_EQ(1u, again.get());
}

TEST(TestLocksEndToEnd, NotInternalBuildsOnlyLog) {
    DaemonProcess daemon;
    startInternal(daemon, false);
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    EXPECT_EQ(1u, replyCode(setTestLock(*c, 1, true)));
    EXPECT_EQ(1u, replyCode(retryTest(*c, 2)));
    EXPECT_TRUE(waitForLog(daemon, "Unsupported call to set lock!"));
    EXPECT_TRUE(waitForLog(daemon, "People really shouldn't be calling this on non-internal installs!"));
    // Nothing is held: a create goes through.
    EXPECT_FALSE(createContainer(*c, "com.example.free", 2).path.empty());
    EXPECT_EQ(std::string::npos, logText(daemon).find("Acquired test lock"));
}

TEST(RetryTest, TheDaemonExitsTwiceThenSucceedsAndTheRetryContainerGoes) {
    DaemonProcess daemon;
    startInternal(daemon);
    std::string counterLog = "Crashes Remaining in retry test: ";
    for (uint64_t expected : {2u, 1u}) {
        auto c = connectTo(daemon);
        ASSERT_TRUE(c);
        auto r = retryTest(*c, 2);
        EXPECT_FALSE(r.ok());  // the daemon ended while handling it
        EXPECT_EQ(0, daemon.stop());  // it ended itself with status 0
        EXPECT_NE(std::string::npos, logText(daemon).find(counterLog + std::to_string(expected)));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    }
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    EXPECT_EQ(1u, replyCode(retryTest(*c, 2)));
    EXPECT_NE(std::string::npos, logText(daemon).find(counterLog + "0"));
    EXPECT_NE(std::string::npos, logText(daemon).find("Returning Successfully"));
    auto lookup = c->sendRequest(Value::dictionary({{"Command", Value::uint64(0)},
                                                    {"Identifier", Value::string("com.tarrow.retryTest")},
                                                    {"ContainerClass", Value::uint64(2)}}));
    EXPECT_EQ(21u, replyCode(lookup));
}
