// End to end: a real vesseld on a scratch root, driven by client programs whose
// identities come from the policy store.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "Client/VSLConnection.h"
#include "Platform/IpcWire.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";

size_t replyKeyCount(const DaemonProcess::CtlResult& r) {
    return r.reply.dictionaryValue() ? r.reply.dictionaryValue()->size() : 0;
}

class Dispatch : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        daemon = new DaemonProcess();
        allowed = daemon->addClient("allowed", "com.example.allowed", dict({{kAllowed, Value::boolean(true)}}));
        nothing = daemon->addClient("nothing", "com.example.nothing", Value::dictionary({}));
        tester = daemon->addClient("tester", "com.example.tester",
                                   dict({{kAllowed, Value::boolean(true)},
                                         {"com.tarrow.private.Vesselry.testability", Value::boolean(true)}}));
        lookupOnly = daemon->addClient(
            "lookuponly", "com.example.lookup",
            dict({{"com.tarrow.private.Vesselry.lookup", dict({{"appData", Value::array({Value::string("a")})}})}}));
        ASSERT_TRUE(daemon->start()) << test::readFile(daemon->at("vesseld.stderr"));
    }
    static void TearDownTestSuite() {
        if (daemon) {
            EXPECT_EQ(0, daemon->stop()) << "SIGTERM stops the daemon cleanly";
        }
        delete daemon;
        daemon = nullptr;
    }
    static DaemonProcess* daemon;
    static std::string allowed, nothing, tester, lookupOnly;
};

DaemonProcess* Dispatch::daemon = nullptr;
std::string Dispatch::allowed, Dispatch::nothing, Dispatch::tester, Dispatch::lookupOnly;

}  // namespace

TEST_F(Dispatch, InvalidAndRetiredCommandNumbers) {
    for (const char* number : {"33", "18446744073709551615", "27"}) {
        auto r = daemon->run(allowed, {number});
        EXPECT_EQ(49u, r.code()) << number << " " << r.err;
        EXPECT_EQ(1u, replyKeyCount(r)) << "only ReplyError: " << number;
        EXPECT_EQ(1, r.exitCode);
    }
}

TEST_F(Dispatch, EntitlementsDecideRights) {
    auto ok = daemon->run(allowed, {"personaUniqueStrings"});
    EXPECT_EQ(1u, ok.code()) << ok.err;
    EXPECT_TRUE(ok.reply.find("ReplyPersonaUniqueStringsArray")) << "the handler ran";
    EXPECT_EQ(0, ok.exitCode);

    // A client without entitlements: refused where the command needs them.
    EXPECT_EQ(55u, daemon->run(nothing, {"deleteContainer", "Identifier=x"}).code());
    EXPECT_EQ(55u, daemon->run(nothing, {"containersWithClass", "ContainerClass=2"}).code());
    // ...but command 32 admits unentitled clients, restricted to their own.
    EXPECT_EQ(1u, daemon->run(nothing, {"personaUniqueStrings"}).code());

    // The general entitlement does not stand in for the testability one.
    EXPECT_EQ(55u, daemon->run(allowed, {"retryTest", "NumRetryCrashes=0"}).code());
    EXPECT_EQ(55u, daemon->run(allowed, {"setTestLock", "TestLock=0", "Enable=false"}).code());
    EXPECT_NE(55u, daemon->run(tester, {"setTestLock", "TestLock=0", "Enable=false"}).code());

    // A lookup dictionary alone admits the lookup commands 1, 14 and 23 (and not 10).
    for (const char* command : {"containersWithClass", "groupContainerIdentifiers", "diskUsage"}) {
        EXPECT_NE(55u, daemon->run(lookupOnly, {command, "ContainerClass=2", "Identifier=a"}).code())
            << command;
        EXPECT_EQ(55u, daemon->run(nothing, {command, "ContainerClass=2", "Identifier=a"}).code()) << command;
    }
    EXPECT_EQ(55u, daemon->run(lookupOnly, {"deleteContainer", "Identifier=a"}).code());
}

TEST_F(Dispatch, MissingOrMistypedCommandIsCommandZero) {
    // Command 0 admits unentitled clients; command 1 does not. A request without a
    // usable "Command" must therefore pass the rights check for this client.
    auto explicitOne = daemon->run(nothing, {"1"});
    EXPECT_EQ(55u, explicitOne.code());

    std::string error;
    auto c = client::VSLConnection::connect(daemon->socketPath(), &error);
    ASSERT_TRUE(c) << error;
    // The test binary itself has no policy record: it is unentitled like "nothing".
    auto missing = c->sendRequest(dict({{"Identifier", Value::string("x")}}), std::chrono::seconds(10));
    ASSERT_TRUE(missing.ok()) << missing.error;
    auto mistyped = c->sendRequest(dict({{"Command", Value::string("1")}}), std::chrono::seconds(10));
    ASSERT_TRUE(mistyped.ok());
    auto one = c->sendRequest(dict({{"Command", Value::uint64(1)}}), std::chrono::seconds(10));
    ASSERT_TRUE(one.ok());
    EXPECT_EQ(55u, one.body.find("ReplyError")->uint64Value());
    EXPECT_NE(55u, missing.body.find("ReplyError")->uint64Value());
    EXPECT_EQ(missing.body, mistyped.body) << "a non-uint64 Command reads as absent";
}

TEST_F(Dispatch, MalformedFramesCloseOnlyThatConnection) {
    std::string error;
    auto good = client::VSLConnection::connect(daemon->socketPath(), &error);
    ASSERT_TRUE(good) << error;

    auto garbage = [&](const std::string& bytes) {
        int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, daemon->socketPath().c_str(), sizeof addr.sun_path - 1);
        EXPECT_EQ(0, ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr));
        EXPECT_EQ(static_cast<ssize_t>(bytes.size()), ::write(fd, bytes.data(), bytes.size()));
        // The daemon closes the connection: read sees EOF (or a reset), never a reply.
        char buf[64];
        timeval tv{10, 0};
        ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
        EXPECT_LE(::read(fd, buf, sizeof buf), 0);
        ::close(fd);
    };
    std::string frame = *encodeFrame(7, 0, dict({{"Command", Value::uint64(27)}}));
    std::string badMagic = frame;
    badMagic[4] = 'X';
    std::string trailing = frame + "x";
    trailing[0] = static_cast<char>(trailing[0] + 1);
    std::string huge = "\xff\xff\xff\x7f" + frame.substr(4);
    garbage(badMagic);
    garbage(trailing);
    garbage(huge);
    garbage(std::string("\x05\x00\x00\x00VSLMx", 9));

    auto r = good->sendRequest(dict({{"Command", Value::uint64(27)}}), std::chrono::seconds(10));
    ASSERT_TRUE(r.ok()) << r.error;
    // The test binary has no policy record: refused, but answered.
    EXPECT_EQ(55u, r.body.find("ReplyError")->uint64Value());
}

TEST(DispatchQueue, WorkQueuedByEntitlementRegistrationRunsEvenWhenTheCommandFails) {
    DaemonProcess daemon;
    // One signing identifier, two builds: the second no longer claims a system container.
    std::string before = daemon.addClient(
        "before", "com.example.sys",
        dict({{kAllowed, Value::boolean(true)}, {"com.tarrow.security.system-container", Value::boolean(true)}}));
    std::string after = daemon.addClient("after", "com.example.sys", dict({{kAllowed, Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << test::readFile(daemon.at("vesseld.stderr"));
    auto made = daemon.run(before, {"createOrLookup", "ContainerClass=12", "CreateIfNecessary=true"});
    ASSERT_EQ(1u, made.code()) << made.err;
    const Value* path = made.reply.find("ReplyPath");
    ASSERT_TRUE(path && path->stringValue());
    ASSERT_EQ(0, ::access(path->stringValue()->c_str(), F_OK));

    // Registering the new entitlements queues the system container's deletion; the
    // command itself (which fails: it names no container) must not drop it.
    auto r = daemon.run(after, {"regenerateDirectoryUUID", "ContainerClass=2"});
    EXPECT_EQ(18u, r.code()) << r.err;
    EXPECT_EQ(21u, daemon.run(before, {"createOrLookup", "ContainerClass=12"}).code());
    EXPECT_NE(0, ::access(path->stringValue()->c_str(), F_OK)) << "moved to death row";
    EXPECT_EQ(0, daemon.stop());
}
