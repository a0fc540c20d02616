#include <gtest/gtest.h>

#include <unordered_set>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

VSLUserIdentityRef user(uid_t uid, std::optional<std::string> unique = std::nullopt,
                        uint32_t type = kVSLPersonaTypePersonal) {
    return VSLUserIdentity::create(uid, uid, "/home/u" + std::to_string(uid), std::move(unique), type,
                                   static_cast<int32_t>(uid));
}

}  // namespace

TEST(ContainerIdentity, ValidationOrderAndCodes) {
    auto u = user(501);
    uint64_t code = 1;

    // Each failure reports its own code; the earlier check wins when several fail.
    EXPECT_EQ(nullptr, VSLContainerIdentity::containerIdentityWithUserIdentity(nullptr, Value(), 0, &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code) << "missing user identity is checked first";

    code = 1;
    EXPECT_EQ(nullptr, VSLContainerIdentity::containerIdentityWithUserIdentity(u, Value(), 0, &code));
    EXPECT_EQ(kVSLErrorMissingIdentifier, code) << "missing identifier is 18 even with a bad class";

    code = 1;
    EXPECT_EQ(nullptr, VSLContainerIdentity::containerIdentityWithUserIdentity(u, Value::uint64(7), 2, &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code) << "a non-string identifier is 11";

    for (VSLContainerClass bad : {VSLContainerClass(0), VSLContainerClass(14), VSLContainerClass(15),
                                  VSLContainerClass(UINT64_MAX)}) {
        code = 1;
        EXPECT_EQ(nullptr, VSLContainerIdentity::containerIdentityWithUserIdentity(u, "com.x", bad, &code));
        EXPECT_EQ(kVSLErrorInvalidObject, code) << "class " << bad;
    }

    code = 1;
    auto ok = VSLContainerIdentity::containerIdentityWithUserIdentity(u, "com.x", 13, &code);
    ASSERT_NE(nullptr, ok);
    EXPECT_EQ(1u, code) << "success leaves the code untouched";
    EXPECT_EQ(13u, ok->containerClass());

    // The concrete form runs the base checks first and passes their code through.
    code = 1;
    EXPECT_EQ(nullptr, VSLConcreteContainerIdentity::containerIdentityWithUUID(Value::string("nope"), u, Value(),
                                                                               2, &code));
    EXPECT_EQ(kVSLErrorMissingIdentifier, code);
    code = 1;
    EXPECT_EQ(nullptr, VSLConcreteContainerIdentity::containerIdentityWithUUID(Value::string("nope"), u,
                                                                               Value::string("a"), 2, &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code) << "a uuid that is not a uuid value";
    code = 1;
    EXPECT_EQ(nullptr, VSLConcreteContainerIdentity::containerIdentityWithUUID(Value(), u, Value::string("a"), 2,
                                                                               &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code);
}

TEST(ContainerIdentity, IdentifierOnlyFormNeedsAClassWithoutUser) {
    test::TempRoot root;
    for (VSLContainerClass c = 1; c <= 13; c++) {
        uint64_t code = 1;
        auto id = VSLContainerIdentity::containerIdentityWithIdentifier("com.x", c, &code);
        bool needsUser = VSLUserIdentity::isUserIdentityRequiredForContainerClass(c);
        EXPECT_EQ(needsUser, id == nullptr) << "class " << c;
        EXPECT_EQ(needsUser ? uint64_t(kVSLErrorInvalidObject) : uint64_t(1), code) << "class " << c;
        if (id) {
            EXPECT_EQ("501", id->userIdentity()->identifier()) << "the default (mobile) identity";
        }
    }
    EXPECT_TRUE(VSLUserIdentity::isUserIdentityRequiredForContainerClass(0));
    EXPECT_TRUE(VSLUserIdentity::isUserIdentityRequiredForContainerClass(14));
    EXPECT_TRUE(VSLUserIdentity::isUserIdentityRequiredForContainerClass(99));
}

TEST(ContainerIdentity, EqualityAndHash) {
    auto a = VSLContainerIdentity::containerIdentityWithUserIdentity(user(501), "com.x", 2, nullptr);
    // Different object, equal user identity (same uid, another unique string: personal ids compare by uid).
    auto b = VSLContainerIdentity::containerIdentityWithUserIdentity(user(501, "other"), "com.x", 2, nullptr);
    auto otherClass = VSLContainerIdentity::containerIdentityWithUserIdentity(user(501), "com.x", 4, nullptr);
    auto otherUser = VSLContainerIdentity::containerIdentityWithUserIdentity(user(502), "com.x", 2, nullptr);
    auto otherId = VSLContainerIdentity::containerIdentityWithUserIdentity(user(501), "com.y", 2, nullptr);
    ASSERT_TRUE(a && b && otherClass && otherUser && otherId);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_FALSE(a->isEqual(*otherClass));
    EXPECT_FALSE(a->isEqual(*otherUser));
    EXPECT_FALSE(a->isEqual(*otherId));

    Uuid u1 = Uuid::random(), u2 = Uuid::random();
    auto c1 = VSLConcreteContainerIdentity::containerIdentityWithUUID(u1, user(501), "com.x", 2, nullptr);
    auto c1b = VSLConcreteContainerIdentity::containerIdentityWithUUID(u1, user(501), "com.x", 2, nullptr);
    auto c2 = VSLConcreteContainerIdentity::containerIdentityWithUUID(u2, user(501), "com.x", 2, nullptr);
    ASSERT_TRUE(c1 && c1b && c2);
    EXPECT_TRUE(c1->isEqual(*c1b));
    EXPECT_EQ(c1->hash(), c1b->hash());
    EXPECT_FALSE(c1->isEqual(*c2)) << "same three fields, different UUID";
    EXPECT_FALSE(c1->isEqual(*a)) << "a concrete identity never equals a plain one";
    EXPECT_TRUE(a->isEqual(*c1)) << "a plain identity compares the base fields only";

    std::unordered_set<VSLContainerIdentityRef, VSLContainerIdentityHash, VSLContainerIdentityEqual> set{a, b,
                                                                                                          otherId};
    EXPECT_EQ(2u, set.size());

    EXPECT_NE(std::string::npos, c1->description().find("uuid = " + u1.string()));
    EXPECT_NE(std::string::npos, a->description().find("identifier = com.x, class = 2>"));
}

TEST(ContainerClass, TablesAndSets) {
    EXPECT_STREQ("Data/Application", containerClassDirectoryName(2));
    EXPECT_STREQ("Shared/SystemGroup", containerClassDirectoryName(13));
    EXPECT_STREQ("MAX", containerClassDirectoryName(14));
    EXPECT_EQ(nullptr, containerClassDirectoryName(15));
    EXPECT_STREQ("daemon", containerClassShortName(10));
    EXPECT_EQ(nullptr, containerClassShortName(0));
    EXPECT_EQ(nullptr, containerClassShortName(14));
    EXPECT_EQ(9u, containerClassForShortName("ipcService"));
    EXPECT_EQ(0u, containerClassForShortName("nope"));

    std::vector<VSLContainerClass> seen;
    forEachPerUserContainerClass([&](VSLContainerClass c) { seen.push_back(c); });
    EXPECT_EQ((std::vector<VSLContainerClass>{2, 4, 6, 7, 9, 10, 11}), seen);
    for (VSLContainerClass c = 0; c <= 14; c++) {
        int sets = isBundleContainerClass(c) + isSystemContainerClass(c) + isPerUserContainerClass(c);
        EXPECT_EQ(isValidContainerClass(c) ? 1 : 0, sets) << "every valid class is in exactly one set: " << c;
    }
}
