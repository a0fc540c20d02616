// Request decoding under the persona rules, against the process-wide identity
// cache of a device with personas. This binary owns that cache: the root with its
// persona list is set up once, before anything asks for it.
#include <gtest/gtest.h>

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLRequestDecoding.h"
#include "Platform/PropertyList.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

test::TempRoot* gRoot = nullptr;

// An empty unique string means the persona has none.
Value persona(uint64_t type, uint64_t id, const std::string& unique, std::vector<std::string> bundles,
              bool universal = false) {
    Dictionary d{{"PersonaType", Value::uint64(type)}, {"KernelPersonaID", Value::uint64(id)},
                 {"UID", Value::uint64(501)}, {"GID", Value::uint64(501)}};
    if (!unique.empty()) d["PersonaUniqueString"] = Value::string(unique);
    Array b;
    for (auto& s : bundles) b.push_back(Value::string(s));
    d["BundleIdentifiers"] = Value::array(std::move(b));
    if (type == 1) d["HomeDirectory"] = Value::string("/private/var/PersonaVolumes/" + unique);
    if (universal) d["Universal"] = Value::boolean(true);
    return Value::dictionary(std::move(d));
}

class PersonaDevice : public ::testing::Environment {
public:
    void SetUp() override {
        gRoot = new test::TempRoot();
        auto list = encodeBinaryPropertyList(
            Value::array({persona(0, 1000, "P", {}), persona(1, 1001, "E1", {"com.example.mail", "com.example.both"}),
                          persona(1, 1002, "E2", {"com.example.both"}),
                          persona(2, 900, "", {"com.example.phone"}, true)}),
            nullptr);
        gRoot->writeFile("etc/vesseld/personas.plist", *list);
        gRoot->writeDeviceFacts(dict({{"PersonasSupported", Value::boolean(true)}}));
    }
    void TearDown() override { delete gRoot; }
};

const auto* const kEnvironment = ::testing::AddGlobalTestEnvironment(new PersonaDevice);

std::shared_ptr<VSLUserIdentitySharedCache> cache() { return VSLUserIdentitySharedCache::sharedInstance(); }

VSLClientConnectionRef clientAs(const VSLUserIdentityRef& user, const std::string& bundle = "com.example.client") {
    auto identity = VSLClientIdentity::create(bundle, 501, 501, 1, user, Value::dictionary({}), false,
                                              VSLAuditToken{}, false);
    return VSLClientConnection::create(identity, true, true, false, std::nullopt, std::nullopt, nullptr);
}

VSLUserIdentityRef e1() { return cache()->userIdentityForCurrentUserWithPersonaUniqueString(std::string("E1")); }
VSLUserIdentityRef e2() { return cache()->userIdentityForCurrentUserWithPersonaUniqueString(std::string("E2")); }

}  // namespace

TEST(PersonaRules, ExplicitPersonaString) {
    ASSERT_TRUE(e1() && e2());
    auto unspecific = clientAs(cache()->unspecificUserIdentity());
    auto boundToE1 = clientAs(e1());
    uint64_t code = 1;

    EXPECT_TRUE(sameUserIdentity(e1(), userIdentityForPersonaUniqueString(std::string("E1"), *boundToE1, &code)))
        << "a persona-bound client may name its own persona";
    EXPECT_EQ(1u, code);
    EXPECT_EQ(nullptr, userIdentityForPersonaUniqueString(std::string("E2"), *boundToE1, &code))
        << "but not a sibling";
    EXPECT_EQ(kVSLErrorWrongPersona, code);

    code = 1;
    EXPECT_TRUE(sameUserIdentity(e2(), userIdentityForPersonaUniqueString(std::string("E2"), *unspecific, &code)))
        << "a client outside personas may name any persona";
    EXPECT_EQ(nullptr, userIdentityForPersonaUniqueString(std::string("nope"), *unspecific, &code));
    EXPECT_EQ(kVSLErrorWrongPersona, code);

    // On a multi-user device the string has no effect at all.
    gRoot->writeDeviceFacts(dict({{"PersonasSupported", Value::boolean(true)}, {"MultiUser", Value::boolean(true)}}));
    code = 1;
    EXPECT_TRUE(sameUserIdentity(e1(), userIdentityForPersonaUniqueString(std::string("E2"), *boundToE1, &code)));
    EXPECT_EQ(1u, code);
    gRoot->writeDeviceFacts(dict({{"PersonasSupported", Value::boolean(true)}}));
}

TEST(PersonaRules, InferredFromWhereTheIdentifierIsInstalled) {
    auto unspecificUser = cache()->unspecificUserIdentity();
    auto unspecific = clientAs(unspecificUser);
    uint64_t code = 1;

    EXPECT_TRUE(sameUserIdentity(e1(), userIdentityForContainerIdentifier(*unspecific, "com.example.mail", 2, &code)))
        << "installed in one persona: that persona";
    EXPECT_TRUE(sameUserIdentity(unspecificUser,
                                 userIdentityForContainerIdentifier(*unspecific, "com.example.both", 2, &code)))
        << "ambiguous: the client's own identity";
    EXPECT_TRUE(sameUserIdentity(cache()->userIdentityForPersonalPersona(),
                                 userIdentityForContainerIdentifier(*unspecific, "com.example.unlisted", 2, &code)))
        << "listed nowhere: the personal persona only";
    EXPECT_TRUE(sameUserIdentity(unspecificUser,
                                 userIdentityForContainerIdentifier(*unspecific, "com.example.mail", 1, &code)))
        << "bundle classes are not per-user";
    auto bound = clientAs(e2());
    EXPECT_TRUE(sameUserIdentity(e2(), userIdentityForContainerIdentifier(*bound, "com.example.mail", 2, &code)))
        << "a persona-bound client keeps its persona";
    EXPECT_EQ(1u, code);
}

TEST(PersonaRules, IdentitiesFromRequests) {
    auto boundToE1 = clientAs(e1(), "com.example.mail");
    uint64_t code = 1;

    // A persona-bound client that names no persona resolves to the unspecific
    // identity, which is not its own.
    EXPECT_EQ(nullptr, concreteIdentityFromRequest(
                           dict({{"ContainerClass", Value::uint64(2)}, {"UUID", Value::uuid(Uuid::random())}}),
                           nullptr, nullptr, nullptr, nullptr, *boundToE1, &code));
    EXPECT_EQ(kVSLErrorWrongPersona, code);

    // No "Identifier": the client's own, where the command allows a default.
    code = 1;
    auto own = concreteIdentityFromRequest(dict({{"ContainerClass", Value::uint64(2)},
                                                 {"UUID", Value::uuid(Uuid::random())},
                                                 {"PersonaUniqueString", Value::string("E1")}}),
                                           nullptr, nullptr, nullptr, nullptr, *boundToE1, &code);
    ASSERT_TRUE(own) << code;
    EXPECT_EQ("com.example.mail", own->identifier());
    EXPECT_TRUE(sameUserIdentity(e1(), own->userIdentity()));

    code = 1;
    EXPECT_EQ(nullptr, concreteIdentityFromRequestIdentifier(dict({{"ContainerClass", Value::uint64(2)}}), *boundToE1,
                                                             &code));
    EXPECT_EQ(kVSLErrorMissingIdentifier, code) << "an explicit identifier key has no default";

    code = 1;
    EXPECT_EQ(nullptr, concreteIdentityFromRequestIdentifier(
                           dict({{"Identifier", Value::string("x")},
                                 {"ContainerClass", Value::uint64(2)},
                                 {"PersonaUniqueString", Value::string("E1")}}),
                           *boundToE1, &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code) << "no UUID";

    code = 1;
    EXPECT_EQ(nullptr, concreteIdentityFromRequestIdentifier(
                           dict({{"Identifier", Value::string("x")},
                                 {"ContainerClass", Value::uint64(2)},
                                 {"UUID", Value::uuid(Uuid::random())},
                                 {"PersonaUniqueString", Value::string("E2")}}),
                           *boundToE1, &code));
    EXPECT_EQ(kVSLErrorWrongPersona, code);

    code = 1;
    EXPECT_EQ(nullptr, identityFromRequest(dict({{"Identifier", Value::string("x")}}), nullptr, nullptr, *boundToE1,
                                           &code));
    EXPECT_EQ(kVSLErrorUnexpectedClass, code) << "class 0";
    auto plain = identityFromRequest(dict({{"ContainerClass", Value::uint64(7)}}), nullptr, nullptr, *boundToE1, &code);
    ASSERT_TRUE(plain);
    EXPECT_EQ("com.example.mail", plain->identifier());
}

TEST(PersonaRules, AccessiblePersonas) {
    auto strings = [](const VSLClientConnectionRef& c) {
        auto reply = std::make_shared<VSLReply>(nullptr);
        uint64_t code = 1;
        listAccessiblePersonas(Value::dictionary({}), reply, c, &code);
        EXPECT_EQ(1u, code);
        std::set<std::string> out;
        for (const auto& v : *reply->values().at("ReplyPersonaUniqueStringsArray").arrayValue())
            out.insert(*v.stringValue());
        return out;
    };
    EXPECT_EQ((std::set<std::string>{"P", "E1", "E2"}), strings(clientAs(cache()->unspecificUserIdentity())));
    EXPECT_EQ((std::set<std::string>{"E1"}), strings(clientAs(e1())));
}
