// The data-migrator migration against a real daemon: what older builds left in the
// library directory is imported, unreferenced application groups are staged, and
// clients creating containers meanwhile are neither blocked for good nor robbed of
// the groups they name.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <chrono>
#include <cstdio>
#include <future>
#include <thread>

#include "Client/VSLContainerInfo.h"
#include "Client/VSLMigration.h"
#include "Daemon/CodeSigning/VSLSQLiteDB.h"
#include "Platform/PropertyList.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using namespace vsl::client;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";
const char* const kDataMigration = "com.tarrow.private.Vesselry.dataMigration";
const char* const kLibrary = "private/var/root/Library/Vesselry/";

void writePlist(const std::string& path, const Value& value) {
    auto bytes = encodeBinaryPropertyList(value, nullptr);
    ASSERT_TRUE(bytes);
    FILE* f = std::fopen(path.c_str(), "wb");
    ASSERT_TRUE(f) << path;
    std::fwrite(bytes->data(), 1, bytes->size(), f);
    std::fclose(f);
}

bool exists(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

Value groupsEntitlements(const char* group) {
    return dict({{"com.tarrow.security.application-groups", Value::array({Value::string(group)})}});
}

class DataMigration : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowed, Value::boolean(true)}}));
        migrator = daemon.addClient("migrator", "com.example.migrator",
                                    dict({{kAllowed, Value::boolean(true)}, {kDataMigration, Value::boolean(true)}}));
        // This program, for the calls vesselctl has no words for.
        ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "tester", "com.example.tester",
                                           dict({{kAllowed, Value::boolean(true)},
                                                 {kDataMigration, Value::boolean(true)},
                                                 {"com.tarrow.private.Vesselry.testability", Value::boolean(true)}})));
        std::string library = daemon.at(kLibrary);
        for (size_t i = daemon.root().size() + 1; i < library.size(); i++)
            if (library[i] == '/') ::mkdir(library.substr(0, i).c_str(), 0755);
    }

    void layLegacyFiles() {
        // The file-based store: served after start-up once one of its entries is stored.
        auto stored = dict({{"CodeSigningInfo",
                             dict({{"com.tarrow.Vesselry.Entitlements", groupsEntitlements("group.stored")}})},
                            {"DataContainerClass", Value::uint64(2)}});
        writePlist(daemon.at(std::string(kLibrary) + "vsl_code_signing_info.plist"),
                   dict({{"com.example.stored", stored}, {"com.example.refused", stored}}));
        writePlist(
            daemon.at(std::string(kLibrary) + "vsl_entitlements.plist"),
            dict({{"com.example.legacy", groupsEntitlements("group.legacy")},
                  {"com.example.caller", groupsEntitlements("group.caller")},
                  {"com.example.broken", Value::string("not entitlements")},
                  {"com.tarrow.Vesselry.EntitlementsRegisteredByCaller",
                   dict({{"com.example.caller", Value::boolean(true)}})},
                  {"com.tarrow.Vesselry.ChildPluginBundleIDs",
                   dict({{"com.example.caller", Value::array({Value::string("com.example.caller.widget")})}})}}));
    }

    DaemonProcess::CtlResult lookup(const std::string& identifier, int containerClass, bool create = false) {
        return daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                  "ContainerClass=" + std::to_string(containerClass),
                                  std::string("CreateIfNecessary=") + (create ? "true" : "false")});
    }

    std::shared_ptr<VSLConnection> connect() {
        std::string error;
        auto c = VSLConnection::connect(daemon.socketPath(), &error);
        EXPECT_TRUE(c) << error;
        return c;
    }

    // A container made through `c` carrying one info value; its reference.
    VSLContainerRef containerWithInfo(VSLConnection& c, const std::string& identifier, int containerClass,
                                      const char* key, const Value& value) {
        auto r = lookup(identifier, containerClass, true);
        EXPECT_EQ(1u, r.code()) << r.err;
        VSLContainerRef ref{identifier, static_cast<uint64_t>(containerClass), {}, std::nullopt};
        if (auto uuid = Uuid::parse(r.uuid())) ref.uuid = *uuid;
        EXPECT_EQ(1u, replyCode(setInfoValue(c, ref, key, value))) << identifier;
        return ref;
    }

    std::string logText() { return readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log")); }
    bool waitForLog(const std::string& text) {
        for (int i = 0; i < 600 && logText().find(text) == std::string::npos; i++)
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        return logText().find(text) != std::string::npos;
    }

    DaemonProcess daemon;
    std::string admin;
    std::string migrator;
};

}  // namespace

TEST_F(DataMigration, ImportsLegacyFilesStagesUnreferencedGroupsAndChangesNothingTheSecondTime) {
    layLegacyFiles();
    std::string stranger = daemon.addClient("stranger", "com.example.stranger", Value::dictionary({}));
    const std::string mappingFile = daemon.at(std::string(kLibrary) + "vsl_code_signing_info.plist");

    // A database that refuses every write: the file-based store stays for the next start.
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_FAIL_DB_WRITES=*"})) << readFile(daemon.at("vesseld.stderr"));
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.stored"}).code());
    EXPECT_TRUE(exists(mappingFile));
    ASSERT_EQ(0, daemon.stop());

    // One entry stored is enough: served, and the file is gone.
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_FAIL_DB_WRITES=com.example.refused"}))
        << readFile(daemon.at("vesseld.stderr"));
    auto r = daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.stored"});
    ASSERT_EQ(1u, r.code()) << r.err;
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.refused"}).code());
    EXPECT_FALSE(exists(mappingFile));

    // A group somebody names and one nobody does.
    ASSERT_EQ(1u, daemon.run(admin, {"processCodeSigningInfo", "Identifier=com.example.named",
                                     "CodeSigningInfo:plist=@" + [&] {
                                         std::string p = daemon.at("named.plist");
                                         writePlist(p, dict({{"com.tarrow.Vesselry.Entitlements",
                                                              groupsEntitlements("group.named")}}));
                                         return p;
                                     }()})
                      .code());
    ASSERT_EQ(1u, lookup("group.named", 7, true).code());
    ASSERT_EQ(1u, lookup("group.orphan", 7, true).code());
    ASSERT_EQ(1u, lookup("group.legacy", 7, true).code());
    auto namedInfo = daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.named"}).reply;

    // Metadata values that older builds left: group identifiers in the legacy mobile
    // user's data containers (one of an identifier already stored) and code-signing
    // information cached in a framework's bundle container.
    auto c = connect();
    ASSERT_TRUE(c);
    const char* const kGroupIds = "com.tarrow.Stowage.GroupContainerIDs";
    const char* const kCached = "com.tarrow.Stowage.CachedCodeSigningInfo";
    auto grouped = containerWithInfo(*c, "com.example.grouped", 2, kGroupIds,
                                     Value::array({Value::string("group.fromdata")}));
    auto namedData = containerWithInfo(*c, "com.example.named", 2, kGroupIds,
                                       Value::array({Value::string("group.ignored")}));
    auto framework = containerWithInfo(*c, "com.example.framework", 8, kCached,
                                       dict({{"Entitlements", groupsEntitlements("group.framework")}}));
    ASSERT_EQ(1u, lookup("group.fromdata", 7, true).code());

    EXPECT_EQ(55u, daemon.run(stranger, {"performDataMigration"}).code());
    EXPECT_TRUE(exists(daemon.at(std::string(kLibrary) + "vsl_entitlements.plist"))) << "refused: nothing ran";

    r = daemon.run(migrator, {"migrate"});
    ASSERT_EQ(1u, r.code()) << r.err << readFile(daemon.at("vesseld.stderr"));
    EXPECT_FALSE(exists(daemon.at(std::string(kLibrary) + "vsl_entitlements.plist")));

    // Not registered by a caller: imported invalid, so never returned, but its group
    // still counts as named. Registered by a caller: returned as it was.
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.legacy"}).code());
    r = daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.caller"});
    ASSERT_EQ(1u, r.code());
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.broken"}).code());
    EXPECT_EQ(1u, lookup("group.named", 7).code());
    EXPECT_EQ(1u, lookup("group.legacy", 7).code());
    EXPECT_EQ(21u, lookup("group.orphan", 7).code()) << "unreferenced: staged";

    // Group identifiers: imported invalid, so never returned, yet their group counts
    // as named; nothing written over a stored entry; every value cleared.
    EXPECT_EQ(21u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.grouped"}).code());
    EXPECT_EQ(1u, lookup("group.fromdata", 7).code());
    EXPECT_EQ(namedInfo, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.named"}).reply);
    EXPECT_EQ(24u, replyCode(infoValueForKey(*c, grouped, kGroupIds)));
    EXPECT_EQ(24u, replyCode(infoValueForKey(*c, namedData, kGroupIds)));
    // Cached information: imported and served, the value cleared.
    r = daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.framework"});
    ASSERT_EQ(1u, r.code());
    EXPECT_NE(std::string::npos, r.out.find("group.framework"));
    EXPECT_EQ(24u, replyCode(infoValueForKey(*c, framework, kCached)));

    // The status file records the one-time steps.
    auto status = decodePropertyList(readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist")).data(),
                                     readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist")).size(),
                                     nullptr);
    ASSERT_TRUE(status);
    for (const char* type : {"ACLMigration", "BundleMigration", "GroupIdMigration", "CodeSigningMigration"})
        EXPECT_TRUE(status->find(type)) << type;

    // An entitlements file that shows up again: an identifier with only an invalid
    // entry is imported again, this time as registered by its caller.
    writePlist(daemon.at(std::string(kLibrary) + "vsl_entitlements.plist"),
               dict({{"com.example.legacy", groupsEntitlements("group.legacy")},
                     {"com.tarrow.Vesselry.EntitlementsRegisteredByCaller",
                      dict({{"com.example.legacy", Value::boolean(true)}})}}));
    ASSERT_EQ(1u, daemon.run(migrator, {"performDataMigration"}).code());
    EXPECT_EQ(1u, daemon.run(admin, {"getCodeSigningInfo", "Identifier=com.example.legacy"}).code());

    // Nothing left to do: a further run changes nothing.
    std::string before = readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist"));
    ASSERT_EQ(1u, daemon.run(migrator, {"performDataMigration"}).code());
    EXPECT_EQ(before, readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist")));
    EXPECT_EQ(1u, lookup("group.named", 7).code());
    EXPECT_EQ(1u, lookup("group.legacy", 7).code());

    // The stored records: the group import keeps its container's class, the cached
    // import of a framework (no data container of its own) has none.
    ASSERT_EQ(0, daemon.stop());
    auto db = VSLSQLiteDB::initWithParentDirectoryURL(daemon.at(kLibrary));
    ASSERT_TRUE(db);
    auto groupedEntry = db->codeSigningEntryWithIdentifier("com.example.grouped", nullptr);
    ASSERT_TRUE(groupedEntry);
    EXPECT_TRUE(groupedEntry->invalid);
    EXPECT_EQ(2u, groupedEntry->dataContainerClass);
    auto frameworkEntry = db->codeSigningEntryWithIdentifier("com.example.framework", nullptr);
    ASSERT_TRUE(frameworkEntry);
    EXPECT_EQ(0u, frameworkEntry->dataContainerClass);
}

TEST_F(DataMigration, OnAMultiUserDeviceGroupsAreNotReconciled) {
    writePlist(daemon.at("etc/vesseld/device.plist"), dict({{"MultiUser", Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_EQ(1u, lookup("group.orphan", 7, true).code());
    auto r = daemon.run(migrator, {"performDataMigration"});
    ASSERT_EQ(1u, r.code()) << r.err;
    EXPECT_EQ(1u, lookup("group.orphan", 7).code());
    auto status = decodePropertyList(readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist")).data(),
                                     readFile(daemon.at(std::string(kLibrary) + "vsl_migration_status.plist")).size(),
                                     nullptr);
    ASSERT_TRUE(status);
    EXPECT_FALSE(status->find("GroupIdMigration"));
    EXPECT_TRUE(status->find("CodeSigningMigration"));
}

TEST_F(DataMigration, ConcurrentCreationsNeitherDeadlockNorLoseTheGroupsTheyName) {
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    constexpr int kClients = 4;
    constexpr int kRounds = 6;
    std::vector<std::future<bool>> clients;
    for (int c = 0; c < kClients; c++)
        clients.push_back(std::async(std::launch::async, [this, c] {
            bool ok = true;
            for (int i = 0; i < kRounds; i++) {
                std::string id = "com.example.app" + std::to_string(c) + "." + std::to_string(i);
                std::string group = "group.live" + std::to_string(c) + "." + std::to_string(i);
                std::string info = daemon.at(id + ".plist");
                writePlist(info, dict({{"com.tarrow.Vesselry.Entitlements", groupsEntitlements(group.c_str())}}));
                ok &= daemon.run(admin, {"processCodeSigningInfo", "Identifier=" + id, "CodeSigningInfo:plist=@" + info})
                          .code() == 1;
                ok &= lookup(group, 7, true).code() == 1;
                ok &= lookup(id, 2, true).code() == 1;
            }
            return ok;
        }));
    auto migrations = std::async(std::launch::async, [this] {
        bool ok = true;
        for (int i = 0; i < 3; i++) ok &= daemon.run(migrator, {"performDataMigration"}).code() == 1;
        return ok;
    });
    // A stuck daemon is killed, so that the waiting clients return and the test fails
    // instead of hanging.
    auto answered = [this](std::future<bool>& pending) {
        if (pending.wait_for(std::chrono::seconds(120)) == std::future_status::ready) return pending.get();
        daemon.kill();
        pending.wait();
        ADD_FAILURE() << "no answer within 120 s: deadlock";
        return false;
    };
    for (auto& client : clients) EXPECT_TRUE(answered(client));
    EXPECT_TRUE(answered(migrations));
    ASSERT_TRUE(daemon.running());
    // Every group that a registration names is still there.
    for (int c = 0; c < kClients; c++)
        for (int i = 0; i < kRounds; i++) {
            std::string group = "group.live" + std::to_string(c) + "." + std::to_string(i);
            EXPECT_EQ(1u, lookup(group, 7).code()) << group;
        }
}

TEST_F(DataMigration, AGroupNamedWhileItsStagingWaitsIsKept) {
    writePlist(daemon.at("etc/vesseld/device.plist"), dict({{"InternalBuild", Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_EQ(1u, lookup("group.orphan", 7, true).code());
    auto c = connect();
    ASSERT_TRUE(c);

    // Reconciliation queues the unreferenced group; its staging waits at the gate
    // while a registration names the group.
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 6, true)));
    auto migration = std::async(std::launch::async, [this] {
        auto m = connect();
        return m ? replyCode(performDataMigration(*m)) : 0;
    });
    ASSERT_TRUE(waitForLog("Waiting on lock: 6")) << logText();
    std::string info = daemon.at("late.plist");
    writePlist(info, dict({{"com.tarrow.Vesselry.Entitlements", groupsEntitlements("group.orphan")}}));
    EXPECT_EQ(1u, daemon.run(admin, {"processCodeSigningInfo", "Identifier=com.example.late",
                                     "CodeSigningInfo:plist=@" + info})
                      .code());
    ASSERT_EQ(1u, replyCode(setTestLock(*c, 6, false)));
    ASSERT_EQ(std::future_status::ready, migration.wait_for(std::chrono::seconds(60)));
    EXPECT_EQ(1u, migration.get());
    EXPECT_EQ(1u, lookup("group.orphan", 7).code()) << "named again before its staging ran";
}

TEST_F(DataMigration, AnUnreadableStatusFileFailsTheMigrationAndRecordsNothing) {
    const std::string statusFile = daemon.at(std::string(kLibrary) + "vsl_migration_status.plist");
    {
        FILE* f = std::fopen(statusFile.c_str(), "wb");
        ASSERT_TRUE(f);
        std::fputs("not a property list", f);
        std::fclose(f);
    }
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connect();
    ASSERT_TRUE(c);
    EXPECT_EQ(12u, replyCode(performDataMigration(*c)));
    EXPECT_EQ("not a property list", readFile(statusFile));
    std::string log = logText();
    size_t unreadable = log.find("Error reading system migration file from disk.  This is bad");
    EXPECT_NE(std::string::npos, unreadable);
    EXPECT_NE(std::string::npos, log.find("Failed to perform data migration : ", unreadable)) << log;
}
