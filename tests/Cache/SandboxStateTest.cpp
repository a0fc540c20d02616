#include <gtest/gtest.h>
#include <fcntl.h>
#include <unistd.h>

#include <map>
#include <tuple>

#include "Cache/CacheTestSupport.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

using Items = std::map<std::tuple<uint64_t, int32_t, std::string>, std::string>;

Items itemsOf(uid_t uid) {
    Items items;
    EXPECT_EQ(0, SandboxState::iterateItems(uid, [&](const SandboxContainerItem& item) {
        items[{item.type, item.personaID, item.identifier}] = item.path;
    }));
    return items;
}

std::string tableOf(uid_t uid) { return joinPath(SandboxState::directory(), "uid-" + std::to_string(uid)); }

class SandboxStateTest : public ::testing::Test {
protected:
    void SetUp() override { resetCacheTestRoot(); }
};

TEST_F(SandboxStateTest, ItemsAreKeyedByTypePersonaAndIdentifierPerUID) {
    EXPECT_TRUE(itemsOf(501).empty());
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 1000, "com.a", "/c/A"}));
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 1001, "com.a", "/c/A-enterprise"}));
    ASSERT_EQ(0, SandboxState::setItem(501, {2, 1000, "com.a", "/c/group"}));
    ASSERT_EQ(0, SandboxState::setItem(0, {4, 0, "com.a", "/c/system"}));
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 1000, "com.a", "/c/A2"}));  // replaces
    EXPECT_EQ((Items{{{1, 1000, "com.a"}, "/c/A2"}, {{1, 1001, "com.a"}, "/c/A-enterprise"}, {{2, 1000, "com.a"}, "/c/group"}}),
              itemsOf(501));
    EXPECT_EQ((Items{{{4, 0, "com.a"}, "/c/system"}}), itemsOf(0));

    // No path removes; removing what is not there is no error.
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 1001, "com.a", std::nullopt}));
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 1001, "com.a", std::nullopt}));
    ASSERT_EQ(0, SandboxState::setItems(501, {{2, 1000, "com.a", std::nullopt}, {2, 1000, "com.b", "/c/B"}}));
    EXPECT_EQ((Items{{{1, 1000, "com.a"}, "/c/A2"}, {{2, 1000, "com.b"}, "/c/B"}}), itemsOf(501));
    EXPECT_EQ(0, ::access(tableOf(501).c_str(), F_OK));
}

TEST_F(SandboxStateTest, ATornRecordIsDroppedAndTheRestSurvives) {
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.a", "/c/A"}));
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.b", "/c/B"}));
    // A crash in the middle of an append leaves part of a record at the end.
    std::string torn("\x30\x00\x00\x00\x01\x02\x03", 7);
    int fd = ::open(tableOf(501).c_str(), O_WRONLY | O_APPEND);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(static_cast<ssize_t>(torn.size()), ::write(fd, torn.data(), torn.size()));
    ::close(fd);
    Items expected{{{1, 7, "com.a"}, "/c/A"}, {{1, 7, "com.b"}, "/c/B"}};
    EXPECT_EQ(expected, itemsOf(501));

    // The next change is not lost behind the torn bytes.
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.c", "/c/C"}));
    expected[{1, 7, "com.c"}] = "/c/C";
    EXPECT_EQ(expected, itemsOf(501));
    std::string bytes = readFile(tableOf(501));
    EXPECT_EQ(std::string::npos, bytes.find(torn));
}

TEST_F(SandboxStateTest, ABootForgetsEveryTable) {
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.a", "/c/A"}));
    ASSERT_EQ(0, SandboxState::setItem(0, {8, 0, "com.g", "/c/G"}));

    // A table written under another boot reads as empty.
    std::string bytes = readFile(tableOf(0));
    ASSERT_GT(bytes.size(), 13u);
    bytes[12] = bytes[12] == 'x' ? 'y' : 'x';  // first character of the boot id
    writeBytes(tableOf(0) + ".new", bytes);
    ASSERT_EQ(0, ::rename((tableOf(0) + ".new").c_str(), tableOf(0).c_str()));
    EXPECT_TRUE(itemsOf(0).empty());
    EXPECT_EQ(1u, itemsOf(501).size());

    ASSERT_EQ(0, SandboxState::clearForBoot());
    EXPECT_TRUE(itemsOf(501).empty());
    EXPECT_NE(0, ::access(tableOf(501).c_str(), F_OK));
    ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.b", "/c/B"}));
    EXPECT_EQ((Items{{{1, 7, "com.b"}, "/c/B"}}), itemsOf(501));
}

TEST_F(SandboxStateTest, ManyChangesCompactTheTable) {
    for (int i = 0; i < 3000; i++)
        ASSERT_EQ(0, SandboxState::setItem(501, {1, 7, "com.a", "/c/" + std::to_string(i)}));
    EXPECT_EQ((Items{{{1, 7, "com.a"}, "/c/2999"}}), itemsOf(501));
    // One live item does not need thousands of records.
    EXPECT_LT(readFile(tableOf(501)).size(), 1100u * 48u);
}

}  // namespace
