#include <gtest/gtest.h>

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/DeviceFacts.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

// Resolver for a device without personas: every lookup is the personal persona
// re-based to the asked uid/gid; enterprise strings known to the test resolve.
class FakeResolver : public VSLUserIdentityResolver {
public:
    std::map<std::string, VSLUserIdentityRef> enterprise;
    VSLUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& unique, uid_t uid,
                                                          gid_t gid) override {
        if (unique) {
            auto it = enterprise.find(*unique);
            return it == enterprise.end() ? nullptr : it->second;
        }
        return userIdentityForPersonalPersona(uid, gid);
    }
    VSLUserIdentityRef userIdentityForPersonalPersona(uid_t uid, gid_t gid) override {
        return VSLUserIdentity::create(uid, gid, "/home/" + std::to_string(uid), std::nullopt,
                                       kVSLPersonaTypePersonal, static_cast<int32_t>(uid));
    }
};

}  // namespace

TEST(UserIdentity, FieldsIdentifierAndRoleUsers) {
    EXPECT_EQ(nullptr, VSLUserIdentity::create(500, 500, "/h", std::nullopt, 0, 500)) << "role user";
    EXPECT_EQ(nullptr, VSLUserIdentity::create(0, 0, "/h", std::nullopt, 0, 0));
    auto personal = VSLUserIdentity::create(501, 20, "/h", std::string("P-1"), kVSLPersonaTypePersonal, 1000);
    auto personal2 = VSLUserIdentity::create(501, 21, "/h2", std::string("P-2"), kVSLPersonaTypeUnspecific, 1001);
    auto enterprise = VSLUserIdentity::create(501, 20, "/e", std::string("E-1"), kVSLPersonaTypeEnterprise, 1002);
    auto enterpriseNoString = VSLUserIdentity::create(501, 20, "/e", std::nullopt, kVSLPersonaTypeEnterprise, 1003);
    ASSERT_TRUE(personal && personal2 && enterprise && enterpriseNoString);
    EXPECT_EQ("501", personal->identifier());
    EXPECT_EQ("E-1", enterprise->identifier());
    EXPECT_EQ("501", enterpriseNoString->identifier());
    EXPECT_TRUE(personal->isEqual(*personal2)) << "personal identities of one uid are equal whatever their strings";
    EXPECT_EQ(personal->hash(), personal2->hash());
    EXPECT_FALSE(personal->isEqual(*enterprise));
    EXPECT_TRUE(personal->isHomeDirectoryInCommonSandbox());
    EXPECT_TRUE(personal2->isNoSpecificPersona());
    EXPECT_FALSE(enterprise->isHomeDirectoryInCommonSandbox());
    EXPECT_STREQ("unknown", VSLUserIdentity::descriptionForPersonaType(7));
    EXPECT_NE(std::string::npos, enterprise->shortDescription().find("; 501/20/E-1/1/1002>"));
    EXPECT_NE(std::string::npos, enterprise->description().find("personaType = enterprise, personaUniqueString = E-1, "
                                                                "kernelPersonaID = 1002>"));
}

TEST(UserIdentity, OwnerPerClassFollowsDeviceFacts) {
    test::TempRoot root;
    root.writeDeviceFacts(dict({{"InstallerUID", Value::uint64(777)}, {"SystemContainerUID", Value::uint64(888)}}));
    auto u = VSLUserIdentity::create(601, 602, "/h", std::nullopt, 0, 601);
    for (VSLContainerClass c : {1, 3, 5, 8}) {
        EXPECT_EQ(777u, u->posixUIDForContainerClass(c));
        EXPECT_EQ(777u, u->posixGIDForContainerClass(c));
    }
    EXPECT_EQ(888u, u->posixUIDForContainerClass(12));
    EXPECT_EQ(888u, u->posixGIDForContainerClass(13));
    EXPECT_EQ(601u, u->posixUIDForContainerClass(2));
    EXPECT_EQ(602u, u->posixGIDForContainerClass(7));
}

TEST(UserIdentity, PropertyListForms) {
    FakeResolver cache;
    auto enterprise = VSLUserIdentity::create(501, 501, "/e", std::string("E-1"), kVSLPersonaTypeEnterprise, 9);
    cache.enterprise["E-1"] = enterprise;
    // A known string that is not enterprise is still returned (and logged).
    cache.enterprise["P-1"] = VSLUserIdentity::create(501, 501, "/p", std::string("P-1"), 0, 8);

    Value written = enterprise->plist();
    EXPECT_EQ("2", *written.find("version")->stringValue());
    EXPECT_EQ(1u, written.find("type")->uint64Value());
    EXPECT_EQ("E-1", *written.find("personaUniqueString")->stringValue());
    EXPECT_EQ(nullptr, cache.userIdentityForPersonalPersona(600, 600)->plist().find("personaUniqueString"));

    uint64_t code = 1;
    auto back = VSLUserIdentity::userIdentityWithPlist(written, cache, &code);
    EXPECT_EQ(enterprise, back);
    EXPECT_EQ(1u, code);

    auto v2 = [](uint64_t uid, uint64_t gid, Value type, std::optional<std::string> unique) {
        Dictionary d{{"version", Value::string("2")}, {"posixUID", Value::uint64(uid)},
                     {"posixGID", Value::uint64(gid)}, {"type", std::move(type)}};
        if (unique) d["personaUniqueString"] = Value::string(*unique);
        return Value::dictionary(std::move(d));
    };

    code = 1;
    EXPECT_EQ(nullptr, VSLUserIdentity::userIdentityWithPlist(v2(501, 501, Value::uint64(3), std::nullopt), cache, &code));
    EXPECT_EQ(kVSLErrorUserIdentityPlist, code) << "type 3";
    code = 1;
    EXPECT_EQ(nullptr,
              VSLUserIdentity::userIdentityWithPlist(v2(501, 501, Value::string("1"), std::nullopt), cache, &code));
    EXPECT_EQ(kVSLErrorUserIdentityPlist, code) << "type not a number";

    code = 1;
    auto unspecific = VSLUserIdentity::userIdentityWithPlist(v2(640, 641, Value::uint64(2), std::nullopt), cache, &code);
    ASSERT_TRUE(unspecific);
    EXPECT_EQ(640u, unspecific->posixUID()) << "type 2 without string: the personal identity re-based";
    EXPECT_EQ(641u, unspecific->posixGID());
    EXPECT_EQ(kVSLPersonaTypePersonal, unspecific->personaType());

    code = 5;
    EXPECT_EQ(nullptr, VSLUserIdentity::userIdentityWithPlist(v2(501, 501, Value::uint64(1), "E-unknown"), cache, &code));
    EXPECT_EQ(1u, code) << "an unknown enterprise string yields none with code 1";
    EXPECT_EQ(cache.enterprise["P-1"],
              VSLUserIdentity::userIdentityWithPlist(v2(501, 501, Value::uint64(1), "P-1"), cache, nullptr));

    // Version 1: personaIdentifier tried first, then the personal persona.
    Value v1 = dict({{"version", Value::string("1")}, {"posixUID", Value::uint64(650)},
                     {"posixGID", Value::uint64(651)}, {"personaIdentifier", Value::string("E-1")}});
    EXPECT_EQ(enterprise, VSLUserIdentity::userIdentityWithPlist(v1, cache, nullptr));
    Value v1Unknown = dict({{"version", Value::string("1")}, {"posixUID", Value::uint64(650)},
                            {"posixGID", Value::uint64(651)}, {"personaIdentifier", Value::string("nope")}});
    auto fallback = VSLUserIdentity::userIdentityWithPlist(v1Unknown, cache, nullptr);
    ASSERT_TRUE(fallback);
    EXPECT_EQ(650u, fallback->posixUID());
    code = 1;
    EXPECT_EQ(nullptr, VSLUserIdentity::userIdentityWithPlist(
                           dict({{"version", Value::string("1")}, {"posixUID", Value::uint64(650)}}), cache, &code));
    EXPECT_EQ(kVSLErrorUserIdentityPlist, code);

    // Unknown or missing versions yield none and leave the code alone.
    code = 1;
    EXPECT_EQ(nullptr, VSLUserIdentity::userIdentityWithPlist(dict({{"version", Value::uint64(2)}}), cache, &code));
    EXPECT_EQ(nullptr, VSLUserIdentity::userIdentityWithPlist(Value::string("x"), cache, &code));
    EXPECT_EQ(1u, code);
}

TEST(UserIdentity, DefaultAndLegacyMobileUseThePasswordDatabase) {
    test::TempRoot root(777, 778);
    auto legacy = VSLUserIdentity::legacyMobile();
    ASSERT_TRUE(legacy);
    EXPECT_EQ(501u, legacy->posixUID());
    // uid 501 is not in this root's passwd: the fallback home below the root.
    EXPECT_EQ(root.at("private/var/mobile"), legacy->homeDirectoryURL());
}
