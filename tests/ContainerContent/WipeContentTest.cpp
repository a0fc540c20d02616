// End to end: wiping the content of a data container through a real daemon. The
// container keeps its identity, UUID and place; its old content leaves through death
// row and a fresh skeleton takes its place. Who may wipe what.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Client/VSLContent.h"
#include "ContainerContent/ContentSupport.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
namespace fs = std::filesystem;

namespace {

const char* const kWidget = "com.example.app.widget";
const char* const kOtherWidget = "com.example.other.widget";

struct Container {
    std::string uuid;
    std::string path;
};

class WipeContent : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowedEntitlement, Value::boolean(true)}}));
        wiper = daemon.addClient(
            "wiper", "com.example.wiper",
            dict({{"com.tarrow.private.Vesselry.wipeContainer", Value::array({Value::string(kWidget)})}}));
        eraser = daemon.addClient("eraser", "com.example.eraser",
                                  dict({{"com.tarrow.private.Vesselry.deleteContainerContent", Value::boolean(true)}}));
        ASSERT_FALSE(admin.empty() || wiper.empty() || eraser.empty());
        ASSERT_TRUE(daemon.registerProgram(
            "/proc/self/exe", "tester", "com.example.tester",
            dict({{"com.tarrow.private.Vesselry.deleteContainerContent", Value::boolean(true)}})));
        ASSERT_TRUE(daemon.start({"VESSELD_DURABLE_TRACE=" + trace()})) << readFile(daemon.at("vesseld.stderr"));
    }

    Container lookUp(const std::string& identifier, uint64_t containerClass, bool create = false) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                    "ContainerClass=" + std::to_string(containerClass),
                                    std::string("CreateIfNecessary=") + (create ? "true" : "false")});
        EXPECT_EQ(1u, r.code()) << identifier << r.err;
        return Container{r.uuid(), r.string("ReplyPath")};
    }

    // Old content: a file, a tree, and a skeleton directory gone missing.
    void dirty(const Container& c) {
        std::ofstream(c.path + "/Documents/old.txt") << "old content";
        fs::create_directories(c.path + "/Junk/deep");
        std::ofstream(c.path + "/Junk/deep/old.txt") << "old content";
        fs::remove_all(c.path + "/tmp");
    }

    // What is left of old content anywhere under the root, once death row is drained.
    bool oldContentGone() {
        for (int i = 0; i < 3000; i++) {
            bool found = false;
            std::error_code ec;
            for (auto it = fs::recursive_directory_iterator(daemon.root(), ec); it != fs::recursive_directory_iterator();
                 it.increment(ec))
                if (it->path().filename() == "old.txt") found = true;
            if (!found) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        return false;
    }

    std::string trace() const { return daemon.root() + "/durable.trace"; }
    std::string deathRow() const { return daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld/Dead"); }

    DaemonProcess daemon;
    std::string admin, wiper, eraser;
};

}  // namespace

TEST_F(WipeContent, AWipeListLetsAClientWipeItsPlugInContainerAndNothingElse) {
    Container widget = lookUp(kWidget, 4, true);
    Container other = lookUp(kOtherWidget, 4, true);
    Container app = lookUp("com.example.app", 2, true);
    ASSERT_FALSE(widget.path.empty() || other.path.empty() || app.path.empty());
    const auto freshSkeleton = treeState(lookUp("com.example.fresh.widget", 4, true).path, false);
    dirty(widget);
    dirty(other);
    dirty(app);
    const auto otherBefore = treeState(other.path);
    const auto appBefore = treeState(app.path);

    // Outside its list, and command 12 without its entitlement: 55, nothing touched.
    EXPECT_EQ(55u, daemon.run(wiper, {"wipe", kOtherWidget}).code());
    EXPECT_EQ(55u, daemon.run(wiper, {"wipe-content", "com.example.app", "2"}).code());
    EXPECT_EQ(55u, daemon.run(wiper, {"wipe-content", kWidget, "4"}).code());
    EXPECT_EQ(otherBefore, treeState(other.path));
    EXPECT_EQ(appBefore, treeState(app.path));
    // No identifier: 18.
    EXPECT_EQ(18u, daemon.run(wiper, {"wipeContainer"}).code());

    std::string out, err;
    ASSERT_EQ(0, runProgram({wiper, "--root", daemon.root(), "--json", "wipe", kWidget}, &out, &err)) << out << err;
    EXPECT_NE(std::string::npos, out.find("\"ReplyError\":1")) << out;

    Container after = lookUp(kWidget, 4);
    EXPECT_EQ(widget.uuid, after.uuid);
    EXPECT_EQ(widget.path, after.path);
    EXPECT_EQ(freshSkeleton, treeState(after.path, false)) << "the content is a fresh skeleton";
    // The old content went to death row and was destroyed there.
    std::string renames = readFile(trace());
    EXPECT_NE(std::string::npos, renames.find("-> " + deathRow())) << renames;
    std::error_code ec;
    fs::remove(other.path + "/Documents/old.txt", ec);
    fs::remove_all(other.path + "/Junk", ec);
    fs::remove_all(app.path + "/Documents/old.txt", ec);
    fs::remove_all(app.path + "/Junk", ec);
    EXPECT_TRUE(oldContentGone());
}

TEST_F(WipeContent, TheDeleteContentEntitlementWipesAnyDataContainer) {
    Container app = lookUp("com.example.app", 2, true);
    ASSERT_FALSE(app.path.empty());
    const auto freshSkeleton = treeState(lookUp("com.example.fresh", 2, true).path, false);
    dirty(app);

    std::string error;
    auto connection = client::VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(connection) << error;
    // The eraser may not use the wipe list's command.
    EXPECT_EQ(55u, daemon.run(eraser, {"wipe", "com.example.app"}).code());
    // A class that holds no user data cannot be wiped (11), nor a class that does not exist.
    EXPECT_EQ(11u, daemon.run(eraser, {"wipe-content", "com.example.app", "1"}).code());
    EXPECT_NE(1u, daemon.run(eraser, {"wipe-content", "com.example.app", "99"}).code());
    EXPECT_EQ(21u, daemon.run(eraser, {"wipe-content", "com.example.absent", "2"}).code());

    ASSERT_EQ(1u, client::replyCode(client::deleteContainerContent(*connection, "com.example.app", 2)));
    Container after = lookUp("com.example.app", 2);
    EXPECT_EQ(app.uuid, after.uuid);
    EXPECT_EQ(app.path, after.path);
    EXPECT_EQ(freshSkeleton, treeState(after.path, false));
    EXPECT_TRUE(oldContentGone());
}
