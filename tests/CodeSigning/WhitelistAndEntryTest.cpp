// The well-known container lists, and the code-signing entry as a value.
#include <gtest/gtest.h>

#include "Daemon/CodeSigning/VSLCodeSigningEntry.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/CodeSigning/VSLWhitelistTable.h"

using namespace vsl;

TEST(VSLWhitelist, LookupPermissionFollowsContainerThenCallerThenClass) {
    auto whitelist = VSLWhitelist::sharedWhitelist();
    const auto& byContainer = kVSLLookupByContainer[0];
    EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.anyone", byContainer.containerClass,
                                                                     byContainer.containerIdentifier));
    EXPECT_FALSE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.anyone", byContainer.containerClass,
                                                                      "com.example.other"));

    size_t everything = 0, oneClass = 0;
    for (const auto& row : kVSLLookupByCodeSignIdentifier) {
        if (row.containerClass == kVSLClassUndefined) {
            everything++;
            for (VSLContainerClass c = 0; c < kVSLClassMax; c++)
                EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier(row.codeSigningIdentifier, c, "x.y"));
            EXPECT_FALSE(
                whitelist->isLookupWhitelistedFromCodeSignIdentifier(row.codeSigningIdentifier, kVSLClassMax, "x.y"));
            continue;
        }
        oneClass++;
        EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier(row.codeSigningIdentifier, row.containerClass,
                                                                         row.containerIdentifier));
        EXPECT_FALSE(whitelist->isLookupWhitelistedFromCodeSignIdentifier(row.codeSigningIdentifier, row.containerClass,
                                                                          "com.example.other"));
        VSLContainerClass otherClass =
            row.containerClass == kVSLClassAppGroup ? kVSLClassApplicationData : kVSLClassAppGroup;
        EXPECT_FALSE(whitelist->isLookupWhitelistedFromCodeSignIdentifier(row.codeSigningIdentifier, otherClass,
                                                                          row.containerIdentifier));
    }
    EXPECT_EQ(6u, everything);
    EXPECT_EQ(3u, oneClass);
}

TEST(VSLWhitelist, WellKnownContainersAreKnownOnlyInTheirOwnClass) {
    auto whitelist = VSLWhitelist::sharedWhitelist();
    EXPECT_EQ(2u, whitelist->wellknownSystemContainers().size());
    size_t groups = whitelist->wellknownSystemGroupContainers().size();
    EXPECT_TRUE(groups == 8 || groups == 9) << groups;
    for (const auto& g : whitelist->wellknownSystemGroupContainers()) EXPECT_EQ(0u, g.rfind("systemgroup.", 0)) << g;

    std::string system = kVSLWellKnownSystemContainers[0];
    std::string group = kVSLWellKnownSystemGroupContainers[0];
    EXPECT_TRUE(whitelist->containerIdIsWellknown(system, kVSLClassSystemData));
    EXPECT_FALSE(whitelist->containerIdIsWellknown(system, kVSLClassAppGroup));
    EXPECT_FALSE(whitelist->containerIdIsWellknown(system, kVSLClassSystemGroup));
    EXPECT_TRUE(whitelist->containerIdIsWellknown(group, kVSLClassSystemGroup));
    EXPECT_EQ(system, whitelist->wellknownContainerForId(system, kVSLClassApplicationData));
    EXPECT_EQ(group, whitelist->wellknownContainerForId(group, kVSLClassSystemGroup));
    EXPECT_FALSE(whitelist->wellknownContainerForId(group, kVSLClassSystemData));
    EXPECT_FALSE(whitelist->wellknownSystemContainerForId("com.example.unknown"));
}

TEST(VSLWhitelist, NestedArraysBecomeSetsAtEveryLevel) {
    Value nested = dict({{"a", Value::array({Value::string("x"), Value::string("x"), Value::string("y")})},
                         {"b", dict({{"c", dict({{"d", Value::array({Value::string("z")})}})}, {"e", Value()}})},
                         {"f", Value::uint64(3)}});
    VSLWhitelistNode top = VSLWhitelist::_convertArraysToSetsInNestedDictionary(nested);
    ASSERT_EQ(VSLWhitelistNode::Kind::Dictionary, top.kind);
    EXPECT_EQ((std::set<std::string>{"x", "y"}), top.dictionary.at("a").set);
    const auto& d = top.dictionary.at("b").dictionary.at("c").dictionary.at("d");
    EXPECT_EQ(VSLWhitelistNode::Kind::Set, d.kind);
    EXPECT_EQ(std::set<std::string>{"z"}, d.set);
    EXPECT_TRUE(top.dictionary.at("b").dictionary.at("e").isEverything());
    EXPECT_EQ(Value::uint64(3), top.dictionary.at("f").value);

    VSLWhitelist custom({}, {}, dict({{"2", Value::array({Value::string("open")})}}),
                        dict({{"caller", dict({{"7", Value()}})}}));
    EXPECT_TRUE(custom.isLookupWhitelistedFromCodeSignIdentifier("nobody", 2, "open"));
    EXPECT_FALSE(custom.isLookupWhitelistedFromCodeSignIdentifier("nobody", 4, "open"));
    EXPECT_TRUE(custom.isLookupWhitelistedFromCodeSignIdentifier("caller", 7, "group.any"));
    EXPECT_FALSE(custom.isLookupWhitelistedFromCodeSignIdentifier("caller", 2, "group.any"));
}

TEST(VSLCodeSigningEntry, SerializedFormEqualityHashAndDescription) {
    auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(dict({{"n", Value::int64(5)}}), 4);
    entry.childBundleIdentifiers = std::vector<std::string>{"c1", "c2"};
    entry.placeholder = true;
    entry.registeredByCaller = true;
    auto back = VSLCodeSigningEntry::initWithSerializedDictionary(entry.serialize());
    ASSERT_TRUE(back);
    EXPECT_EQ(entry, *back);

    auto bare = VSLCodeSigningEntry::initWithSerializedDictionary(dict({}));
    ASSERT_TRUE(bare);
    EXPECT_EQ(VSLCodeSigningEntry(), *bare);
    EXPECT_FALSE(VSLCodeSigningEntry::initWithSerializedDictionary(Value::string("x")));

    // The same number stored with another signedness is the same entry.
    auto unsignedTwin = entry;
    unsignedTwin.codeSigningInfo = dict({{"n", Value::uint64(5)}});
    EXPECT_EQ(entry, unsignedTwin);
    EXPECT_EQ(entry.hash(), unsignedTwin.hash());

    auto reordered = entry;
    reordered.childBundleIdentifiers = std::vector<std::string>{"c2", "c1"};
    EXPECT_NE(entry, reordered);
    auto advance = entry;
    advance.advanceCopy = true;
    EXPECT_NE(entry, advance);
    EXPECT_EQ(entry.hash() + 32, advance.hash());
    auto noInfo = entry;
    noInfo.codeSigningInfo.reset();
    EXPECT_NE(entry, noInfo);

    std::string text = entry.description();
    EXPECT_EQ(0u, text.find("<VSLCodeSigningEntry invalid: N, placeholder: Y, advanceCopy: N, regByCaller: Y, "
                            "dataClass: 4, childBundles: "))
        << text;
}
