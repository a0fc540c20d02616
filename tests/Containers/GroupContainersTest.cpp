// End to end: an owner's group containers (command 13) and their identifiers (14),
// owners registered through command 18, on a device with enterprise personas; and
// many clients asking at once for owners that share groups.
#include <gtest/gtest.h>
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <map>
#include <set>
#include <thread>

#include "Client/VSLConnection.h"
#include "Client/VSLContainerInfo.h"
#include "Client/VSLGroups.h"
#include "Client/VSLSandboxToken.h"
#include "Platform/AuditToken.h"
#include "Platform/PropertyList.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";
const char* const kAppGroups = "com.tarrow.security.application-groups";
const char* const kGroupExtension = "com.tarrow.sandbox.application-group";

void writeRootFile(const DaemonProcess& daemon, const std::string& relative, const std::string& bytes) {
    std::string path = daemon.at(relative);
    std::string mk = "mkdir -p '" + path.substr(0, path.rfind('/')) + "'";
    ASSERT_EQ(0, std::system(mk.c_str()));
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

Value strings(const std::vector<std::string>& items) {
    Array a;
    for (const auto& s : items) a.push_back(Value::string(s));
    return Value::array(std::move(a));
}

// Registers the owner's entitlements through command 18, as an installer does.
void registerOwner(const DaemonProcess& daemon, const std::string& installer, const std::string& owner,
                   const Value& entitlements) {
    std::string file = daemon.at("info-" + owner + ".plist");
    writeRootFile(daemon, "info-" + owner + ".plist",
                  *encodeBinaryPropertyList(dict({{"com.tarrow.Vesselry.Entitlements", entitlements}}), nullptr));
    auto r = daemon.run(installer, {"processCodeSigningInfo", "Identifier=" + owner, "CodeSigningInfo=@" + file});
    ASSERT_EQ(1u, r.code()) << r.err;
}

std::map<std::string, std::string> stringsOf(const Value& reply, const char* key) {
    std::map<std::string, std::string> out;
    const Value* v = reply.find(key);
    if (const Dictionary* d = v ? v->dictionaryValue() : nullptr)
        for (const auto& [k, item] : *d) out[k] = item.stringValue() ? *item.stringValue() : "";
    return out;
}

size_t entriesIn(const std::string& directory) {
    size_t n = 0;
    if (DIR* d = ::opendir(directory.c_str())) {
        while (auto* e = ::readdir(d)) n += e->d_name[0] != '.';
        ::closedir(d);
    }
    return n;
}

bool isDirectory(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

Value persona(uint64_t type, uint64_t id, const std::string& unique, std::vector<std::string> bundles) {
    Dictionary d{{"PersonaType", Value::uint64(type)}, {"KernelPersonaID", Value::uint64(id)},
                 {"UID", Value::uint64(501)},          {"GID", Value::uint64(501)},
                 {"BundleIdentifiers", strings(bundles)}};
    if (!unique.empty()) d["PersonaUniqueString"] = Value::string(unique);
    if (type == 1) d["HomeDirectory"] = Value::string("/private/var/PersonaVolumes/" + unique);
    return Value::dictionary(std::move(d));
}

}  // namespace

TEST(GroupContainers, AnOwnersGroupsAreMadeWithTokensOnlyForSandboxedCallersAndAPersonaMustBeClear) {
#ifndef VESSEL_KILLPOINTS
    GTEST_SKIP() << "creation failures are injected in kill-point builds only";
#endif
    if (::geteuid() != 0) GTEST_SKIP() << "a client outside personas needs a uid that has none: run as root";
    DaemonProcess daemon;
    // The personas are the mobile user's; clients run as root, outside personas. The
    // owners are installed in enterprise personas: "single" in E1 only, "twice" in
    // E1 and E2.
    writeRootFile(daemon, "etc/vesseld/personas.plist",
                  *encodeBinaryPropertyList(
                      Value::array({persona(0, 1000, "P", {}),
                                    persona(1, 1001, "E1", {"com.example.single", "com.example.twice"}),
                                    persona(1, 1002, "E2", {"com.example.twice"})}),
                      nullptr));
    writeRootFile(daemon, "etc/vesseld/device.plist",
                  *encodeBinaryPropertyList(dict({{"PersonasSupported", Value::boolean(true)}}), nullptr));
    std::string installer = daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    std::string stranger = daemon.addClient("stranger", "com.example.stranger", Value::dictionary({}));
    ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "sandboxed", "com.example.sandboxed",
                                       dict({{kAllowed, Value::boolean(true)}}), true));
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_FAIL_CREATE=group.broken"})) << readFile(daemon.at("vesseld.stderr"));
    registerOwner(daemon, installer, "com.example.single",
                  dict({{kAppGroups, strings({"group.one", "group.broken", "group.two"})}}));
    registerOwner(daemon, installer, "com.example.twice", dict({{kAppGroups, strings({"group.three"})}}));

    // The sandboxed caller: this program.
    std::string error;
    auto connection = client::VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(connection) << error;
    auto made = client::createOrLookupGroupContainers(*connection, std::string("com.example.single"));
    ASSERT_EQ(1u, client::replyCode(made)) << "one group failing does not fail the call: " << made.body.description();
    auto paths = client::groupStrings(made, "ReplyGroupContainerDict");
    ASSERT_EQ((std::set<std::string>{"group.one", "group.two"}),
              (std::set<std::string>{paths.begin()->first, std::next(paths.begin())->first}))
        << made.body.description();
    ASSERT_EQ(2u, paths.size());
    const std::string e1Groups = daemon.at("private/var/PersonaVolumes/E1");
    for (const auto& [group, path] : paths) {
        EXPECT_EQ(0u, path.find(e1Groups)) << group << " lives in the one persona its owner is installed in: " << path;
        EXPECT_NE(std::string::npos, path.find("/Containers/Shared/AppGroup/")) << path;
        EXPECT_TRUE(isDirectory(path)) << path;
        for (const char* sub : {"Library", "Library/Caches", "Library/Preferences"})
            EXPECT_TRUE(isDirectory(path + "/" + sub)) << path << "/" << sub;
        EXPECT_FALSE(isDirectory(path + "/Documents")) << "the group layout, not the data layout";
        EXPECT_EQ(0, ::access((path + "/.com.tarrow.vesselry.metadata.plist").c_str(), F_OK)) << path;
    }
    const std::string classDirectory = paths["group.one"].substr(0, paths["group.one"].rfind('/'));
    EXPECT_EQ(2u, entriesIn(classDirectory)) << "nothing is left of the group that failed";

    auto self = AuditToken::forProcess(::getpid(), ::geteuid(), ::getegid());
    ASSERT_TRUE(self);
    auto tokens = client::groupStrings(made, "ReplySandboxTokenDict");
    ASSERT_EQ(2u, tokens.size()) << made.body.description();
    for (const auto& [group, token] : tokens) {
        const std::string other = group == "group.one" ? "group.two" : "group.one";
        EXPECT_TRUE(client::verifySandboxToken(token, kGroupExtension, paths[group], self->words, daemon.root()))
            << group;
        EXPECT_FALSE(client::verifySandboxToken(token, kGroupExtension, paths[other], self->words, daemon.root()))
            << group << "'s token opens " << other;
    }
    EXPECT_EQ((std::map<std::string, std::string>{{"group.one", "E1"}, {"group.two", "E1"}}),
              client::groupStrings(made, "ReplyPersonaUniqueStringDict"));

    // The same groups for a caller that is not sandboxed: found again, and no tokens.
    auto plain = daemon.run(installer, {"groups", "Identifier=com.example.single"});
    ASSERT_EQ(1u, plain.code()) << plain.err;
    EXPECT_EQ(paths, stringsOf(plain.reply, "ReplyGroupContainerDict"));
    EXPECT_FALSE(plain.reply.find("ReplySandboxTokenDict"));
    EXPECT_FALSE(plain.reply.find("ReplyPersonaUniqueStringDict"));
    // The identifiers alone, including the one that cannot be made; nothing is created.
    auto ids = daemon.run(installer, {"group-ids", "Identifier=com.example.single"});
    ASSERT_EQ(1u, ids.code());
    ASSERT_TRUE(ids.reply.find("ReplyGroupIdentifiersArray"));
    EXPECT_EQ(3u, ids.reply.find("ReplyGroupIdentifiersArray")->arrayValue()->size());
    EXPECT_EQ(2u, entriesIn(classDirectory));

    // Installed in two personas, neither the caller's: ambiguous, and nothing is made.
    EXPECT_EQ(76u, daemon.run(installer, {"groups", "Identifier=com.example.twice"}).code());
    EXPECT_EQ(76u, client::replyCode(client::createOrLookupGroupContainers(*connection, std::string("com.example.twice"))));
    EXPECT_EQ(2u, entriesIn(classDirectory));
    EXPECT_EQ(0u, entriesIn(daemon.at("private/var/PersonaVolumes/E2/Containers/Shared/AppGroup")));

    // A caller without rights may not look at another owner's groups; nothing is made.
    auto refused = daemon.run(stranger, {"groups", "Identifier=com.example.single"});
    EXPECT_EQ(55u, refused.code()) << refused.err;
    EXPECT_FALSE(refused.reply.find("ReplyGroupContainerDict"));
    EXPECT_EQ(2u, entriesIn(classDirectory));
    EXPECT_NE(std::string::npos,
              readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"))
                  .find("com.example.stranger not entitled to retrieve group container class 7 with identifier "
                        "com.example.single"));
    EXPECT_EQ(0, daemon.stop());
}

TEST(GroupContainers, ClientsAskingAtOnceForOwnersThatShareGroupsGetOneContainerPerGroup) {
    DaemonProcess daemon;
    std::string installer = daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    // Owner i names the shared group, its own, and its neighbour's.
    const int kOwners = 8;
    std::set<std::string> allGroups{"group.everyone"};
    for (int i = 0; i < kOwners; i++) {
        std::string mine = "group.pair" + std::to_string(i);
        std::string next = "group.pair" + std::to_string((i + 1) % kOwners);
        allGroups.insert(mine);
        registerOwner(daemon, installer, "com.example.owner" + std::to_string(i),
                      dict({{kAppGroups, strings({"group.everyone", mine, next})}}));
    }
    std::vector<DaemonProcess::CtlResult> results(kOwners);
    std::vector<std::thread> threads;
    for (int i = 0; i < kOwners; i++)
        threads.emplace_back([&, i] {
            results[i] = daemon.run(installer, {"groups", "Identifier=com.example.owner" + std::to_string(i)});
        });
    for (auto& t : threads) t.join();

    std::map<std::string, std::set<std::string>> pathsByGroup;
    for (const auto& r : results) {
        ASSERT_EQ(1u, r.code()) << r.err;
        auto paths = stringsOf(r.reply, "ReplyGroupContainerDict");
        EXPECT_EQ(3u, paths.size());
        for (const auto& [group, path] : paths) pathsByGroup[group].insert(path);
    }
    EXPECT_EQ(allGroups.size(), pathsByGroup.size());
    for (const auto& [group, paths] : pathsByGroup) EXPECT_EQ(1u, paths.size()) << group << " was made more than once";
    EXPECT_EQ(allGroups.size(), entriesIn(daemon.at("private/var/mobile/Containers/Shared/AppGroup")));

    // A key of the wrong type reads as absent: the caller's own groups (it has none).
    auto own = daemon.run(installer, {"group-ids", "Identifier:u64=5"});
    ASSERT_EQ(1u, own.code()) << own.err;
    ASSERT_TRUE(own.reply.find("ReplyGroupIdentifiersArray"));
    EXPECT_TRUE(own.reply.find("ReplyGroupIdentifiersArray")->arrayValue()->empty());
    auto mixed = dict({{kAppGroups, Value::array({Value::string("group.ok"), Value::uint64(1)})}});
    registerOwner(daemon, installer, "com.example.mixed", mixed);
    auto none = daemon.run(installer, {"groups", "Identifier=com.example.mixed"});
    ASSERT_EQ(1u, none.code()) << "an entitlement that is not a list of strings names no group";
    EXPECT_TRUE(stringsOf(none.reply, "ReplyGroupContainerDict").empty());
    EXPECT_EQ(0, daemon.stop());
}

TEST(SystemContainers, WellKnownNamesAndTheCallersEntitledListDecide) {
    DaemonProcess daemon;
    std::string installer = daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    std::string stranger = daemon.addClient("stranger", "com.example.stranger", Value::dictionary({}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    const char* const kSystemGroups = "com.tarrow.security.system-groups";
    registerOwner(daemon, installer, "com.example.installer",
                  dict({{kAllowed, Value::boolean(true)},
                        {kSystemGroups, strings({"systemgroup.com.tarrow.telephony", "systemgroup.com.example.own",
                                                 "com.example.unprefixed"})}}));
    const std::string systemGroups = daemon.at("private/var/containers/Shared/SystemGroup");

    // Command 15: a well-known system container of another identifier needs no entitlement.
    auto wellKnown = daemon.run(stranger, {"system-container", "Identifier=com.tarrow.settingsd"});
    ASSERT_EQ(1u, wellKnown.code()) << wellKnown.err;
    EXPECT_EQ(daemon.at("private/var/containers/Data/System/com.tarrow.settingsd"), wellKnown.string("ReplyPath"));
    EXPECT_TRUE(isDirectory(wellKnown.string("ReplyPath")));
    EXPECT_EQ(55u, daemon.run(stranger, {"system-container", "Identifier=com.example.other"}).code());
    EXPECT_EQ(55u, daemon.run(stranger, {"system-container"}).code()) << "its own needs the system-container entitlement";

    // Command 16: the owner's system groups, prefix rule applied.
    auto own = daemon.run(installer, {"system-groups"});
    ASSERT_EQ(1u, own.code()) << own.err;
    auto ownPaths = stringsOf(own.reply, "ReplyGroupContainerDict");
    EXPECT_EQ(2u, ownPaths.size());
    EXPECT_EQ(systemGroups + "/systemgroup.com.tarrow.telephony", ownPaths["systemgroup.com.tarrow.telephony"]);
    EXPECT_TRUE(isDirectory(ownPaths["systemgroup.com.example.own"]));
    EXPECT_FALSE(own.reply.find("ReplySandboxTokenDict"));
    removeTree(ownPaths["systemgroup.com.tarrow.telephony"]);
    ASSERT_EQ(0, daemon.stop());
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));

    // Command 17, an entitled group: only through the owner's groups, never by its
    // well-known name, so an owner that does not name it finds nothing.
    auto viaOther = daemon.run(installer, {"system-group", "systemgroup.com.tarrow.telephony",
                                           "Identifier=com.example.other"});
    EXPECT_EQ(21u, viaOther.code()) << viaOther.err;
    EXPECT_FALSE(isDirectory(systemGroups + "/systemgroup.com.tarrow.telephony"));
    auto viaOwn = daemon.run(installer, {"system-group", "systemgroup.com.tarrow.telephony"});
    ASSERT_EQ(1u, viaOwn.code()) << viaOwn.err;
    EXPECT_EQ(systemGroups + "/systemgroup.com.tarrow.telephony", viaOwn.string("ReplyPath"));
    EXPECT_TRUE(isDirectory(viaOwn.string("ReplyPath")));

    // A well-known group outside the caller's list: by its well-known name.
    auto font = daemon.run(stranger, {"system-group", "systemgroup.com.tarrow.fontregistry"});
    ASSERT_EQ(1u, font.code()) << font.err;
    EXPECT_EQ(systemGroups + "/systemgroup.com.tarrow.fontregistry", font.string("ReplyPath"));
    EXPECT_TRUE(isDirectory(font.string("ReplyPath")));

    // Anything else is refused; one group's refusal is silent.
    const size_t before = entriesIn(systemGroups);
    EXPECT_EQ(55u, daemon.run(stranger, {"system-group", "systemgroup.com.example.own"}).code());
    EXPECT_EQ(55u, daemon.run(stranger, {"system-group", "systemgroup.com.tarrow.bellwort"}).code());
    EXPECT_EQ(55u, daemon.run(stranger, {"systemGroupContainerPath", "GroupIdentifier:u64=3"}).code())
        << "a group that is not a string is no group";
    EXPECT_EQ(before, entriesIn(systemGroups));
    ASSERT_EQ(0, daemon.stop());
    std::string logs = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log")) +
                       readFile(daemon.at("vesseld.stderr"));
    EXPECT_NE(std::string::npos,
              logs.find("com.example.stranger is not entitled for system group identifier: systemgroup.com.example.own"))
        << logs;
    EXPECT_EQ(std::string::npos, logs.find("bellwort")) << logs;
}
