#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

constexpr uid_t kUnset = static_cast<uid_t>(-1);

class Layout : public ::testing::Test {
protected:
    void SetUp() override {
        global = std::make_shared<VSLGlobalConfiguration>();
        mobile = VSLUserIdentity::create(501, 501, root.at("private/var/mobile"), std::nullopt,
                                         kVSLPersonaTypePersonal, 501);
    }

    // The accessor yields `relative` below the root and (re-)creates it with mode
    // 0755, owner `owner` (kUnset: not checked) and protection class `cls` ("" = none).
    void expectDirectory(const std::function<std::optional<std::string>()>& accessor, const std::string& relative,
                         uid_t owner, const std::string& cls) {
        std::string expected = root.at(relative);
        for (int round = 0; round < 2; round++) {
            auto path = accessor();
            ASSERT_TRUE(path) << relative;
            EXPECT_EQ(expected, *path);
            EXPECT_EQ(0755u, modeOf(expected)) << relative;
            if (owner != kUnset && runningAsRoot()) {
                EXPECT_EQ(owner, lstatOf(expected).st_uid) << relative;
                EXPECT_EQ(owner, lstatOf(expected).st_gid) << relative;
            }
            EXPECT_EQ(cls, protectionClassAttribute(expected)) << relative;
            // Deleted behind the configuration's back: the next call makes it again.
            ASSERT_EQ(0, ::rmdir(expected.c_str())) << relative;
        }
    }

    TempRoot root;
    std::shared_ptr<VSLGlobalConfiguration> global;
    VSLUserIdentityRef mobile;
};

}  // namespace

TEST_F(Layout, GlobalDirectoriesLieBelowTheRootWithTheirModesOwnersAndClasses) {
    auto& g = *global;
    expectDirectory([&] { return g.sharedContainersDirectory(); }, "private/var/containers", kUnset, "");
    expectDirectory([&] { return g.bundleDirectory(); }, "private/var/containers/Bundle", kUnset, "");
    expectDirectory([&] { return g.transientBundleDirectory(); }, "private/var/containers/Temp", 33, "");
    std::string caches = "private/var/root/Library/Caches/com.tarrow.vesseld";
    expectDirectory([&] { return g.stagingDirectory(); }, caches + "/Staging", kUnset, "");
    expectDirectory([&] { return g.deathrowDirectory(); }, caches + "/Dead", kUnset, "");
    expectDirectory([&] { return g.transientDirectory(); }, caches + "/Temp", kUnset, "");
    expectDirectory([&] { return g.replaceDirectory(); }, "private/var/root/Library/Vesselry/Replace", kUnset, "");
    expectDirectory([&] { return g.pendingUpdatesDirectory(); }, "private/var/root/Library/Vesselry/PendingUpdates",
                    kUnset, "");
    expectDirectory([&] { return g.logDirectory(); }, "private/var/root/Library/Logs/Vesselry", kUnset, "4");
    // Parents last, once their children are gone.
    expectDirectory([&] { return g.cachesDirectory(); }, caches, kUnset, "4");
    expectDirectory([&] { return g.libraryDirectory(); }, "private/var/root/Library/Vesselry", kUnset, "4");
    EXPECT_EQ(root.at("private/var/root"), g.homeDirectory());
    EXPECT_EQ(501u, g.currentMobileUserId());
    EXPECT_EQ(501u, g.currentMobileGroupId());
}

TEST_F(Layout, ContainerClassDirectoriesGoToTheGlobalBaseOrTheUsersHome) {
    auto& g = *global;
    EXPECT_FALSE(g.globalContainerBaseURLWithContentClass(2, false));
    EXPECT_FALSE(g.globalContainerBaseURLWithContentClass(14, false));
    EXPECT_EQ(root.at("private/var/root/Library/Caches/com.tarrow.vesseld/Temp/Data/System"),
              g.globalContainerBaseURLWithContentClass(12, true));
    EXPECT_EQ(root.at("private/var/containers/Temp/Bundle/Framework"), g.globalContainerBaseURLWithContentClass(8, true));

    // System class directories keep the owner they were made with.
    std::string system = root.at("private/var/containers/Shared/SystemGroup");
    EXPECT_EQ(system, g.containerDirectoryURLForUserIdentity(mobile, 13, false));
    if (runningAsRoot()) {
        ASSERT_EQ(0, ::chown(system.c_str(), 77, 77));
        g.containerDirectoryURLForUserIdentity(mobile, 13, false);
        EXPECT_EQ(77u, lstatOf(system).st_uid) << "not taken over";
    }
    expectDirectory([&] { return g.containerDirectoryURLForUserIdentity(mobile, 13, false); },
                    "private/var/containers/Shared/SystemGroup", kUnset, "");

    expectDirectory([&] { return g.containerDirectoryURLForUserIdentity(mobile, 1, false); },
                    "private/var/containers/Bundle/Application", 33, "");
    expectDirectory([&] { return g.containerDirectoryURLForUserIdentity(mobile, 5, true); },
                    "private/var/containers/Temp/Bundle/VPNPlugin", 33, "");
    expectDirectory([&] { return g.containerDirectoryURLForUserIdentity(mobile, 7, false); },
                    "private/var/mobile/Containers/Shared/AppGroup", 501, "");
    expectDirectory([&] { return g.containerDirectoryURLForUserIdentity(mobile, 2, true); },
                    "private/var/mobile/Containers/Temp/Data/Application", 501, "");
    EXPECT_FALSE(g.containerDirectoryURLForUserIdentity(mobile, 14, false));
    EXPECT_FALSE(g.containerDirectoryURLForUserIdentity(nullptr, 2, false));

    EXPECT_EQ(g.stagingDirectory(), g.stagingDirectoryURLForUserIdentity(mobile, 8));
    EXPECT_EQ(root.at("private/var/mobile/Containers/Staging"), g.stagingDirectoryURLForUserIdentity(mobile, 2));

    // One per-user configuration per user identity, found again by equality.
    auto again = VSLUserIdentity::create(501, 501, root.at("private/var/mobile"), std::nullopt,
                                         kVSLPersonaTypePersonal, 501);
    EXPECT_EQ(g.getPerUserConfigurationForUserIdentity(mobile), g.getPerUserConfigurationForUserIdentity(again));
}

TEST_F(Layout, PerUserDirectoriesAndTheOnesNeverCreated) {
    auto perUser = global->getPerUserConfigurationForUserIdentity(mobile);
    ASSERT_TRUE(perUser);
    std::string home = "private/var/mobile";
    EXPECT_EQ(root.at(home), perUser->userHomeDirectory());
    EXPECT_TRUE(perUser->existsUserBaseDirectory()) << "the home is enough";
    expectDirectory([&] { return perUser->transientDirectory(); }, home + "/Containers/Temp", 501, "");
    expectDirectory([&] { return perUser->stagingDirectory(); }, home + "/Containers/Staging", 501, "");
    expectDirectory([&] { return perUser->libraryDirectory(); }, home + "/Library/Vesselry", 501, "");
    expectDirectory([&] { return perUser->userBaseDirectory(); }, home + "/Containers", 501, "");
    EXPECT_FALSE(perUser->containerDirectoryURLForContentClass(12, false));

    EXPECT_EQ(root.at(home + "/Library/Backup/SystemContainers/Data"), perUser->systemContainerBackupDirectory());
    EXPECT_EQ(root.at(home + "/Library/Backup/SystemContainers/Shared"), perUser->systemGroupContainerBackupDirectory());
    EXPECT_EQ(root.at(home + "/Library/Logs/Vesselry"), perUser->oldLoggingPath());
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(root.at(home + "/Library/Backup")));
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(root.at(home + "/Library/Logs")));

    auto homeless = VSLPerUserConfiguration::initWithUserIdentity(
        VSLUserIdentity::create(502, 502, "", std::nullopt, kVSLPersonaTypePersonal, 502));
    EXPECT_FALSE(homeless->userBaseDirectory());
    EXPECT_FALSE(homeless->containerDirectoryURLForContentClass(2, false));
    EXPECT_FALSE(homeless->existsUserBaseDirectory());
}

TEST_F(Layout, LegacyDirectoryMigrationFilesAndItemNames) {
    auto& g = *global;
    EXPECT_FALSE(g.legacyTransientBundleDirectory());
    root.writeFile("private/var/stowaged/Library/Caches/com.tarrow.vesseld/x", "");
    EXPECT_EQ(root.at("private/var/stowaged/Library/Caches/com.tarrow.vesseld"), g.legacyTransientBundleDirectory());

    EXPECT_FALSE(g.migrationFileExistsWithName("Done"));
    root.writeFile("private/var/root/Library/Vesselry/Done", "");
    EXPECT_TRUE(g.migrationFileExistsWithName("Done"));

    EXPECT_EQ((std::vector<std::string>{"Documents", "Library", "tmp", "Tillbox"}),
              VSLGlobalConfiguration::appUserDataItemNames());
    EXPECT_EQ(std::vector<std::string>{"SystemData"}, VSLGlobalConfiguration::excludedFromAppUserData());

    g.setIsInternalImage(true);
    EXPECT_TRUE(g.isInternalImage()) << "a value set before the first read stands";
    EXPECT_EQ(VSLGlobalConfiguration::sharedInstance(), VSLGlobalConfiguration::sharedInstance());
}
