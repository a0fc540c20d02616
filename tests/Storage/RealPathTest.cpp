#include <sys/stat.h>
#include <unistd.h>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/SystemRoot.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

class RealPath : public ::testing::Test {
protected:
    void SetUp() override {
        base = root.at("private/var/mobile/Containers/Data/Application/X");
        root.writeFile("private/var/mobile/Containers/Data/Application/X/Library/file", "inside");
        root.writeFile("private/var/mobile/Containers/Data/Application/XY/file", "neighbour");
        root.writeFile("outside/secret", "outside");
    }

    // The accepted real path, or "" after checking the refusal is code 10.
    std::string check(const std::string& suspicious, const std::string& against = "") {
        VSLErrorRef error;
        auto real = VSLFileManager::defaultManager().realPathForURL(suspicious, against.empty() ? base : against, &error);
        if (real) return *real;
        EXPECT_TRUE(error && error->isVSLDomain() && error->code == 10) << suspicious;
        return "";
    }

    void link(const std::string& target, const std::string& at) {
        ASSERT_EQ(0, ::symlink(target.c_str(), (base + "/" + at).c_str())) << at;
    }

    TempRoot root;
    std::string base;
};

}  // namespace

TEST_F(RealPath, AcceptsChildrenAndNotYetExistingPathsInsideTheBase) {
    EXPECT_EQ(base + "/Library", check(base + "/Library"));
    EXPECT_EQ(base + "/Library/file", check(base + "/Library/file/"));
    EXPECT_EQ(base, check(base)) << "the base itself is inside";
    EXPECT_EQ(base + "/Library/new/deeper", check(base + "/Library/new/deeper"));
}

TEST_F(RealPath, RefusesEveryWayOut) {
    EXPECT_EQ("", check(base + "/Library/../Library")) << "'..' even when it stays inside";
    EXPECT_EQ("", check(base + "/../X/Library"));
    EXPECT_EQ("", check(root.at("outside/secret")));
    EXPECT_EQ("", check(base + "Y/file")) << "a string prefix is not a parent";
    EXPECT_EQ("", check("", base));
    EXPECT_EQ("", check(base + "/Library", root.at("missing-base")));

    link("../..", "up");
    link(root.at("outside"), "absolute");
    link(".", "self");
    link("Library/..", "selfAgain");
    EXPECT_EQ("", check(base + "/up"));
    EXPECT_EQ("", check(base + "/absolute"));
    EXPECT_EQ("", check(base + "/self")) << "a link to the base where a child is asked for";
    EXPECT_EQ("", check(base + "/selfAgain"));

    // Links further up the path, or behind a harmless-looking relative link.
    ASSERT_EQ(0, ::symlink(root.at("outside").c_str(), (base + "/Library/exit").c_str()));
    link("Library/exit/secret", "hop");
    EXPECT_EQ("", check(base + "/Library/exit/secret"));
    EXPECT_EQ("", check(base + "/hop"));
    EXPECT_EQ("", check(base + "/Library/exit/not-yet"));
}

TEST_F(RealPath, HandsBackTheResolvedPathSoASwapAfterTheCheckDoesNotMatter) {
    link("Library/file", "shortcut");
    std::string real = check(base + "/shortcut");
    ASSERT_EQ(base + "/Library/file", real) << "the link's target, not the link";

    // The client swaps the link for one leading outside; what the caller holds still
    // names the checked file.
    ASSERT_EQ(0, ::unlink((base + "/shortcut").c_str()));
    ASSERT_EQ(0, ::symlink(root.at("outside/secret").c_str(), (base + "/shortcut").c_str()));
    EXPECT_EQ("inside", readFile(real));
    EXPECT_EQ("", check(base + "/shortcut"));
}

TEST_F(RealPath, TreatsPrivateAsAnAliasOnlyWhereTheFileSystemMakesItOne) {
    std::string unprivate = root.at("var/mobile/Containers/Data/Application/X");
    // No root/var: the other spelling names nothing inside the base.
    EXPECT_EQ("", check(unprivate + "/Library"));

    ASSERT_EQ(0, ::symlink("private/var", root.at("var").c_str()));
    EXPECT_EQ(base + "/Library", check(unprivate + "/Library"));
    EXPECT_EQ(base + "/Library", check(base + "/Library", unprivate));
    EXPECT_EQ("", check(unprivate + "/../X/Library"));
}

TEST(RealPathHelpers, DepthWalkAndWhatExists) {
    TempRoot root;
    const VSLFileManager& fm = VSLFileManager::defaultManager();
    int64_t depth = -1;
    EXPECT_TRUE(fm._validateSymlink("/a/./b//c", 0, &depth));
    EXPECT_EQ(3, depth);
    EXPECT_TRUE(fm._validateSymlink("a/../b", 2, &depth));
    EXPECT_EQ(3, depth);
    EXPECT_FALSE(fm._validateSymlink("../a", 2, &depth));
    EXPECT_FALSE(fm._validateSymlink("", 0, &depth));

    root.writeFile("d/f", "");
    EXPECT_EQ(root.at("d/x/y"), fm._realPathWhatExistsInPath(root.at("d/x/y")));
    EXPECT_EQ(root.at("d/f"), fm._realPathForURL(root.at("d/f"), false));
    EXPECT_FALSE(fm._realPathForURL(root.at("d/x"), false));
    EXPECT_EQ(root.at("d/x"), fm._realPathForURL(root.at("d/x"), true));
}
