// Commands 18, 19 and 20 against a real daemon, and what an operator sees when the
// database file is unusable.
#include <gtest/gtest.h>

#include <cstdio>

#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";

std::string plistFile(const DaemonProcess& daemon, const std::string& name, const Value& value) {
    std::string path = daemon.at(name);
    auto bytes = encodeBinaryPropertyList(value, nullptr);
    FILE* f = std::fopen(path.c_str(), "wb");
    if (!f || !bytes) return path;
    std::fwrite(bytes->data(), 1, bytes->size(), f);
    std::fclose(f);
    return path;
}

std::string databasePath(const DaemonProcess& daemon) {
    return daemon.at("private/var/root/Library/Vesselry/containers.sqlite3");
}

}  // namespace

TEST(CodeSigningEndToEnd, CommandsStoreReturnAndInvalidateCodeSigningInfo) {
    DaemonProcess daemon;
    std::string installer =
        daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    std::string stranger = daemon.addClient("stranger", "com.example.stranger", Value::dictionary({}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));

    Value info =
        dict({{"com.tarrow.Vesselry.Entitlements",
               dict({{"com.tarrow.security.application-groups", Value::array({Value::string("group.example")})}})},
              {"Version", Value::uint64(3)}});
    std::string infoPath = plistFile(daemon, "info.plist", info);
    std::string childOptions =
        plistFile(daemon, "child-options.plist",
                  dict({{"com.tarrow.Vesselry.DataContainerClass", Value::uint64(4)},
                        {"com.tarrow.Vesselry.ParentBundleID", Value::string("com.example.app")}}));

    auto r =
        daemon.run(installer, {"processCodeSigningInfo", "Identifier=com.example.app", "CodeSigningInfo=@" + infoPath});
    ASSERT_EQ(1u, r.code()) << r.err;
    r = daemon.run(installer, {"processCodeSigningInfo", "Identifier=com.example.app.widget",
                               "CodeSigningInfo=@" + infoPath, "OptionsDictionary=@" + childOptions});
    ASSERT_EQ(1u, r.code()) << r.err;
    r = daemon.run(installer, {"processCodeSigningInfo", "CodeSigningInfo=@" + infoPath});
    EXPECT_EQ(18u, r.code()) << "no identifier";
    r = daemon.run(installer, {"processCodeSigningInfo", "Identifier=", "CodeSigningInfo=@" + infoPath});
    EXPECT_EQ(18u, r.code()) << "an empty identifier is no identifier";
    EXPECT_EQ(21u, daemon.run(installer, {"getCodeSigningInfo", "Identifier="}).code()) << "nothing stored under \"\"";
    r = daemon.run(stranger, {"processCodeSigningInfo", "Identifier=com.example.evil", "CodeSigningInfo=@" + infoPath});
    EXPECT_EQ(55u, r.code()) << "not entitled";

    r = daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app"});
    ASSERT_EQ(1u, r.code()) << r.err;
    const Value* returned = r.reply.find("ReplyInfoDictionary");
    ASSERT_TRUE(returned);
    EXPECT_TRUE(propertyListValuesEqual(info, *returned)) << returned->description();
    r = daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.unknown"});
    EXPECT_EQ(21u, r.code());
    EXPECT_FALSE(r.reply.find("ReplyInfoDictionary"));
    // Every entitled message registers its sender's own entitlements.
    r = daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.installer"});
    ASSERT_EQ(1u, r.code());
    EXPECT_TRUE(
        propertyListValuesEqual(dict({{"com.tarrow.Vesselry.Entitlements", dict({{kAllowed, Value::boolean(true)}})}}),
                                *r.reply.find("ReplyInfoDictionary")));

    // No bundle container exists for anything registered here.
    r = daemon.run(installer, {"invalidateCodeSigningInfo"});
    EXPECT_EQ(1u, r.code()) << r.err;
    EXPECT_EQ(21u, daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app"}).code());
    EXPECT_EQ(21u, daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app.widget"}).code())
        << "invalidated with its parent";
    EXPECT_EQ(1u, daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.installer"}).code())
        << "caller-registered entries are kept";

    // Registered again, the entry is valid again; and it outlives the daemon.
    ASSERT_EQ(1u, daemon.run(installer, {"processCodeSigningInfo", "Identifier=com.example.app",
                                                   "CodeSigningInfo=@" + infoPath}).code());
    EXPECT_EQ(0, daemon.stop());
    EXPECT_TRUE(readFile(databasePath(daemon)).size() > 0);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    r = daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app"});
    ASSERT_EQ(1u, r.code()) << r.err;
    EXPECT_TRUE(propertyListValuesEqual(info, *r.reply.find("ReplyInfoDictionary")));
    EXPECT_EQ(0, daemon.stop());
}

TEST(CodeSigningEndToEnd, ACorruptDatabaseStopsTheDaemonUntilItIsMovedAside) {
    DaemonProcess daemon;
    std::string installer =
        daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    std::string path = databasePath(daemon);
    std::string mk = "mkdir -p '" + path.substr(0, path.rfind('/')) + "'";
    ASSERT_EQ(0, std::system(mk.c_str()));
    {
        FILE* f = std::fopen(path.c_str(), "wb");
        ASSERT_TRUE(f);
        std::string junk(8192, '\x5a');
        std::fwrite(junk.data(), 1, junk.size(), f);
        std::fclose(f);
    }
    // The database is opened at start: the daemon stops before it serves anyone.
    EXPECT_FALSE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto r = daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app"});
    EXPECT_EQ(3, r.exitCode) << "the client cannot reach a daemon: " << r.err;
    std::string stderrText = readFile(daemon.at("vesseld.stderr"));
    EXPECT_NE(std::string::npos, stderrText.find("Failed to initialize database, err = 26")) << stderrText;
    std::string logText = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, logText.find("table create for " + path + " failed")) << logText;
    EXPECT_NE(std::string::npos, logText.find("Move it aside")) << logText;

    ASSERT_EQ(0, std::rename(path.c_str(), (path + ".corrupt").c_str()));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    EXPECT_EQ(21u, daemon.run(installer, {"getCodeSigningInfo", "Identifier=com.example.app"}).code())
        << "a fresh, empty database";
    EXPECT_EQ(0, daemon.stop());
}
