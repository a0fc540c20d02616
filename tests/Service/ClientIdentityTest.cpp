#include <gtest/gtest.h>

#include <atomic>

#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLClientIdentity.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

// Code-signing answers chosen by the test, counting how often entitlements are read.
class FakeSigning : public VSLCodeSigningService {
public:
    std::optional<std::string> identifier = std::string("com.tarrow.stowaged");
    std::optional<Value> entitlements = dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}});
    std::atomic<int> lookups{0};
    VSLCodeSigningFacts factsForPeer(const VSLPeerCredentials&) override {
        lookups++;
        VSLCodeSigningFacts f;
        f.signingIdentifier = identifier;
        f.entitlements = entitlements;
        f.error = "no record";
        return f;
    }
};

VSLPeerCredentials peer(pid_t pid, uint32_t generation) {
    VSLPeerCredentials p;
    p.pid = pid;
    p.uid = 501;
    p.gid = 501;
    p.auditToken = {501, 501, 501, 501, 501, static_cast<uint32_t>(pid), 0, generation};
    return p;
}

}  // namespace

TEST(ClientIdentity, InstallerIdentityIsReusedPerAuditToken) {
    test::TempRoot root;
    auto signing = std::make_shared<FakeSigning>();
    setCodeSigningService(signing);

    auto first = VSLClientIdentity::clientIdentityWithIPCConnection(peer(100, 7));
    ASSERT_TRUE(first);
    auto again = VSLClientIdentity::clientIdentityWithIPCConnection(peer(100, 7));
    EXPECT_EQ(first, again) << "same installer process: the cached identity";
    auto restarted = VSLClientIdentity::clientIdentityWithIPCConnection(peer(100, 8));
    ASSERT_TRUE(restarted);
    EXPECT_NE(first, restarted) << "a new audit token gets a fresh identity";

    // Other callers are never cached.
    signing->identifier = "com.example.app";
    auto a = VSLClientIdentity::clientIdentityWithIPCConnection(peer(200, 1));
    auto b = VSLClientIdentity::clientIdentityWithIPCConnection(peer(200, 1));
    ASSERT_TRUE(a && b);
    EXPECT_NE(a, b);
    EXPECT_EQ("com.example.app", a->bundleIdentifier());
    EXPECT_EQ("501", a->userIdentity()->identifier());

    // No signing identifier: no identity. Unreadable entitlements: an empty dictionary.
    signing->identifier.reset();
    EXPECT_EQ(nullptr, VSLClientIdentity::clientIdentityWithIPCConnection(peer(300, 1)));
    signing->identifier = "com.example.noents";
    signing->entitlements = Value::string("garbage");
    auto empty = VSLClientIdentity::clientIdentityWithIPCConnection(peer(301, 1));
    ASSERT_TRUE(empty);
    ASSERT_TRUE(empty->entitlements());
    EXPECT_TRUE(empty->entitlements()->dictionaryValue()->empty());
    EXPECT_NE(std::string::npos, empty->description().find("entitlements = YES>"));
    auto privileged = VSLClientIdentity::privilegedClientIdentityWithUserIdentity(empty->userIdentity(), true);
    EXPECT_NE(std::string::npos, privileged->description().find("entitlements = NO>"));
    EXPECT_TRUE(privileged->kernel());
    EXPECT_EQ("com.tarrow.vesseld.internal", privileged->bundleIdentifier());
    setCodeSigningService(nullptr);
}

TEST(ClientIdentity, BooleanEntitlementsAndLookupSets) {
    test::TempRoot root;
    auto user = VSLUserIdentity::create(501, 501, "/h", std::nullopt, 0, 501);
    auto identity = VSLClientIdentity::create(
        "com.example.app", 501, 501, 42, user,
        dict({{"yes", Value::boolean(true)},
              {"one", Value::uint64(1)},
              {"zero", Value::uint64(0)},
              {"string", Value::string("true")},
              {"com.tarrow.private.Vesselry.lookup",
               dict({{"appData", Value::array({Value::string("a"), Value::uint64(5), Value::string("b")})},
                     {"pluginData", Value::string("a")}})}}),
        false, VSLAuditToken{}, false);
    EXPECT_TRUE(identity->boolValueOfEntitlement("yes"));
    EXPECT_TRUE(identity->boolValueOfEntitlement("one"));
    EXPECT_FALSE(identity->boolValueOfEntitlement("zero"));
    EXPECT_FALSE(identity->boolValueOfEntitlement("string")) << "only numbers and booleans count";
    EXPECT_FALSE(identity->boolValueOfEntitlement("absent"));

    auto connection = VSLClientConnection::create(identity, false, false, false,
                                                  *identity->entitlement("com.tarrow.private.Vesselry.lookup"),
                                                  std::nullopt, nullptr);
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(2, "a"));
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(2, "b"));
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(2, "5")) << "non-strings are dropped";
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(4, "a")) << "a string instead of an array allows none";
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(1, "a"));
    EXPECT_FALSE(connection->lookupForContainerClass(0).has_value());
    EXPECT_FALSE(connection->lookupForContainerClass(14).has_value());

    auto noLookup = VSLClientConnection::create(identity, true, true, false, std::nullopt, std::nullopt, nullptr);
    EXPECT_FALSE(noLookup->isEntitledForLookupWithClass(2, "a")) << "no lookup dictionary, no lookup rights";
}
