// End to end: an installer swaps a prepared container in for the old one through a
// real daemon (command 2), refused swaps change nothing, and a start settles the
// swaps a crash interrupted.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <set>

#include "Client/VSLConnection.h"
#include "Client/VSLReplaceContainer.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/PropertyList.h"
#include "Support/Boot.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
namespace fs = std::filesystem;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";
const char* const kApp = "com.example.app";

struct Made {
    Uuid uuid;
    std::string path;
};

class ReplaceContainer : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowed, Value::boolean(true)}}));
        ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "installer", "com.example.installer",
                                           dict({{kAllowed, Value::boolean(true)}})));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    }

    Made create(uint64_t containerClass, bool transient, const std::string& identifier = kApp) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                    "ContainerClass=" + std::to_string(containerClass), "CreateIfNecessary=true",
                                    std::string("Transient=") + (transient ? "true" : "false")});
        EXPECT_EQ(1u, r.code()) << r.err;
        return Made{Uuid::parse(r.uuid()).value_or(Uuid{}), r.string("ReplyPath")};
    }
    DaemonProcess::CtlResult lookUp(uint64_t containerClass, const std::string& identifier = kApp) {
        return daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                  "ContainerClass=" + std::to_string(containerClass)});
    }
    std::vector<std::string> replaceArgs(const Made& old, uint64_t oldClass, const Made& fresh, uint64_t newClass) {
        return {"replace",
                std::string("OldIdentifier=") + kApp,
                "OldContainerClass=" + std::to_string(oldClass),
                "OldContainerUUID=" + old.uuid.string(),
                std::string("NewIdentifier=") + kApp,
                "NewContainerClass=" + std::to_string(newClass),
                "NewContainerUUID=" + fresh.uuid.string()};
    }

    std::string deathRow() const { return daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld/Dead"); }
    std::string replaceDirectory() const { return daemon.at("private/var/root/Library/Vesselry/Replace"); }

    DaemonProcess daemon;
    std::string admin;
};

void writeText(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

std::string readText(const std::string& path) {
    std::ifstream in(path);
    return std::string((std::istreambuf_iterator<char>(in)), {});
}

// Every path below `directory` with its file contents ("" for directories): what a
// refused replacement must leave exactly as it was.
std::map<std::string, std::string> snapshot(const std::string& directory) {
    std::map<std::string, std::string> out;
    std::error_code ec;
    if (!fs::exists(directory, ec)) return out;
    for (auto it = fs::recursive_directory_iterator(directory, ec); it != fs::recursive_directory_iterator();
         it.increment(ec))
        out[it->path().string()] = it->is_regular_file() ? readText(it->path().string()) : "";
    return out;
}

// The paths below `directory` whose last component is `name`.
std::vector<std::string> findNamed(const std::string& directory, const std::string& name) {
    std::vector<std::string> out;
    for (const auto& [path, contents] : snapshot(directory))
        if (fs::path(path).filename() == name) out.push_back(path);
    return out;
}

void writeJournal(const std::string& path, const std::string& old, const std::string& fresh,
                  const std::string& staging, const std::string& destination) {
    VSLErrorRef error;
    ASSERT_TRUE(VSL_writeToURL(dict({{"VSLReplaceOperationOldURL", Value::string(old)},
                                     {"VSLReplaceOperationNewURL", Value::string(fresh)},
                                     {"VSLReplaceOperationStagingURL", Value::string(staging)},
                                     {"VSLReplaceOperationDestURL", Value::string(destination)}}),
                               path, kVSLWriteAtomic, &error));
}

}  // namespace

TEST_F(ReplaceContainer, AnInstallerUpdateSwapsThePreparedContainerIn) {
    Made old = create(2, false);
    writeText(old.path + "/Documents/old.txt", "old content");
    Made fresh = create(2, true);
    writeText(fresh.path + "/Documents/new.txt", "new content");
    ASSERT_NE(old.uuid, fresh.uuid);

    std::string error;
    auto connection = client::VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(connection) << error;
    client::VSLContainerReference oldReference{kApp, 2, old.uuid, std::nullopt};
    client::VSLContainerReference newReference{kApp, 2, fresh.uuid, std::nullopt};
    ASSERT_EQ(1u, client::replaceContainer(*connection, oldReference, newReference, &error)) << error;

    // The new container sits in the permanent class directory under its own directory
    // name, and lookups answer with its UUID.
    std::string expected = fs::path(old.path).parent_path().string() + "/" + fs::path(fresh.path).filename().string();
    auto found = lookUp(2);
    ASSERT_EQ(1u, found.code());
    EXPECT_EQ(expected, found.string("ReplyPath"));
    EXPECT_EQ(fresh.uuid.string(), found.uuid());
    EXPECT_EQ("new content", readText(expected + "/Documents/new.txt"));
    EXPECT_FALSE(fs::exists(old.path));
    EXPECT_FALSE(fs::exists(fresh.path));

    // The old container went to death row with its journal, and the Replace directory
    // holds nothing.
    auto parked = findNamed(deathRow(), "old.txt");
    ASSERT_EQ(1u, parked.size());
    EXPECT_EQ("old content", readText(parked[0]));
    size_t journals = 0;
    for (const auto& [path, contents] : snapshot(deathRow())) journals += fs::path(path).extension() == ".plist" &&
                                                                        fs::path(path).parent_path().parent_path() == deathRow();
    EXPECT_EQ(1u, journals);
    EXPECT_TRUE(snapshot(replaceDirectory()).empty());

    // Destroying death row removes the old content; the new container stays.
    ASSERT_EQ(1u, daemon.run(admin, {"deleteContainersOnDeathRow"}).code());
    EXPECT_TRUE(findNamed(deathRow(), "old.txt").empty());
    // The same answers after a restart, from the disk alone.
    ASSERT_EQ(0, daemon.stop());
    ASSERT_TRUE(daemon.start());
    found = lookUp(2);
    EXPECT_EQ(expected, found.string("ReplyPath"));
    EXPECT_EQ(fresh.uuid.string(), found.uuid());
}

TEST_F(ReplaceContainer, RefusedReplacementsChangeNothing) {
    Made old = create(2, false);
    writeText(old.path + "/Documents/old.txt", "old content");
    Made fresh = create(2, true);
    Made other = create(4, true, "com.example.app.widget");
    auto containers = daemon.at("private/var/mobile/Containers");
    auto before = snapshot(containers);
    auto deathRowBefore = snapshot(deathRow());
    auto replaceBefore = snapshot(replaceDirectory());

    auto r = daemon.run(admin, replaceArgs(old, 2, old, 2));
    EXPECT_EQ(22u, r.code()) << "a container in its own place";
    std::string json, jsonErr;
    int status = runProgram({admin, "--root", daemon.root(), "--json", "replace", std::string("OldIdentifier=") + kApp,
                             "OldContainerClass=2", "OldContainerUUID=" + old.uuid.string(),
                             "NewIdentifier=com.example.app.widget", "NewContainerClass=4",
                             "NewContainerUUID=" + other.uuid.string()},
                            &json, &jsonErr);
    EXPECT_EQ(1, status) << "another class";
    EXPECT_NE(std::string::npos, json.find("\"error\":23")) << json << jsonErr;
    // Promotion of the transient container while the permanent one exists.
    r = daemon.run(admin, {"replace", std::string("NewIdentifier=") + kApp, "NewContainerClass=2",
                           "NewContainerUUID=" + fresh.uuid.string()});
    EXPECT_EQ(27u, r.code());
    EXPECT_EQ(21u, daemon.run(admin, replaceArgs(Made{Uuid::random(), ""}, 2, fresh, 2)).code()) << "unknown old";

    // Bad input: wrongly typed or missing keys read as absent.
    r = daemon.run(admin, {"replace", std::string("OldIdentifier=") + kApp, "OldContainerClass=2",
                           "OldContainerUUID:str=" + old.uuid.string(), std::string("NewIdentifier=") + kApp,
                           "NewContainerClass=2", "NewContainerUUID=" + fresh.uuid.string()});
    EXPECT_EQ(11u, r.code()) << "an old UUID sent as text";
    r = daemon.run(admin, {"replace", std::string("NewIdentifier=") + kApp, "NewContainerClass=2"});
    EXPECT_EQ(11u, r.code()) << "no new UUID";
    r = daemon.run(admin, {"replace", "NewIdentifier:u64=7", "NewContainerClass=2",
                           "NewContainerUUID=" + fresh.uuid.string()});
    EXPECT_EQ(18u, r.code()) << "a numeric identifier is no identifier";
    r = daemon.run(admin, {"replace", std::string("NewIdentifier=") + kApp, "NewContainerClass:str=2",
                           "NewContainerUUID=" + fresh.uuid.string()});
    EXPECT_NE(1u, r.code()) << "a class sent as text";

    EXPECT_EQ(before, snapshot(containers));
    EXPECT_EQ(deathRowBefore, snapshot(deathRow()));
    EXPECT_EQ(replaceBefore, snapshot(replaceDirectory()));
    auto found = lookUp(2);
    EXPECT_EQ(old.uuid.string(), found.uuid());
    EXPECT_EQ(old.path, found.string("ReplyPath"));
    // The transient one still answers to its UUID: replacing it now works.
    EXPECT_EQ(1u, daemon.run(admin, replaceArgs(old, 2, fresh, 2)).code());

    std::string help;
    runProgram({vesselctlPath(), "--help"}, &help, nullptr);
    for (const char* key : {"replace", "OldIdentifier", "OldContainerClass", "OldContainerUUID",
                            "OldPersonaUniqueString", "NewIdentifier", "NewContainerClass", "NewContainerUUID",
                            "NewPersonaUniqueString"})
        EXPECT_NE(std::string::npos, help.find(key)) << key;
}

TEST_F(ReplaceContainer, ABundleReplacementDropsTheOldCodeSigningInformation) {
    std::string infoPath = daemon.at("info.plist");
    std::string childOptions = daemon.at("child-options.plist");
    VSLErrorRef error;
    ASSERT_TRUE(VSL_writeToURL(dict({{"com.tarrow.Vesselry.Entitlements", dict({})}}), infoPath, kVSLWriteAtomic,
                               &error));
    ASSERT_TRUE(VSL_writeToURL(dict({{"com.tarrow.Vesselry.ParentBundleID", Value::string(kApp)}}), childOptions,
                               kVSLWriteAtomic, &error));
    ASSERT_EQ(1u, daemon.run(admin, {"processCodeSigningInfo", std::string("Identifier=") + kApp,
                                     "CodeSigningInfo=@" + infoPath}).code());
    ASSERT_EQ(1u, daemon.run(admin, {"processCodeSigningInfo", "Identifier=com.example.app.widget",
                                     "CodeSigningInfo=@" + infoPath, "OptionsDictionary=@" + childOptions}).code());
    ASSERT_EQ(1u, daemon.run(admin, {"processCodeSigningInfo", "Identifier=com.example.bystander",
                                     "CodeSigningInfo=@" + infoPath}).code());
    Made old = create(1, false);
    Made fresh = create(1, true);

    auto r = daemon.run(admin, replaceArgs(old, 1, fresh, 1));
    ASSERT_EQ(1u, r.code()) << r.out << r.err;
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", std::string("Identifier=") + kApp}).code());
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.app.widget"}).code())
        << "the child goes with its parent";
    EXPECT_EQ(1u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.bystander"}).code());
    EXPECT_EQ(fresh.uuid.string(), lookUp(1).uuid());
}

TEST_F(ReplaceContainer, AStartSettlesEveryCrashState) {
    Made untouched = create(2, false, "com.example.untouched");
    Made rolledBack = create(2, false, "com.example.rolledback");
    writeText(rolledBack.path + "/Documents/keep.txt", "kept");
    Made hostile = create(2, false, "com.example.hostile");
    ASSERT_EQ(0, daemon.stop());

    std::string staging = daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld/Staging");
    fs::create_directories(staging);
    fs::create_directories(replaceDirectory());
    std::string classDirectory = fs::path(untouched.path).parent_path().string();

    // Crash before the old container left: the old place is occupied; its staging
    // location holds something that must not move.
    std::string strayStaging = staging + "/" + Uuid::random().string();
    fs::create_directories(strayStaging + "/marker");
    writeJournal(replaceDirectory() + "/" + Uuid::random().string() + ".plist", untouched.path,
                 classDirectory + "/" + Uuid::random().string(), strayStaging,
                 classDirectory + "/" + Uuid::random().string());
    // Crash with the old container in staging and nothing at the destination.
    std::string parked = staging + "/" + Uuid::random().string();
    fs::rename(rolledBack.path, parked);
    writeJournal(replaceDirectory() + "/" + Uuid::random().string() + ".plist", rolledBack.path,
                 classDirectory + "/" + Uuid::random().string(), parked,
                 classDirectory + "/" + Uuid::random().string());
    // Crash after the new container arrived: rolled forward, the staged old one stays
    // for the staging clean-up.
    std::string forwardOld = classDirectory + "/" + Uuid::random().string();
    std::string forwardStaging = staging + "/" + Uuid::random().string();
    fs::create_directories(forwardStaging + "/marker");
    writeJournal(replaceDirectory() + "/" + Uuid::random().string() + ".plist", forwardOld,
                 classDirectory + "/" + Uuid::random().string(), forwardStaging, untouched.path);
    // Journals that cannot be trusted: garbage, a wrong type, a path climbing out.
    writeText(replaceDirectory() + "/" + Uuid::random().string() + ".plist", "not a property list");
    VSLErrorRef error;
    ASSERT_TRUE(VSL_writeToURL(dict({{"VSLReplaceOperationOldURL", Value::uint64(3)}}),
                               replaceDirectory() + "/" + Uuid::random().string() + ".plist", kVSLWriteAtomic,
                               &error));
    std::string hostileParked = staging + "/" + Uuid::random().string();
    fs::rename(hostile.path, hostileParked);
    writeJournal(replaceDirectory() + "/" + Uuid::random().string() + ".plist", classDirectory + "/../x/..",
                 classDirectory + "/" + Uuid::random().string(), hostileParked,
                 classDirectory + "/" + Uuid::random().string());

    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    // What recovery leaves in staging is the every-start clean-up's: wait for it.
    ASSERT_TRUE(waitForNotification(daemon, client::kCleanupCompleteNotification));
    EXPECT_FALSE(fs::exists(untouched.path + "/marker")) << "nothing moved for a replacement that never started";
    EXPECT_EQ(untouched.uuid.string(), lookUp(2, "com.example.untouched").uuid());
    auto back = lookUp(2, "com.example.rolledback");
    ASSERT_EQ(1u, back.code());
    EXPECT_EQ(rolledBack.uuid.string(), back.uuid()) << "the staged container is back with its UUID";
    EXPECT_EQ(rolledBack.path, back.string("ReplyPath"));
    EXPECT_EQ("kept", readText(rolledBack.path + "/Documents/keep.txt"));
    EXPECT_FALSE(fs::exists(parked));
    EXPECT_FALSE(fs::exists(forwardOld)) << "a finished replacement is not undone";
    EXPECT_FALSE(fs::exists(classDirectory + "/x")) << "an untrusted journal moves nothing";
    EXPECT_TRUE(snapshot(staging).empty()) << "staged leftovers went to death row";
    EXPECT_TRUE(snapshot(replaceDirectory()).empty()) << "every journal went to death row";
}
