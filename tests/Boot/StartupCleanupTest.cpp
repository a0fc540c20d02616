// The clean-up run at every start: what the last process left half-built in staging
// goes through death row, and death row is destroyed, before cleanup-complete is
// posted; clients are served meanwhile.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>

#include "Support/Boot.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "Support/TempRoot.h"
#include "Platform/Value.h"

using namespace vsl::test;
using vsl::client::kCleanupCompleteNotification;
namespace fs = std::filesystem;

namespace {

const char* const kGlobalStaging = "private/var/root/Library/Caches/com.tarrow.vesseld/Staging";
const char* const kUserStaging = "private/var/mobile/Containers/Staging";
const char* const kDeathRow = "private/var/root/Library/Caches/com.tarrow.vesseld/Dead";

// A container whose creation a crash cut short: directories and a file, no metadata.
void leaveHalfBuiltContainer(const DaemonProcess& daemon, const std::string& staging, const std::string& name) {
    writeRootFile(daemon, staging + "/" + name + "/Library/Preferences/half.plist", "half");
    writeRootFile(daemon, staging + "/" + name + "/Documents/half.txt", "half");
}

}  // namespace

TEST(StartupCleanup, StagingLeftoversGoThroughDeathRowBeforeCleanupComplete) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_TRUE(waitForNotification(daemon, kCleanupCompleteNotification));
    ASSERT_EQ(0, daemon.stop());

    leaveHalfBuiltContainer(daemon, kGlobalStaging, "0A1B2C3D-0000-4000-8000-000000000001");
    leaveHalfBuiltContainer(daemon, kUserStaging, "0A1B2C3D-0000-4000-8000-000000000002");
    writeRootFile(daemon, std::string(kDeathRow) + "/temp.crashed/leftover/file", "dead");

    std::string trace = daemon.at("durable.trace");
    // Numbered from start-up: the clean-up may run before or after the first client message.
    ASSERT_TRUE(daemon.start({"VESSELD_DURABLE_TRACE=" + trace, "VESSELD_KILL_SCOPE=startup"}))
        << readFile(daemon.at("vesseld.stderr"));
    ASSERT_TRUE(waitForNotification(daemon, kCleanupCompleteNotification));
    EXPECT_EQ(std::vector<std::string>{}, entriesOf(daemon.at(kGlobalStaging)));
    EXPECT_EQ(std::vector<std::string>{}, entriesOf(daemon.at(kUserStaging)));
    EXPECT_EQ(std::vector<std::string>{}, entriesOf(daemon.at(kDeathRow))) << "death row destroyed before the post";

    // Scripts wait the same way.
    std::string out, err;
    EXPECT_EQ(0, runProgram({vesselctlPath(), "--root", daemon.root(), "wait", kCleanupCompleteNotification,
                             "--timeout", "60"}, &out, &err)) << err;
    EXPECT_EQ(1, runProgram({vesselctlPath(), "--root", daemon.root(), "wait", "com.example.never-posted",
                             "--timeout", "0"}, &out, &err));
    EXPECT_NE(std::string::npos, err.find("was not posted")) << err;

    // Through death row: each staged item was renamed into it, not removed in place.
    std::string steps = readFile(trace);
    for (const char* staging : {kGlobalStaging, kUserStaging}) {
        std::string from = fs::canonical(daemon.at(staging)).string() + "/0A1B2C3D";
        size_t at = steps.find("rename " + from);
        ASSERT_NE(std::string::npos, at) << staging << "\n" << steps;
        std::string line = steps.substr(at, steps.find('\n', at) - at);
        EXPECT_NE(std::string::npos, line.find("/Dead/temp.")) << line;
    }
}

// Destroying a big death row is background work: clients are answered meanwhile.
TEST(StartupCleanup, ClientsAreServedWhileABigDeathRowIsDestroyed) {
    DaemonProcess daemon;
    std::string admin = daemon.addClient("admin", "com.example.admin",
                                         vsl::dict({{"com.tarrow.private.Vesselry.allowed", vsl::Value::boolean(true)}}));
    ASSERT_FALSE(admin.empty());
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_TRUE(waitForNotification(daemon, kCleanupCompleteNotification));
    ASSERT_EQ(0, daemon.stop());

    const std::string tree = daemon.at(std::string(kDeathRow) + "/temp.big/tree");
    for (int d = 0; d < 50; d++) {
        std::string dir = tree + "/" + std::to_string(d);
        fs::create_directories(dir);
        for (int f = 0; f < 1000; f++) std::ofstream(dir + "/" + std::to_string(f)) << 'x';
    }

    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    for (int i = 0; i < 3; i++) {
        auto r = daemon.run(admin, {"--timeout", "60", "createOrLookup", "Identifier=com.example.served" + std::to_string(i),
                                    "ContainerClass=2", "CreateIfNecessary=true"});
        EXPECT_EQ(1u, r.code()) << r.err;
    }
    ASSERT_TRUE(waitForNotification(daemon, kCleanupCompleteNotification, std::chrono::seconds(600)));
    EXPECT_EQ(std::vector<std::string>{}, entriesOf(daemon.at(kDeathRow)));
}
