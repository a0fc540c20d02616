// End to end: clients create, find, list and delete containers through a real
// daemon, and the result is checked on disk.
#include <gtest/gtest.h>
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <set>
#include <thread>

#include "Platform/FileFlags.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

class Containers : public ::testing::Test {
protected:
    void SetUp() override {
        app = daemon.addClient("app", "com.example.app", Value::dictionary({}));
        admin = daemon.addClient("admin", "com.example.admin",
                                 dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    }
    DaemonProcess daemon;
    std::string app, admin;
};

}  // namespace

TEST_F(Containers, OwnDataContainerIsMadeOnceAndFoundAgain) {
    auto made = daemon.run(app, {"createOrLookup", "ContainerClass=2", "CreateIfNecessary=true"});
    ASSERT_EQ(1u, made.code()) << made.err;
    EXPECT_FALSE(made.existed());
    EXPECT_EQ("com.example.app", made.string("ReplyIdentifier")) << "no Identifier: the client's own";
    std::string path = made.string("ReplyPath");
    EXPECT_EQ(0u, path.find(daemon.at("private/var/mobile/Containers/Data/Application/")));
    EXPECT_FALSE(made.reply.find("ReplySandboxToken")) << "not sandboxed: no token";

    struct stat st;
    ASSERT_EQ(0, ::stat(path.c_str(), &st));
    EXPECT_EQ(0755u, st.st_mode & 07777);
    for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp", "SystemData"}) {
        ASSERT_EQ(0, ::stat((path + "/" + sub).c_str(), &st)) << sub;
        EXPECT_TRUE(S_ISDIR(st.st_mode)) << sub;
        EXPECT_EQ(0755u, st.st_mode & 07777) << sub;
        if (::geteuid() == 0) {
            EXPECT_EQ(501u, st.st_uid) << sub << ": owned by the mobile user";
        }
    }
    EXPECT_EQ(0, ::access((path + "/.com.tarrow.vesselry.metadata.plist").c_str(), F_OK));

    auto again = daemon.run(app, {"createOrLookup", "ContainerClass=2"});
    ASSERT_EQ(1u, again.code());
    EXPECT_TRUE(again.existed());
    EXPECT_EQ(made.uuid(), again.uuid());
    EXPECT_EQ(path, again.string("ReplyPath"));

    // The daemon forgets nothing across a restart.
    ASSERT_EQ(0, daemon.stop());
    ASSERT_TRUE(daemon.start());
    auto afterRestart = daemon.run(app, {"createOrLookup", "ContainerClass=2"});
    ASSERT_EQ(1u, afterRestart.code());
    EXPECT_TRUE(afterRestart.existed());
    EXPECT_EQ(made.uuid(), afterRestart.uuid());
}

TEST_F(Containers, AbsentOrForeignContainersAreRefused) {
    EXPECT_EQ(21u, daemon.run(app, {"createOrLookup", "ContainerClass=4"}).code()) << "create false, absent";
    EXPECT_EQ(55u, daemon.run(app, {"createOrLookup", "Identifier=com.example.other", "ContainerClass=2",
                                         "CreateIfNecessary=true"}).code())
        << "another identifier without rights";
    EXPECT_EQ(20u, daemon.run(app, {"createOrLookup", "ContainerClass=0"}).code());
    EXPECT_EQ(20u, daemon.run(app, {"createOrLookup", "ContainerClass=14"}).code());
    EXPECT_EQ(18u, daemon.run(admin, {"deleteContainer", "ContainerClass=2"}).code()) << "delete needs an Identifier";
    EXPECT_EQ(21u, daemon.run(admin, {"deleteContainer", "Identifier=com.example.none", "ContainerClass=2"}).code());
}

TEST_F(Containers, ConcurrentCreatorsGetOneContainer) {
    std::vector<DaemonProcess::CtlResult> results(8);
    std::vector<std::thread> threads;
    for (auto& r : results)
        threads.emplace_back([&] {
            r = daemon.run(admin, {"createOrLookup", "Identifier=com.example.shared", "ContainerClass=2",
                                   "CreateIfNecessary=true"});
        });
    for (auto& t : threads) t.join();
    std::set<std::string> uuids;
    int created = 0;
    for (auto& r : results) {
        ASSERT_EQ(1u, r.code()) << r.err;
        uuids.insert(r.uuid());
        created += r.existed() ? 0 : 1;
    }
    EXPECT_EQ(1u, uuids.size());
    EXPECT_EQ(1, created) << "exactly one caller made it";
    auto listed = daemon.run(admin, {"containersWithClass", "ContainerClass=2"});
    ASSERT_EQ(1u, listed.code());
    size_t shared = 0;
    for (const auto& id : *listed.reply.find("ReplyIdsArray")->arrayValue())
        shared += *id.stringValue() == "com.example.shared";
    EXPECT_EQ(1u, shared);
}

TEST_F(Containers, TransientRecreateAndDelete) {
    auto first = daemon.run(admin, {"createOrLookup", "Identifier=com.example.t", "ContainerClass=2", "Transient=true",
                                    "CreateIfNecessary=true"});
    ASSERT_EQ(1u, first.code()) << first.err;
    auto second = daemon.run(admin, {"createOrLookup", "Identifier=com.example.t", "ContainerClass=2",
                                     "Transient=true", "CreateIfNecessary=true"});
    ASSERT_EQ(1u, second.code());
    EXPECT_NE(first.uuid(), second.uuid()) << "a transient request never returns the old transient container";
    EXPECT_NE(0, ::access(first.string("ReplyPath").c_str(), F_OK)) << "the old one left its place for death row";

    auto made = daemon.run(admin, {"createOrLookup", "Identifier=com.example.d", "ContainerClass=2",
                                   "CreateIfNecessary=true"});
    ASSERT_EQ(1u, made.code());
    EXPECT_EQ(1u, daemon.run(admin, {"deleteContainer", "Identifier=com.example.d", "ContainerClass=2"}).code());
    EXPECT_NE(0, ::access(made.string("ReplyPath").c_str(), F_OK)) << "gone from its class directory at the reply";
    EXPECT_EQ(21u, daemon.run(admin, {"createOrLookup", "Identifier=com.example.d", "ContainerClass=2"}).code());
}

TEST_F(Containers, FailureAfterStagingLeavesNothingBehind) {
    // An immutable class directory: lookups still read it, the final move into it fails.
    auto made = daemon.run(admin, {"createOrLookup", "Identifier=com.example.first", "ContainerClass=4",
                                   "CreateIfNecessary=true"});
    ASSERT_EQ(1u, made.code());
    std::string classDir = daemon.at("private/var/mobile/Containers/Data/PluginKitPlugin");
    int fd = ::open(classDir.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(fd, 0);
    unsigned flags = 0;
    if (getFileFlags(fd, &flags) != 0 || setFileFlags(fd, classDir, flags | FS_IMMUTABLE_FL) != 0) {
        ::close(fd);
        GTEST_SKIP() << "needs root and a file system with the immutable flag";
    }
    auto r = daemon.run(admin, {"createOrLookup", "Identifier=com.example.p", "ContainerClass=4",
                                "CreateIfNecessary=true"});
    setFileFlags(fd, classDir, flags);
    ::close(fd);
    EXPECT_EQ(8u, r.code()) << r.err;

    size_t inClass = 0;
    if (auto d = opendir(classDir.c_str())) {
        while (auto e = readdir(d)) inClass += e->d_name[0] != '.';
        closedir(d);
    }
    EXPECT_EQ(1u, inClass) << "only the container made before";
    std::string staging = daemon.at("private/var/mobile/Containers/Staging");
    size_t left = 0;
    if (auto d = opendir(staging.c_str())) {
        while (auto e = readdir(d)) left += e->d_name[0] != '.';
        closedir(d);
    }
    EXPECT_EQ(0u, left) << "the staging directory went to death row";
}

TEST(DeathRow, LeftoversGoAtStartAndOnRequest) {
    DaemonProcess daemon;
    std::string dead = daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld/Dead");
    ASSERT_EQ(0, std::system(("mkdir -p '" + dead + "/LEFT-BY-A-CRASH/deep/er'").c_str()));
    std::ofstream(dead + "/LEFT-BY-A-CRASH/deep/file") << "x";
    std::string cleaner = daemon.addClient("cleaner", "com.example.cleaner",
                                           dict({{"com.tarrow.private.Vesselry.userManagedAssets", Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start());
    bool gone = false;
    for (int i = 0; i < 400 && !gone; i++) {
        gone = ::access((dead + "/LEFT-BY-A-CRASH").c_str(), F_OK) != 0;
        if (!gone) std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    EXPECT_TRUE(gone) << "items a crash left on death row are destroyed after the next start";

    ASSERT_EQ(0, std::system(("mkdir -p '" + dead + "/LATER'").c_str()));
    auto r = daemon.run(cleaner, {"deleteContainersOnDeathRow"});
    EXPECT_EQ(1u, r.code()) << r.err;
    EXPECT_EQ(1u, r.reply.dictionaryValue()->size()) << "only ReplyError, sent from the completion";
    EXPECT_NE(0, ::access((dead + "/LATER").c_str(), F_OK)) << "the reply comes after the destruction";
    EXPECT_EQ(0, ::access(dead.c_str(), F_OK)) << "death row itself stays";
}

TEST(CrashSafety, KillDuringCreationsLeavesOnlyCompleteContainers) {
    DaemonProcess daemon;
    std::string admin = daemon.addClient("admin", "com.example.admin",
                                         dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start());
    std::vector<std::thread> burst;
    for (int i = 0; i < 24; i++)
        burst.emplace_back([&, i] {
            daemon.run(admin, {"createOrLookup", "Identifier=com.example.burst" + std::to_string(i), "ContainerClass=2",
                               "CreateIfNecessary=true"});
        });
    std::this_thread::sleep_for(std::chrono::milliseconds(60));
    daemon.kill();
    for (auto& t : burst) t.join();

    ASSERT_TRUE(daemon.start());
    auto listed = daemon.run(admin, {"containersWithClass", "ContainerClass=2"});
    ASSERT_EQ(1u, listed.code()) << listed.err;
    size_t known = listed.reply.find("ReplyIdsArray")->arrayValue()->size();
    std::string classDir = daemon.at("private/var/mobile/Containers/Data/Application");
    size_t onDisk = 0;
    if (auto d = opendir(classDir.c_str())) {
        while (auto e = readdir(d)) {
            if (e->d_name[0] == '.') continue;
            onDisk++;
            std::string metadata = classDir + "/" + e->d_name + "/.com.tarrow.vesselry.metadata.plist";
            EXPECT_EQ(0, ::access(metadata.c_str(), F_OK)) << e->d_name << " is incomplete";
            EXPECT_EQ(0, ::access((classDir + "/" + e->d_name + "/Library/Preferences").c_str(), F_OK))
                << e->d_name << " lacks its skeleton";
        }
        closedir(d);
    }
    EXPECT_EQ(known, onDisk) << "every directory in the class is a container the daemon knows";
    // And every one of the burst is either complete or absent: creating again works.
    for (int i = 0; i < 24; i++) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=com.example.burst" + std::to_string(i),
                                    "ContainerClass=2", "CreateIfNecessary=true"});
        EXPECT_EQ(1u, r.code()) << i;
    }
}
