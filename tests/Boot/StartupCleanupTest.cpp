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
    ASSERT_TRUE(daemon.start({"VESSELD_DURABLE_TRACE=" + trace})) << readFile(daemon.at("vesseld.stderr"));
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
