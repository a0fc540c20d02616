// The kernel's container query end to end: a daemon on a scratch root, asked over
// its upcall socket by a client playing the kernel.
#include <gtest/gtest.h>
#include <sys/stat.h>


#include "Client/VSLUpcallProtocol.h"
#include "Platform/PropertyList.h"
#include "Support/TempRoot.h"
#include "Upcall/UpcallTestSupport.h"

using namespace vsl;
using namespace vsl::client;
using namespace vsl::test;
using packbuff_test::Bytes;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";
const char* const kApplications = "private/var/mobile/Containers/Data/Application";
const char* const kPlugins = "private/var/mobile/Containers/Data/PluginKitPlugin";
const char* const kGroups = "private/var/mobile/Containers/Shared/AppGroup";

bool isDirectory(const std::string& path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

VSLUpcallQuery application(const std::string& identifier) {
    VSLUpcallQuery q;
    q.codeSignatureID = identifier;
    q.uid = mobileUID();
    q.containerType = kVSLUpcallContainerTypeApplication;
    q.personaID = kVSLUpcallNoPersona;
    return q;
}

}  // namespace

TEST(UpcallEndToEnd, AnApplicationGetsItsContainersInReplyOrderAsTheBytesSay) {
    DaemonProcess daemon;
    std::string installer = daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    struct stat st;
    ASSERT_EQ(0, ::stat(client::VSLUpcallClient::socketPathForSystemRoot(daemon.root()).c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 07777) << "only the kernel stand-in may connect";
    registerCodeSigning(daemon, installer, "com.example.app", 2);

    VSLUpcallQuery q = application("com.example.app");
    q.appGroupIDs = {"group.b", "group.a", "group.b"};  // the same group twice is one pair
    q.systemContainerID = "com.example.system";
    q.systemGroupIDs = {"systemgroup.one"};
    UpcallAnswer a = askUpcall(daemon, q);
    ASSERT_EQ(VSLUpcallStatus::Ok, a.status) << a.error;
    EXPECT_EQ(kVSLUpcallGetProcessContainersID + 100, a.frame.messageId);
    ASSERT_EQ(0, a.frame.returnCode);

    // Everything was made on disk, where the reply says.
    auto apps = entriesOf(daemon.at(kApplications));
    ASSERT_EQ(1u, apps.size());
    const std::string data = daemon.at(std::string(kApplications) + "/" + apps[0]);
    auto groups = entriesOf(daemon.at(kGroups));
    ASSERT_EQ(2u, groups.size()) << "group.b asked twice is made once";
    ASSERT_TRUE(a.containers.dataContainer && a.containers.systemContainer && a.containers.home);
    EXPECT_EQ(data, *a.containers.dataContainer);
    EXPECT_TRUE(isDirectory(*a.containers.systemContainer));
    ASSERT_EQ(2u, a.containers.groups.size());
    ASSERT_EQ(1u, a.containers.systemGroups.size());
    for (const auto& [identifier, path] : a.containers.groups) EXPECT_TRUE(isDirectory(path)) << identifier;

    // The reply, byte for byte: home, data, tmp, group pairs, system container,
    // system-group pairs, then status 1.
    Bytes expected;
    packedString(expected, 100, daemon.at("private/var/mobile"));
    packedString(expected, 1, data);
    packedString(expected, 2, data + "/tmp");
    for (const auto& [identifier, path] : a.containers.groups) {
        packedString(expected, 3, identifier);
        packedString(expected, 4, path);
    }
    packedString(expected, 101, *a.containers.systemContainer);
    packedString(packedString(expected, 102, "systemgroup.one"), 103, a.containers.systemGroups[0].second);
    expected.header(1, 0, 1).end();
    EXPECT_EQ(asString(expected), a.frame.packbuff);
    EXPECT_EQ("group.a", a.containers.groups[0].first);
    EXPECT_EQ("group.b", a.containers.groups[1].first);

    // Asked again, the same containers come back and nothing new is made.
    UpcallAnswer again = askUpcall(daemon, q);
    EXPECT_EQ(a.frame.packbuff, again.frame.packbuff);
    EXPECT_EQ(apps, entriesOf(daemon.at(kApplications)));

    // vesselctl plays the kernel too.
    auto r = daemon.run(vesselctlPath(), {"--json", "upcall", "uid=" + std::to_string(mobileUID()),
                                          "signature-id=com.example.app", "group=group.a"});
    EXPECT_EQ(0, r.exitCode) << r.err;
    EXPECT_NE(std::string::npos, r.out.find("\"DataContainer\":\"" + data + "\"")) << r.out;
    EXPECT_NE(std::string::npos, r.out.find("\"Status\":1")) << r.out;
    EXPECT_EQ(2, daemon.run(vesselctlPath(), {"upcall", "signature-id=x"}).exitCode) << "uid is required";
    EXPECT_EQ(0, daemon.stop());
}

TEST(UpcallEndToEnd, ClassesHomesAndPersonasFollowTheRules) {
    DaemonProcess daemon;
    const uint64_t uid = mobileUID();
    const uint64_t gid = ::geteuid() == 0 ? 501 : ::getegid();
    auto persona = [&](uint64_t type, uint64_t id, const char* unique, const char* home) {
        Dictionary d{{"PersonaType", Value::uint64(type)}, {"KernelPersonaID", Value::uint64(id)},
                     {"UID", Value::uint64(uid)},          {"GID", Value::uint64(gid)},
                     {"PersonaUniqueString", Value::string(unique)}, {"BundleIdentifiers", Value::array({})}};
        if (home) d.emplace("HomeDirectory", Value::string(home));
        return Value::dictionary(std::move(d));
    };
    writeRootFile(daemon, "etc/vesseld/personas.plist",
                  *encodeBinaryPropertyList(Value::array({persona(0, 1000, "P", nullptr),
                                                          persona(1, 2000, "E", "/private/var/enterprise")}),
                                            nullptr));
    writeRootFile(daemon, "etc/vesseld/device.plist",
                  *encodeBinaryPropertyList(dict({{"PersonasSupported", Value::boolean(true)}}), nullptr));
    std::string installer = daemon.addClient("installer", "com.example.installer", dict({{kAllowed, Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    registerCodeSigning(daemon, installer, "com.example.widget", 2);

    // A plug-in stored with class 2 is served from a plug-in data container.
    VSLUpcallQuery q = application("com.example.widget");
    q.containerType = kVSLUpcallContainerTypePlugin;
    UpcallAnswer a = askUpcall(daemon, q);
    ASSERT_EQ(0, a.frame.returnCode) << a.error;
    ASSERT_TRUE(a.containers.dataContainer);
    EXPECT_EQ(daemon.at(kPlugins), a.containers.dataContainer->substr(0, daemon.at(kPlugins).size()));
    EXPECT_TRUE(entriesOf(daemon.at(kApplications)).empty());

    // Nothing stored: 4 for a plug-in, 2 for an application, and the log says so.
    q = application("com.example.unknown-plugin");
    q.containerType = kVSLUpcallContainerTypePlugin;
    a = askUpcall(daemon, q);
    ASSERT_EQ(0, a.frame.returnCode);
    EXPECT_EQ(2u, entriesOf(daemon.at(kPlugins)).size());
    a = askUpcall(daemon, application("com.example.unknown-app"));
    ASSERT_EQ(0, a.frame.returnCode);
    EXPECT_EQ(1u, entriesOf(daemon.at(kApplications)).size());
    EXPECT_EQ(1u, a.containers.status.value_or(0));
    const std::string log = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, log.find("Invalid data container class for com.example.unknown-plugin: 0")) << log;
    EXPECT_NE(std::string::npos, log.find("Invalid data container class for com.example.unknown-app: 0"));
    EXPECT_EQ(std::string::npos, log.find("Invalid data container class for com.example.widget"));

    // Uid 0 gets the root's home; a uid alone gets its home and status 1, nothing more.
    VSLUpcallQuery root;
    root.uid = 0;
    root.personaID = kVSLUpcallNoPersona;
    a = askUpcall(daemon, root);
    ASSERT_EQ(0, a.frame.returnCode);
    Bytes homeOnly;
    packedString(homeOnly, 100, daemon.at("private/var/root")).header(1, 0, 1).end();
    EXPECT_EQ(asString(homeOnly), a.frame.packbuff);
    VSLUpcallQuery mobile;
    mobile.uid = static_cast<uint32_t>(uid);
    mobile.personaID = kVSLUpcallNoPersona;
    a = askUpcall(daemon, mobile);
    Bytes mobileHome;
    packedString(mobileHome, 100, daemon.at("private/var/mobile")).header(1, 0, 1).end();
    EXPECT_EQ(asString(mobileHome), a.frame.packbuff);

    // An enterprise persona's process gets that persona's containers; an unknown id gets 4.
    q = application("com.example.enterprise-app");
    q.personaID = 2000;
    a = askUpcall(daemon, q);
    ASSERT_EQ(0, a.frame.returnCode) << a.error;
    ASSERT_TRUE(a.containers.dataContainer && a.containers.home);
    const std::string enterprise = daemon.at("private/var/enterprise");
    EXPECT_EQ(enterprise, *a.containers.home);
    EXPECT_EQ(enterprise + "/", a.containers.dataContainer->substr(0, enterprise.size() + 1));
    q.personaID = 4242;
    a = askUpcall(daemon, q);
    ASSERT_EQ(VSLUpcallStatus::Ok, a.status);
    EXPECT_EQ(kVSLUpcallInvalidArgument, a.frame.returnCode);
    EXPECT_TRUE(a.frame.packbuff.empty()) << "a failed reply carries no packbuff";
    // The personal persona's id reads as kernel persona type 1: the personal containers.
    q.personaID = 1000;
    a = askUpcall(daemon, q);
    ASSERT_EQ(0, a.frame.returnCode);
    EXPECT_EQ(daemon.at("private/var/mobile"), a.containers.home.value_or(""));
    EXPECT_EQ(0, daemon.stop());
}

TEST(UpcallEndToEnd, AGroupThatCannotBeMadeLeavesOnlyTheStatus) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    // The group class directory is a file: no group container can be made there.
    const std::string groups = daemon.at(kGroups);
    ASSERT_EQ(0, std::system(("rm -rf '" + groups + "' && mkdir -p \"$(dirname '" + groups + "')\" && touch '" +
                              groups + "'").c_str()));
    VSLUpcallQuery q = application("com.example.app");
    q.appGroupIDs = {"group.example"};
    UpcallAnswer a = askUpcall(daemon, q);
    ASSERT_EQ(VSLUpcallStatus::Ok, a.status) << a.error;
    ASSERT_EQ(0, a.frame.returnCode);
    Bytes statusOnly;
    statusOnly.header(1, 0, 0).end();
    EXPECT_EQ(asString(statusOnly), a.frame.packbuff);
    EXPECT_EQ(1u, entriesOf(daemon.at(kApplications)).size()) << "the data container was still made";
    const std::string log = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, log.find("createOrLookupGroupContainersForUser: Failed with error:")) << log;
    EXPECT_EQ(0, daemon.stop());
}
