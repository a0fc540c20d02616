#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kMarkers[] = {"vsl_bundle_migration_complete.plist", "vsl_acl2_migration_complete.plist",
                                "vsl_group_id_migration_complete.plist",
                                "vsl_code_signing_migration_complete.plist"};
const char* const kTypes[] = {"BundleMigration", "ACLMigration", "GroupIdMigration", "CodeSigningMigration"};

class MigrationStatus : public ::testing::Test {
protected:
    void SetUp() override {
        VSLGlobalConfiguration::resetSharedInstanceForTesting();
        library = VSLGlobalConfiguration::sharedInstance()->libraryDirectory();
        statusFile = library + "/vsl_migration_status.plist";
    }
    void TearDown() override { VSLGlobalConfiguration::resetSharedInstanceForTesting(); }

    void writeDictionary(const std::string& path, const Dictionary& d) {
        ASSERT_TRUE(VSL_writeToURL(Value::dictionary(d), path, kVSLWriteAtomic, nullptr)) << path;
    }
    void writeMarkers() {
        for (const char* m : kMarkers)
            writeDictionary(library + "/" + m, {{"VSLMigrationVersionNumber", Value::string("old")}});
    }
    bool exists(const std::string& path) {
        struct stat st;
        return ::lstat(path.c_str(), &st) == 0;
    }
    void setBuild(const std::string& osRelease) {
        root.writeFile("etc/os-release", osRelease);
        reloadDeviceFacts();
    }

    TempRoot root;
    std::string library;
    std::string statusFile;
};

}  // namespace

TEST_F(MigrationStatus, MarkerFilesAreFoldedInOnceAndRemovedOnlyAfterTheStatusFileIsWritten) {
    // Two markers whose sum is larger than a status file may be: the write is refused
    // and every marker stays for the next attempt.
    writeMarkers();
    Data half((kVSLMaxPropertyListFileSize / 2) + 1024, 7);
    writeDictionary(library + "/" + kMarkers[0], {{"padding", Value::data(half)}});
    writeDictionary(library + "/" + kMarkers[1], {{"padding", Value::data(half)}});
    ASSERT_TRUE(VSLMigrationStatus::initForSystemMigration());
    EXPECT_FALSE(exists(statusFile));
    for (const char* m : kMarkers) EXPECT_TRUE(exists(library + "/" + m)) << m;
    writeMarkers();

    // An empty status file beside the four markers becomes one file with the four types.
    writeDictionary(statusFile, {});
    {
        auto status = VSLMigrationStatus::initForSystemMigration();
        ASSERT_TRUE(status);
        for (const char* t : kTypes) EXPECT_TRUE(status->hasMigrationOccurredForType(t)) << t;
        EXPECT_FALSE(status->hasMigrationOccurredForType("SubdirectoryMigration"));
    }
    for (const char* m : kMarkers) EXPECT_FALSE(exists(library + "/" + m)) << m;
    auto onDisk = VSL_dictionaryWithContentsOfURL(statusFile, 0, nullptr);
    ASSERT_TRUE(onDisk);
    for (const char* t : kTypes) EXPECT_TRUE(onDisk->find(t)) << t;

    // A marker that shows up again later is not folded in: the status is not empty.
    writeDictionary(library + "/" + kMarkers[0], {});
    ASSERT_TRUE(VSLMigrationStatus::initForSystemMigration());
    EXPECT_TRUE(exists(library + "/" + kMarkers[0]));
}

TEST_F(MigrationStatus, UnreadableStatusFileFailsAndRecordsNothing) {
    writeMarkers();
    root.writeFile(statusFile.substr(root.path().size() + 1), "not a property list");
    EXPECT_FALSE(VSLMigrationStatus::initForSystemMigration());
    EXPECT_EQ("not a property list", readFile(statusFile));
    for (const char* m : kMarkers) EXPECT_TRUE(exists(library + "/" + m)) << m;

    // A marker of the wrong shape is skipped; the others still fold in.
    ASSERT_EQ(0, ::unlink(statusFile.c_str()));
    root.writeFile(library.substr(root.path().size() + 1) + "/" + kMarkers[1], "garbage");
    auto status = VSLMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->hasMigrationOccurredForType("BundleMigration"));
    EXPECT_FALSE(status->hasMigrationOccurredForType("ACLMigration"));
}

TEST_F(MigrationStatus, CompletedTypesAndLastBuildSurviveReopeningAndDecideUpgrades) {
    EXPECT_EQ("Unknown", VSLMigrationStatus::currentBuildVersion());
    setBuild("NAME=vessel\nBUILD_ID=\"20A1\"\nVARIANT_ID=internal\n");
    EXPECT_EQ("20A1", VSLMigrationStatus::currentBuildVersion());
    auto version = currentSystemVersionDictionary();
    ASSERT_TRUE(version);
    EXPECT_EQ("internal", *version->at("ReleaseType").stringValue());
    EXPECT_EQ("vessel", *version->at("NAME").stringValue());

    auto status = VSLMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->isBuildUpgrade());  // first boot: nothing recorded
    ASSERT_TRUE(status->setMigrationCompleteForType("ACLMigration"));
    ASSERT_TRUE(status->writeCurrentBuildInfoToDisk());

    status = VSLMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->hasMigrationOccurredForType("ACLMigration"));
    EXPECT_FALSE(status->hasMigrationOccurredForType("BundleMigration"));
    const Value* entry = status->migrationInfo().at("ACLMigration").find("VSLMigrationVersionNumber");
    ASSERT_TRUE(entry);
    EXPECT_EQ("20A1", *entry->stringValue());
    EXPECT_FALSE(status->isBuildUpgrade());

    // Only the build decides; a changed release type alone is no upgrade.
    setBuild("BUILD_ID=20A1\nVARIANT_ID=customer\n");
    EXPECT_FALSE(status->isBuildUpgrade());
    setBuild("BUILD_ID=20B7\n");
    EXPECT_TRUE(status->isBuildUpgrade());
    setBuild("NAME=vessel\n");
    EXPECT_TRUE(status->isBuildUpgrade());

    // The user's file is a separate one.
    auto user = VSLMigrationStatus::initForMobileUserMigration();
    ASSERT_TRUE(user);
    EXPECT_FALSE(user->hasMigrationOccurredForType("ACLMigration"));
    ASSERT_TRUE(user->setMigrationCompleteForType("SubdirectoryMigration"));
    EXPECT_NE(std::string::npos, user->migrationFileURL().find("/vsl_user_migration_status.plist"));
    EXPECT_TRUE(exists(user->migrationFileURL()));
    EXPECT_TRUE(VSLMigrationStatus::initForMobileUserMigration()->hasMigrationOccurredForType("SubdirectoryMigration"));
}
