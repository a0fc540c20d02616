#include <sys/stat.h>
#include <unistd.h>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DurableIO.h"
#include "Platform/PinnedNode.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

VSLFileManager& fm() { return VSLFileManager::defaultManager(); }
constexpr gid_t kSystemUsers = 4242;
constexpr uid_t kNobody = 4294967294u;

// A container with a metadata file, a subdirectory and a link that leads outside.
std::string makeContainer(const TempRoot& root, const std::string& name) {
    std::string c = root.at(name);
    root.writeFile(name + "/" + kVSLMetadataFileName, "meta");
    root.writeFile(name + "/Library/Preferences/p.plist", "pref");
    root.writeFile(name + "/tool", "#!/bin/sh\n");
    ::chmod((c + "/tool").c_str(), 0700);
    ::chmod((c + "/Library/Preferences/p.plist").c_str(), 0600);
    ::chmod((c + "/Library").c_str(), 0700);
    ::chmod((c + "/" + kVSLMetadataFileName).c_str(), 0600);
    ::symlink(root.at("outside/target").c_str(), (c + "/escape").c_str());
    return c;
}

void withSystemUsersGroup(const TempRoot& root) {
    root.writeFile("etc/group", "wheel:x:0:\nmobile:x:501:\nsystemusers:x:" + std::to_string(kSystemUsers) + ":\n");
}

}  // namespace

TEST(Standardize, OwnershipGivesStandardModesSkipsMetadataAndLeavesLinkTargetsAlone) {
    TempRoot root;
    root.writeFile("outside/target", "x");
    ::chmod(root.at("outside/target").c_str(), 0600);
    std::string c = makeContainer(root, "c");
    uid_t uid = runningAsRoot() ? 501 : ::geteuid();
    gid_t gid = runningAsRoot() ? 501 : ::getegid();

    VSLErrorRef error;
    ASSERT_TRUE(fm().standardizeOwnershipAtURL(c, uid, gid, &error)) << error->description();
    EXPECT_EQ(0755u, modeOf(c + "/tool"));
    EXPECT_EQ(0644u, modeOf(c + "/Library/Preferences/p.plist"));
    EXPECT_EQ(0755u, modeOf(c + "/Library"));
    EXPECT_EQ(0600u, modeOf(c + "/" + kVSLMetadataFileName));
    EXPECT_EQ(0600u, modeOf(root.at("outside/target")));
    if (runningAsRoot()) {
        EXPECT_EQ(501u, lstatOf(c + "/Library/Preferences/p.plist").st_uid);
        EXPECT_EQ(501u, lstatOf(c + "/escape").st_gid) << "the link itself";
        EXPECT_EQ(0u, lstatOf(root.at("outside/target")).st_uid);
        EXPECT_EQ(0u, lstatOf(c + "/" + kVSLMetadataFileName).st_uid);
    }
    uint64_t steps = durable::stepCount();
    ASSERT_TRUE(fm().standardizeOwnershipAtURL(c, uid, gid, &error));
    EXPECT_EQ(steps, durable::stepCount()) << "a second walk finds nothing to write";

    EXPECT_FALSE(fm().standardizeOwnershipAtURL(root.at("missing"), uid, gid, &error));
    EXPECT_EQ(ENOENT, error->code);
}

TEST(Standardize, SystemContainerACLsGrantOnlyTheSystemUsersGroup) {
    if (!runningAsRoot())
        GTEST_SKIP() << "needs root: a standardised system container is closed to everyone but root and the group";
    TempRoot root;
    withSystemUsersGroup(root);
    root.writeFile("outside/target", "x");
    std::string c = makeContainer(root, "sys");
    ::chmod(c.c_str(), 0755);
    struct stat before = lstatOf(c);

    VSLErrorRef error;
    ASSERT_TRUE(fm().standardizeACLsForSystemContainerAtURL(c, &error)) << error->description();

    // The root keeps owner and base permissions and gains the two-entry grant: the
    // inheritable one as its default ACL, the add-entries one in its access ACL.
    EXPECT_EQ(before.st_uid, lstatOf(c).st_uid);
    EXPECT_EQ(7, aclPerms(c, ACL_TYPE_ACCESS, ACL_USER_OBJ));
    EXPECT_EQ(5, aclPerms(c, ACL_TYPE_ACCESS, ACL_GROUP_OBJ));
    EXPECT_EQ(5, aclPerms(c, ACL_TYPE_ACCESS, ACL_OTHER));
    EXPECT_EQ(7, aclPerms(c, ACL_TYPE_ACCESS, ACL_GROUP, kSystemUsers));
    EXPECT_EQ(7, aclPerms(c, ACL_TYPE_DEFAULT, ACL_GROUP, kSystemUsers));

    // Everything inside: nothing for owner, group and other; all for the group.
    for (const char* p : {"/tool", "/Library", "/Library/Preferences/p.plist"}) {
        std::string item = c + p;
        EXPECT_EQ(0, aclPerms(item, ACL_TYPE_ACCESS, ACL_USER_OBJ)) << p;
        EXPECT_EQ(0, aclPerms(item, ACL_TYPE_ACCESS, ACL_OTHER)) << p;
        EXPECT_EQ(7, aclPerms(item, ACL_TYPE_ACCESS, ACL_GROUP, kSystemUsers)) << p;
        EXPECT_EQ(kNobody, lstatOf(item).st_uid) << p;
    }
    EXPECT_EQ(7, aclPerms(c + "/Library", ACL_TYPE_DEFAULT, ACL_GROUP, kSystemUsers));
    EXPECT_EQ(-1, aclPerms(root.at("outside/target"), ACL_TYPE_ACCESS, ACL_GROUP, kSystemUsers));
    EXPECT_EQ(0600u, modeOf(c + "/" + kVSLMetadataFileName));

    uint64_t steps = durable::stepCount();
    ASSERT_TRUE(fm().standardizeACLsForSystemContainerAtURL(c, &error));
    EXPECT_EQ(steps, durable::stepCount()) << "a second walk finds nothing to write";
}

TEST(Standardize, AllSystemContainersAndMissingGroup) {
    TempRoot root;
    VSLErrorRef error;
    EXPECT_TRUE(fm().standardizeAllSystemContainerACLsAtURL(root.at("no-class-dir"), &error));

    root.writeFile("outside/target", "x");
    makeContainer(root, "class/A");
    makeContainer(root, "class/B");
    EXPECT_FALSE(fm().standardizeAllSystemContainerACLsAtURL(root.at("class"), &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(63, error->code) << "no systemusers group";
    EXPECT_FALSE(fm().setTopLevelSystemContainerACLAtURL(root.at("class/A"), &error));
    EXPECT_EQ(63, error->code);

    withSystemUsersGroup(root);
    EXPECT_TRUE(fm().standardizeAllSystemContainerACLsAtURL(root.at("class"), &error));
    for (const char* p : {"class/A/tool", "class/B/tool"})
        EXPECT_EQ(7, aclPerms(root.at(p), ACL_TYPE_ACCESS, ACL_GROUP, kSystemUsers)) << p;
}

TEST(Standardize, AWriteGoesOnlyToTheItemTheWalkSaw) {
    TempRoot root;
    root.writeFile("c/dir/file", "mine");
    root.writeFile("elsewhere/file", "not mine");
    std::string c = root.at("c");
    NodePinner pinner(c);
    struct stat seen = lstatOf(c + "/dir/file");
    int fd = pinner.open(c + "/dir/file", seen);
    ASSERT_GE(fd, 0);
    ::close(fd);

    // A directory on the way swapped for a link: refused even though a file of that
    // name waits behind it.
    ASSERT_EQ(0, ::rename((c + "/dir").c_str(), (c + "/old").c_str()));
    ASSERT_EQ(0, ::symlink(root.at("elsewhere").c_str(), (c + "/dir").c_str()));
    EXPECT_EQ(-1, pinner.open(c + "/dir/file", lstatOf(root.at("elsewhere/file"))));
    EXPECT_EQ(ELOOP, errno);

    // Another item in the same place: refused as stale.
    EXPECT_EQ(-1, pinner.open(c + "/old/file", lstatOf(root.at("elsewhere/file"))));
    EXPECT_EQ(ESTALE, errno);
    EXPECT_EQ(-1, pinner.open(root.at("elsewhere/file"), lstatOf(root.at("elsewhere/file"))))
        << "nothing outside the walk's top";
}

TEST(DiskUsage, SumsRegularFilesAndIsZeroWhenUnknown) {
    TempRoot root;
    root.writeFile("t/a", std::string(1000, 'a'));
    root.writeFile("t/d/b", std::string(234, 'b'));
    ::symlink(root.at("t/a").c_str(), root.at("t/d/link").c_str());
    EXPECT_EQ(1234u, fm().diskUsageForURL(root.at("t")));
    EXPECT_EQ(1234u, fm().fastDiskUsageForURL(root.at("t")));
    EXPECT_EQ(0u, fm().diskUsageForURL(root.at("missing")));
}
