// First start after boot against restarts within one boot, on one root: the first-boot
// setup and clean-up run once per boot; orphans and transient containers go at first
// boot only; restored system containers are installed; a new build rolls system
// container names and migrates.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include <sqlite3.h>

#include "Daemon/CodeSigning/VSLSQLiteDB.h"
#include "Platform/UniqueFd.h"
#include "Platform/Value.h"
#include "Support/Boot.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using client::kCleanupCompleteNotification;
using client::kRebootCleanupCompleteNotification;
namespace fs = std::filesystem;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";
const char* const kLog = "private/var/root/Library/Logs/Vesselry/vesseld.log";
const char* const kSystemData = "private/var/containers/Data/System";
const char* const kUserData = "private/var/mobile/Containers/Data/Application";

// A property-list dictionary of these XML entries.
std::string plistWith(const std::string& entries) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>" + entries +
           "</dict></plist>\n";
}

size_t occurrences(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) n++;
    return n;
}

class Boot : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowed, Value::boolean(true)}}));
        ASSERT_FALSE(admin.empty());
    }
    void startAndSettle(bool firstBoot, const std::vector<std::string>& environment = {}) {
        ASSERT_TRUE(daemon.start(environment)) << readFile(daemon.at("vesseld.stderr"));
        ASSERT_TRUE(waitForNotification(daemon, kCleanupCompleteNotification));
        if (firstBoot) {
            ASSERT_TRUE(waitForNotification(daemon, kRebootCleanupCompleteNotification));
        }
    }
    void rebootAndSettle(const std::vector<std::string>& environment = {}) {
        if (daemon.running()) {
            ASSERT_EQ(0, daemon.stop());
        }
        simulateReboot(daemon);
        startAndSettle(true, environment);
    }
    // The container's path, made when missing.
    std::string container(const std::string& identifier, uint64_t containerClass, bool create = true) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                    "ContainerClass=" + std::to_string(containerClass),
                                    std::string("CreateIfNecessary=") + (create ? "true" : "false")});
        EXPECT_EQ(1u, r.code()) << identifier << " " << r.err;
        return r.string("ReplyPath");
    }
    std::string log() { return readFile(daemon.at(kLog)); }
    // Rows of the code-signing database marked as advance copies (daemon stopped: it
    // holds the database exclusively).
    int advanceCopies() {
        std::string path = daemon.at(std::string("private/var/root/Library/Vesselry/") + kVSLCodeSigningDatabaseFileName);
        sqlite3* db = nullptr;
        int count = -1;
        if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
            sqlite3_stmt* statement = nullptr;
            if (sqlite3_prepare_v2(db, "SELECT COUNT(*) FROM code_signing_info WHERE (placeholder & 2) > 0;", -1,
                                   &statement, nullptr) == SQLITE_OK &&
                sqlite3_step(statement) == SQLITE_ROW)
                count = sqlite3_column_int(statement, 0);
            sqlite3_finalize(statement);
        }
        sqlite3_close(db);
        return count;
    }

    DaemonProcess daemon;
    std::string admin;
};

const char* const kOrphan = "0A1B2C3D-0000-4000-8000-0000000000AA";

TEST_F(Boot, FirstBootWorkRunsOncePerBootAndItsNotificationFollowsTheOrphanCleanups) {
    startAndSettle(true);
    EXPECT_EQ(1u, occurrences(log(), "vesseld performing first boot initialization"));
    const std::string kept = container("com.example.kept", 2);
    ASSERT_FALSE(kept.empty());
    // Code-signing data an installer registered ahead of the install lasts the boot.
    writeRootFile(daemon, "info.plist", plistWith("<key>Entitlements</key><dict/>"));
    writeRootFile(daemon, "options.plist", plistWith("<key>com.tarrow.Vesselry.AdvanceCopy</key><true/>"));
    auto registered = daemon.run(admin, {"processCodeSigningInfo", "Identifier=com.example.advance",
                                         "CodeSigningInfo:plist=@" + daemon.at("info.plist"),
                                         "OptionsDictionary:plist=@" + daemon.at("options.plist")});
    ASSERT_EQ(1u, registered.code()) << registered.err << registered.out;
    ASSERT_EQ(0, daemon.stop());
    ASSERT_EQ(1, advanceCopies());

    // Left behind: entries without metadata in a per-user and a system class directory,
    // a transient container's directory.
    auto plant = [&] {
        writeRootFile(daemon, std::string(kUserData) + "/" + kOrphan + "/Documents/stray", "x");
        writeRootFile(daemon, std::string(kSystemData) + "/" + kOrphan + "/stray", "x");
        writeRootFile(daemon, "private/var/root/Library/Caches/com.tarrow.vesseld/Temp/Data/System/T/file", "x");
    };
    plant();

    // A restart within the boot: no first-boot work, the orphans stay.
    startAndSettle(false);
    ASSERT_EQ(0, daemon.stop());
    EXPECT_EQ(1, advanceCopies()) << "a restart keeps advance copies";
    EXPECT_EQ(1u, occurrences(log(), "vesseld performing first boot initialization"));
    EXPECT_TRUE(fs::exists(daemon.at(std::string(kUserData) + "/" + kOrphan)));
    EXPECT_TRUE(fs::exists(daemon.at(std::string(kSystemData) + "/" + kOrphan)));

    // After a reboot: orphans and transient containers are gone by the time the
    // first-boot clean-up reports completion; the container with metadata stays.
    const std::string trace = daemon.at("durable.trace");
    // Numbered from start-up: the clean-up may run before or after the first client message.
    rebootAndSettle({"VESSELD_DURABLE_TRACE=" + trace, "VESSELD_KILL_SCOPE=startup"});
    // The steps say the order: both orphans renamed into death row before the post.
    const std::string steps = readFile(trace);
    const size_t posted = steps.find("notify/" + std::string(kRebootCleanupCompleteNotification));
    ASSERT_NE(std::string::npos, posted) << steps;
    for (const char* classDirectory : {kUserData, kSystemData}) {
        size_t moved = steps.find("rename " + fs::canonical(daemon.at(classDirectory)).string() + "/" + kOrphan);
        EXPECT_LT(moved, posted) << classDirectory << "\n" << steps;
    }
    EXPECT_EQ(2u, occurrences(log(), "vesseld performing first boot initialization"));
    EXPECT_FALSE(fs::exists(daemon.at(std::string(kUserData) + "/" + kOrphan)));
    EXPECT_FALSE(fs::exists(daemon.at(std::string(kSystemData) + "/" + kOrphan)));
    EXPECT_FALSE(fs::exists(daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld/Temp/Data/System/T")));
    EXPECT_NE(std::string::npos, log().find("Deleting orphaned data missing a metadata file at"));
    EXPECT_TRUE(fs::exists(kept + "/.com.tarrow.vesselry.metadata.plist"));
    EXPECT_EQ(kept, container("com.example.kept", 2, false));
    ASSERT_EQ(0, daemon.stop());
    EXPECT_EQ(0, advanceCopies()) << "a reboot drops advance copies";
}

TEST_F(Boot, RestoredSystemContainersAreInstalledAndWhatCannotBePlacedIsKept) {
    // An internal build keeps the backup directory, and so what could not be placed.
    writeRootFile(daemon, "etc/vesseld/device.plist", plistWith("<key>InternalBuild</key><true/>"));
    startAndSettle(true);
    const std::string blocked = container("com.example.blocked", 12);
    ASSERT_FALSE(blocked.empty());
    writeRootFile(daemon, fs::relative(blocked, daemon.root()).string() + "/Occupied/old", "old");
    ASSERT_EQ(0, daemon.stop());

    const std::string backup = "private/var/mobile/Library/Backup/SystemContainers";
    writeRootFile(daemon, backup + "/Data/com.example.restored/Documents/restored.txt", "restored");
    writeRootFile(daemon, backup + "/Data/com.example.blocked/Occupied/new", "new");
    writeRootFile(daemon, backup + "/Shared/systemgroup.com.example.restored/Shared.txt", "shared");
    // A link in the user's backup must not make the daemon install another directory.
    writeRootFile(daemon, "outside/secret", "secret");
    fs::create_directory_symlink(daemon.at("outside"), daemon.at(backup + "/Data/com.example.linked"));
    // The backup is the user's, as on a device (running unprivileged it is ours anyway).
    for (const char* mine : {"", "/Data", "/Shared"})
        (void)::lchown(daemon.at(backup + mine).c_str(), 501, 501);
    // The blocked container's entries cannot be removed, so its restored child cannot
    // take their place.
    UniqueFd fd(::open(blocked.c_str(), O_RDONLY | O_DIRECTORY));
    unsigned flags = 0;
    ASSERT_EQ(0, ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags));
    flags |= FS_APPEND_FL;
    ASSERT_EQ(0, ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags));

    simulateReboot(daemon);
    startAndSettle(true);
    flags &= ~FS_APPEND_FL;
    ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags);

    const std::string restored = container("com.example.restored", 12, false);
    ASSERT_FALSE(restored.empty());
    EXPECT_EQ("restored", readFile(restored + "/Documents/restored.txt"));
    for (const char* skeleton : {"Library/Caches", "Library/Preferences", "tmp"})
        EXPECT_TRUE(fs::is_directory(restored + "/" + skeleton)) << skeleton;
    const std::string group = container("systemgroup.com.example.restored", 13, false);
    EXPECT_EQ("shared", readFile(group + "/Shared.txt"));
    EXPECT_TRUE(fs::is_directory(group + "/Library/Caches"));

    EXPECT_TRUE(fs::is_directory(blocked + "/Occupied"));
    EXPECT_FALSE(fs::exists(blocked + "/Occupied/new"));
    EXPECT_EQ("new", readFile(daemon.at(backup + "/Data.inprogress.failed/com.example.blocked/Occupied/new")));
    EXPECT_FALSE(fs::exists(daemon.at(backup + "/Data"))) << "renamed to inprogress";
    EXPECT_EQ("secret", readFile(daemon.at("outside/secret")));
    auto linked = daemon.run(admin, {"createOrLookup", "Identifier=com.example.linked", "ContainerClass=12",
                                     "CreateIfNecessary=false"});
    EXPECT_EQ(21u, linked.code()) << "nothing installed through the link";
}

TEST_F(Boot, NewBuildRollsSystemContainerNamesAndMigrates) {
    startAndSettle(true);
    const std::string system = container("com.example.system", 12);
    const std::string group = container("systemgroup.com.example.group", 13);
    const std::string pinned = container("systemgroup.com.tarrow.wrenfield", 13);
    const std::string wellKnown = container("com.tarrow.settingsd", 12);
    ASSERT_FALSE(system.empty() || group.empty() || pinned.empty() || wellKnown.empty());
    ASSERT_EQ(0, daemon.stop());
    // A well-known container that an older build left under a UUID name.
    const std::string misplaced = daemon.at(std::string(kSystemData) + "/0A1B2C3D-0000-4000-8000-0000000000BB");
    fs::rename(wellKnown, misplaced);
    writeRootFile(daemon, "private/var/mobile/Library/Logs/Vesselry/vesseld.log.0", "old zero");
    writeRootFile(daemon, "private/var/mobile/Library/Logs/Vesselry/vesseld.log.3", "old three");
    writeRootFile(daemon, "etc/os-release", "NAME=vessel\nBUILD_ID=next\n");
    rebootAndSettle();

    const std::string rolledSystem = container("com.example.system", 12, false);
    const std::string rolledGroup = container("systemgroup.com.example.group", 13, false);
    EXPECT_NE(system, rolledSystem);
    EXPECT_NE(group, rolledGroup);
    EXPECT_TRUE(fs::is_directory(rolledSystem + "/Library"));
    EXPECT_FALSE(fs::exists(system));
    EXPECT_EQ(pinned, container("systemgroup.com.tarrow.wrenfield", 13, false));
    EXPECT_EQ(wellKnown, container("com.tarrow.settingsd", 12, false));
    EXPECT_TRUE(fs::is_directory(wellKnown));
    EXPECT_FALSE(fs::exists(misplaced));
    // One rotated file is kept on this build: ".0" becomes ".1"; the rest goes with the
    // old directory.
    EXPECT_EQ("old zero", readFile(daemon.at(std::string(kLog) + ".1")));
    EXPECT_FALSE(fs::exists(daemon.at("private/var/mobile/Library/Logs/Vesselry")));
    EXPECT_NE(std::string::npos, log().find("Saved last build version of next"));
    EXPECT_NE(std::string::npos, readFile(daemon.at("private/var/root/Library/Vesselry/vsl_migration_status.plist"))
                                     .find("next"));

    rebootAndSettle();
    EXPECT_NE(std::string::npos, log().find("skipping upgrade"));
    EXPECT_EQ(rolledSystem, container("com.example.system", 12, false));
}

TEST_F(Boot, AMultiUserDeviceKeepsItsOldLogDirectory) {
    writeRootFile(daemon, "etc/vesseld/device.plist", plistWith("<key>MultiUser</key><true/>"));
    writeRootFile(daemon, "private/var/mobile/Library/Logs/Vesselry/vesseld.log.0", "old zero");
    startAndSettle(true);
    EXPECT_NE(std::string::npos, log().find("Did not find last build info"));
    EXPECT_EQ("old zero", readFile(daemon.at("private/var/mobile/Library/Logs/Vesselry/vesseld.log.0")));
    EXPECT_FALSE(fs::exists(daemon.at(std::string(kLog) + ".1")));
}

// The marker is made only by the first-boot clean-up's completion: a start that stops
// before it (here, on the fatal upcall condition) leaves first-boot work to the next.
TEST_F(Boot, AFatalStopBeforeTheCleanupsLeavesFirstBootWorkToTheNextStart) {
    const std::string blocker = daemon.at("run/vesseld/com.tarrow.vesseld.upcall");
    fs::create_directories(blocker + "/occupied");
    std::string out, err;
    int status = runProgram({vesseldPath(), "--root", daemon.root(), "--init"}, &out, &err);
    EXPECT_NE(0, status) << err;
    EXPECT_NE(std::string::npos, log().find("Failed to initialize kernel upcall interface.")) << log();
    EXPECT_EQ(1u, occurrences(log(), "vesseld performing first boot initialization"));

    fs::remove_all(blocker);
    startAndSettle(true);
    EXPECT_EQ(2u, occurrences(log(), "vesseld performing first boot initialization"));
    ASSERT_EQ(0, daemon.stop());
    startAndSettle(false);
    EXPECT_EQ(2u, occurrences(log(), "vesseld performing first boot initialization"));
}

}  // namespace
