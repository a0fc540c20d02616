// End to end: commands whose clients name paths inside a container (shared-content
// staging, the user-managed assets directory and the removal of assets), through a
// real daemon. Every refusal leaves the container and whatever a path pointed at
// exactly as they were.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "Client/VSLContent.h"
#include "ContainerContent/ContentSupport.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
namespace fs = std::filesystem;

namespace {

const char* const kGroup = "systemgroup.com.example.shared";
const char* const kApp = "com.example.app";
const char* const kStageEntitlement = "com.tarrow.private.Vesselry.stageSharedContent";
const char* const kAssetsEntitlement = "com.tarrow.private.Vesselry.userManagedAssets";
const char* const kSystemGroups = "com.tarrow.security.system-groups";

class PathsInsideContainers : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowedEntitlement, Value::boolean(true)}}));
        stager = daemon.addClient("stager", "com.example.stager",
                                  dict({{kStageEntitlement, Value::boolean(true)},
                                        {kSystemGroups, Value::array({Value::string(kGroup)})}}));
        stranger = daemon.addClient("stranger", "com.example.stranger",
                                    dict({{kStageEntitlement, Value::boolean(true)},
                                          {kSystemGroups, Value::array({Value::string("systemgroup.com.example.x")})}}));
        assets = daemon.addClient("assets", "com.example.installer", dict({{kAssetsEntitlement, Value::boolean(true)}}));
        unentitled = daemon.addClient("unentitled", "com.example.other", dict({}));
        ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "tester", kApp,
                                           dict({{kAssetsEntitlement, Value::boolean(true)}})));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        outside = daemon.at("outside");
        fs::create_directories(outside + "/dir");
        std::ofstream(outside + "/dir/precious") << "keep me";
        std::ofstream(outside + "/file") << "keep me too";
    }

    std::string create(const std::string& identifier, uint64_t containerClass) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                    "ContainerClass=" + std::to_string(containerClass), "CreateIfNecessary=true"});
        EXPECT_EQ(1u, r.code()) << r.err;
        return r.string("ReplyPath");
    }

    // vesselctl's --json output.
    std::string json(const std::string& client, std::vector<std::string> args) {
        args.insert(args.begin(), {client, "--root", daemon.root(), "--json"});
        std::string out, err;
        EXPECT_EQ(0, runProgram(args, &out, &err)) << out << err;
        return out;
    }

    DaemonProcess daemon;
    std::string admin, stager, stranger, assets, unentitled, outside;
};

}  // namespace

TEST_F(PathsInsideContainers, SharedContentMovesInsideItsSystemGroupContainerOnly) {
    const std::string group = create(kGroup, 13);
    ASSERT_FALSE(group.empty());
    fs::create_directories(group + "/Incoming/tree/sub");
    std::ofstream(group + "/Incoming/tree/sub/data") << "shared";
    ::symlink(outside.c_str(), (group + "/Incoming/absolute").c_str());
    ::symlink("../../../outside", (group + "/Incoming/relative").c_str());
    fs::create_directories(group + "/Shared");

    // Refusals: each leaves the container and the outside as they were.
    const auto groupBefore = treeState(group);
    const auto outsideBefore = treeState(outside);
    auto refused = [&](const std::string& client, const std::vector<std::string>& args) {
        auto r = daemon.run(client, args);
        EXPECT_EQ(groupBefore, treeState(group));
        EXPECT_EQ(outsideBefore, treeState(outside));
        return r.code();
    };
    // ".." is refused before anything is looked up, even for a group nobody has.
    EXPECT_EQ(38u, refused(stager, {"stage-shared", "systemgroup.com.example.none", "Incoming/../x", "Shared/x"}));
    EXPECT_EQ(38u, refused(stager, {"stage-shared", kGroup, "Incoming/tree", "Shared/../../x"}));
    EXPECT_EQ(55u, refused(stranger, {"stage-shared", kGroup, "Incoming/tree", "Shared/tree"}));
    EXPECT_EQ(55u, refused(admin, {"stage-shared", kGroup, "Incoming/tree", "Shared/tree"}));
    EXPECT_EQ(11u, refused(stager, {"stageSharedContent", std::string("Identifier=") + kGroup, "DestPath=Shared/x"}));
    EXPECT_EQ(10u, refused(stager, {"stage-shared", kGroup, "Incoming/absolute", "Shared/stolen"}));
    EXPECT_EQ(10u, refused(stager, {"stage-shared", kGroup, "Incoming/relative", "Shared/stolen"}));
    EXPECT_EQ(10u, refused(stager, {"stage-shared", kGroup, "Incoming/tree", "Incoming/absolute/planted"}));
    // The container itself is no source.
    EXPECT_EQ(10u, refused(stager, {"stage-shared", kGroup, "", "Shared/all"}));

    std::string error;
    std::string out = json(stager, {"stage-shared", kGroup, "Incoming/tree", "Shared/tree"});
    EXPECT_NE(std::string::npos, out.find("\"ReplyPath\":\"" + group + "/Shared/tree\"")) << out;
    auto r = daemon.run(stager, {"stage-shared", kGroup, "Shared/tree", "Shared/moved"});
    ASSERT_EQ(1u, r.code()) << r.err;
    EXPECT_EQ(group + "/Shared/moved", r.string("ReplyPath"));
    EXPECT_EQ("shared", readFile(group + "/Shared/moved/sub/data"));
    EXPECT_FALSE(fs::exists(group + "/Incoming/tree"));
    EXPECT_EQ(outsideBefore, treeState(outside));
}

TEST_F(PathsInsideContainers, TheAssetsDirectoryIsMadeOnceAndSurvivesARestart) {
    const std::string app = create(kApp, 2);
    ASSERT_FALSE(app.empty());
    std::string error;
    auto connection = client::VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(connection) << error;

    const auto before = treeState(app);
    EXPECT_EQ(71u, client::replyCode(client::userManagedAssetsPath(*connection, std::nullopt, true, false)));
    EXPECT_EQ(38u, daemon.run(unentitled, {"assets-path", kApp, "--create"}).code());
    EXPECT_EQ(before, treeState(app)) << "refusals make nothing";

    auto made = client::userManagedAssetsPath(*connection, std::nullopt, true, true);
    ASSERT_EQ(1u, client::replyCode(made));
    const std::string relative = *made.body.find("ReplyPath")->stringValue();
    EXPECT_EQ(Value::boolean(false), *made.body.find("ReplyExisted"));
    ASSERT_EQ(0u, relative.rfind("Library/com.tarrow.UserManagedAssets.", 0)) << relative;
    struct stat st;
    ASSERT_EQ(0, ::lstat((app + "/" + relative).c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0755u, st.st_mode & 07777);
    struct stat container;
    ASSERT_EQ(0, ::lstat(app.c_str(), &container));
    EXPECT_EQ(container.st_uid, st.st_uid);
    EXPECT_EQ(container.st_gid, st.st_gid);

    auto again = daemon.run(assets, {"assets-path", kApp});
    ASSERT_EQ(1u, again.code()) << again.err;
    EXPECT_TRUE(again.existed());
    EXPECT_EQ(app + "/" + relative, again.string("ReplyPath"));

    ASSERT_EQ(0, daemon.stop());
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    std::string restarted = json(assets, {"assets-path", kApp, "--relative"});
    EXPECT_NE(std::string::npos, restarted.find("\"ReplyPath\":\"" + relative + "\"")) << restarted;
    EXPECT_NE(std::string::npos, restarted.find("\"ReplyExisted\":true")) << restarted;
    int assetDirectories = 0;
    for (const auto& e : fs::directory_iterator(app + "/Library"))
        assetDirectories += e.path().filename().string().rfind("com.tarrow.UserManagedAssets.", 0) == 0;
    EXPECT_EQ(1, assetDirectories);
}

TEST_F(PathsInsideContainers, AssetRemovalStaysStrictlyInsideTheAssetsDirectory) {
    const std::string app = create(kApp, 2);
    ASSERT_FALSE(app.empty());
    // No assets directory yet: 11.
    EXPECT_EQ(11u, daemon.run(assets, {"assets-delete", kApp, "x"}).code());
    auto made = daemon.run(assets, {"assets-path", kApp, "--create"});
    ASSERT_EQ(1u, made.code()) << made.err;
    const std::string dir = made.string("ReplyPath");
    std::ofstream(dir + "/file") << "asset";
    fs::create_directories(dir + "/tree/deeper");
    std::ofstream(dir + "/tree/deeper/data") << "asset";
    fs::create_directories(dir + "/keep");
    ::symlink((outside + "/dir").c_str(), (dir + "/escape").c_str());
    ::symlink("../../Documents", (dir + "/up").c_str());
    std::ofstream(app + "/Documents/mine") << "not an asset";

    const auto appBefore = treeState(app);
    const auto outsideBefore = treeState(outside);
    for (const std::string path : {"", ".", "keep/..", "../", "../../Documents/mine", "escape", "escape/precious",
                                   "up", "up/mine", "absent"}) {
        EXPECT_EQ(10u, daemon.run(assets, {"deleteUserManagedAsset", std::string("Identifier=") + kApp,
                                           "SourcePath:str=" + path})
                           .code())
            << "'" << path << "'";
        EXPECT_EQ(appBefore, treeState(app)) << path;
        EXPECT_EQ(outsideBefore, treeState(outside)) << path;
    }
    EXPECT_EQ(11u, daemon.run(assets, {"deleteUserManagedAsset", std::string("Identifier=") + kApp}).code());

    std::string error;
    auto connection = client::VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(connection) << error;
    EXPECT_EQ(1u, client::replyCode(client::deleteUserManagedAsset(*connection, kApp, "file")));
    EXPECT_NE(std::string::npos, json(assets, {"assets-delete", kApp, "tree"}).find("\"ReplyError\":1"));
    EXPECT_FALSE(fs::exists(dir + "/file"));
    EXPECT_FALSE(fs::exists(dir + "/tree"));
    EXPECT_TRUE(fs::exists(dir + "/keep"));
    EXPECT_EQ("not an asset", readFile(app + "/Documents/mine"));

    // The assets directory swapped for a link to elsewhere: nothing there is an asset.
    const auto outsideNow = treeState(outside);
    fs::rename(dir, dir + ".moved");
    ASSERT_EQ(0, ::symlink(outside.c_str(), dir.c_str()));
    EXPECT_EQ(10u, daemon.run(assets, {"assets-delete", kApp, "file"}).code());
    EXPECT_EQ(10u, daemon.run(assets, {"assets-delete", kApp, "dir"}).code());
    EXPECT_EQ(outsideNow, treeState(outside));
}
