// End to end: info values, metadata, default structure, directory renaming and disk
// usage of one container, on a real daemon.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "ContainerContent/ContentSupport.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using namespace vsl::client;

namespace {

Value infoValue(VSLConnection& c, const VSLContainerRef& ref, const std::string& key, uint64_t* code) {
    auto r = infoValueForKey(c, ref, key);
    *code = replyCode(r);
    const Value* v = r.body.find("ReplyInfoValue");
    return v ? *v : Value();
}

struct NodeState {
    ino_t inode = 0;
    mode_t mode = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    uint32_t protection = 0;
    bool operator==(const NodeState&) const = default;
};

NodeState nodeState(const std::string& path) {
    NodeState s;
    struct stat st;
    EXPECT_EQ(0, ::lstat(path.c_str(), &st)) << path;
    s.inode = st.st_ino;
    s.mode = st.st_mode;
    s.uid = st.st_uid;
    s.gid = st.st_gid;
    VSLDataProtectionClass c = kVSLDataProtectionClassNotExplicit;
    EXPECT_TRUE(VSLFileManager::defaultManager().dataProtectionClassOfItemAtURL(path, &c, nullptr)) << path;
    s.protection = c;
    return s;
}

}  // namespace

TEST(InfoValues, EveryWireTypeRoundTripsRemovalGives24AndValuesSurviveARestart) {
    DaemonProcess daemon;
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created made = createContainer(*c, "com.example.info", 2);
    ASSERT_FALSE(made.path.empty());

    Dictionary nested{{"inner", Value::dictionary({{"deep", Value::array({Value::uint64(1), Value::string("x")})}})},
                      {"flag", Value::boolean(false)}};
    // The metadata file keeps a UUID as its 16 bytes; everything else as sent.
    const std::vector<std::pair<std::string, Value>> values = {
        {"string", Value::string("héllo")},
        {"true", Value::boolean(true)},
        {"uint64", Value::uint64(18446744073709551615ull)},
        {"int64", Value::int64(-42)},
        {"real", Value::real(2.5)},
        {"data", Value::data(Data{0, 1, 2, 255})},
        {"date", Value::date(Date{1700000000000000000})},
        {"array", Value::array({Value::string("a"), Value::int64(-1)})},
        {"nested", Value::dictionary(nested)},
    };
    for (const auto& [key, value] : values) EXPECT_EQ(1u, replyCode(setInfoValue(*c, made.ref, key, value))) << key;
    for (const auto& [key, value] : values) {
        uint64_t code = 0;
        EXPECT_EQ(value, infoValue(*c, made.ref, key, &code)) << key;
        EXPECT_EQ(1u, code) << key;
    }
    Uuid u = Uuid::random();
    EXPECT_EQ(1u, replyCode(setInfoValue(*c, made.ref, "uuid", Value::uuid(u))));
    uint64_t code = 0;
    Value readUuid = infoValue(*c, made.ref, "uuid", &code);
    EXPECT_EQ(1u, code);
    EXPECT_TRUE(readUuid == Value::uuid(u) || readUuid == Value::data(Data(u.bytes.begin(), u.bytes.end())));

    // No value removes the key.
    EXPECT_EQ(1u, replyCode(setInfoValue(*c, made.ref, "true", std::nullopt)));
    infoValue(*c, made.ref, "true", &code);
    EXPECT_EQ(24u, code);

    // A non-string key: 38 for set and get; an absent container: 21.
    Dictionary badSet = identityRequest(5, made.ref);
    badSet["Key"] = Value::uint64(7);
    badSet["Value"] = Value::string("v");
    EXPECT_EQ(38u, send(*c, badSet));
    Dictionary badGet = identityRequest(6, made.ref);
    EXPECT_EQ(38u, send(*c, badGet));
    VSLContainerRef absent = made.ref;
    absent.uuid = Uuid::random();
    EXPECT_EQ(21u, replyCode(setInfoValue(*c, absent, "k", Value::string("v"))));
    infoValue(*c, absent, "string", &code);
    EXPECT_EQ(21u, code);

    // A value that would take the metadata file past the read limit is refused and
    // nothing is written.
    std::string before = readFile(joinPath(made.path, kVSLMetadataFileName));
    auto big = setInfoValue(*c, made.ref, "big", Value::data(Data(20u << 20, 7)));
    EXPECT_NE(1u, replyCode(big));
    EXPECT_EQ(before, readFile(joinPath(made.path, kVSLMetadataFileName)));
    infoValue(*c, made.ref, "big", &code);
    EXPECT_EQ(24u, code);

    // Metadata answers the path, the transient flag and the info dictionary.
    auto meta = metadata(*c, made.ref, true);
    EXPECT_EQ(1u, replyCode(meta));
    EXPECT_EQ(Value::string(made.path), *meta.body.find("ReplyPath"));
    EXPECT_EQ(Value::boolean(false), *meta.body.find("ReplyTransient"));
    const Value* info = meta.body.find("ReplyInfoDictionary");
    ASSERT_TRUE(info && info->find("nested"));
    EXPECT_EQ(Value::dictionary(nested), *info->find("nested"));
    EXPECT_EQ(nullptr, metadata(*c, made.ref, false).body.find("ReplyInfoDictionary"));

    c.reset();
    daemon.stop();
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    c = connectTo(daemon);
    ASSERT_TRUE(c);
    for (const auto& [key, value] : values) {
        if (key == "true") continue;
        Value read = infoValue(*c, made.ref, key, &code);
        EXPECT_EQ(1u, code) << key;
        // Integers come back from the file as the same 64 bits, whatever their signedness.
        if (key == "int64")
            EXPECT_EQ(-42, read.int64Value().value_or(0)) << key;
        else if (key == "uint64")
            EXPECT_EQ(-1, read.int64Value().value_or(0)) << key;
        else
            EXPECT_EQ(value, read) << key;
    }
    infoValue(*c, made.ref, "true", &code);
    EXPECT_EQ(24u, code);
}

TEST(DefaultStructure, RecreatesDeletedDirectoriesAndLeavesExistingOnesAlone) {
    DaemonProcess daemon;
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created made = createContainer(*c, "com.example.skeleton", 2);
    ASSERT_FALSE(made.path.empty());
    const NodeState documents = nodeState(joinPath(made.path, "Documents"));
    const NodeState caches = nodeState(joinPath(made.path, "Library/Caches"));
    const NodeState systemData = nodeState(joinPath(made.path, "SystemData"));
    // New skeleton directories take the container's protection class.
    ASSERT_EQ(1u, replyCode(setInfoValue(*c, made.ref, "com.tarrow.Stowage.ContentProtectionClass",
                                         Value::int64(3))));
    // A changed mode on an existing directory stays as it is.
    ASSERT_EQ(0, ::chmod(joinPath(made.path, "tmp").c_str(), 0700));
    const NodeState tmp = nodeState(joinPath(made.path, "tmp"));
    ASSERT_EQ(0, ::rmdir(joinPath(made.path, "Library/Caches").c_str()));
    ASSERT_EQ(0, ::rmdir(joinPath(made.path, "SystemData").c_str()));
    // A link put in place of a skeleton directory is neither followed nor replaced.
    std::string outside = makeTempDir("vessel-outside-");
    ASSERT_EQ(0, ::rmdir(joinPath(made.path, "Library/Preferences").c_str()));
    ASSERT_EQ(0, ::symlink(outside.c_str(), joinPath(made.path, "Library/Preferences").c_str()));

    EXPECT_EQ(1u, replyCode(recreateDefaultStructure(*c, made.ref)));
    EXPECT_EQ(documents, nodeState(joinPath(made.path, "Documents")));
    EXPECT_EQ(tmp, nodeState(joinPath(made.path, "tmp")));
    NodeState newCaches = nodeState(joinPath(made.path, "Library/Caches"));
    EXPECT_EQ(caches.mode, newCaches.mode);
    EXPECT_EQ(caches.uid, newCaches.uid);
    EXPECT_EQ(caches.gid, newCaches.gid);
    EXPECT_EQ(3u, newCaches.protection);
    NodeState newSystemData = nodeState(joinPath(made.path, "SystemData"));
    EXPECT_EQ(systemData.mode, newSystemData.mode);
    EXPECT_EQ(0u, newSystemData.protection);  // excluded from the container's class
    struct stat st;
    ASSERT_EQ(0, ::lstat(joinPath(made.path, "Library/Preferences").c_str(), &st));
    EXPECT_TRUE(S_ISLNK(st.st_mode));
    EXPECT_EQ(0u, std::string(readFile(outside + "/x")).size());

    // Command 22 is the same operation; a second run changes nothing.
    Dictionary again = identityRequest(22, made.ref);
    EXPECT_EQ(1u, send(*c, again));
    EXPECT_EQ(newCaches, nodeState(joinPath(made.path, "Library/Caches")));
    VSLContainerRef absent = made.ref;
    absent.uuid = Uuid::random();
    EXPECT_EQ(21u, replyCode(recreateDefaultStructure(*c, absent)));
    removeTree(outside);
}

TEST(DirectoryUUID, MovesToANewUpperCaseNameLookupsFollowAndTheUUIDStays) {
    DaemonProcess daemon;
    std::string admin = daemon.addClient("admin", "com.example.admin",
                                         dict({{kAllowedEntitlement, Value::boolean(true)}}));
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created made = createContainer(*c, "com.example.rename", 2);
    ASSERT_FALSE(made.path.empty());
    ASSERT_EQ(1u, replyCode(setInfoValue(*c, made.ref, "kept", Value::string("yes"))));

    EXPECT_EQ(1u, replyCode(regenerateDirectoryUUID(*c, made.ref)));
    EXPECT_NE(0, ::access(made.path.c_str(), F_OK));
    Created again = createContainer(*c, "com.example.rename", 2);
    EXPECT_EQ(made.ref.uuid, again.ref.uuid);
    EXPECT_NE(made.path, again.path);
    EXPECT_EQ(parentPath(made.path), parentPath(again.path));
    std::string name = lastPathComponent(again.path);
    ASSERT_TRUE(Uuid::parse(name));
    EXPECT_EQ(Uuid::parse(name)->string(), name);
    EXPECT_EQ(0, ::access(joinPath(again.path, "Documents").c_str(), F_OK));
    EXPECT_EQ(Value::string(again.path), *metadata(*c, made.ref, false).body.find("ReplyPath"));
    uint64_t code = 0;
    EXPECT_EQ(Value::string("yes"), infoValue(*c, made.ref, "kept", &code));
    // The sandbox state follows: a fresh daemon reading it finds the new place.
    auto listed = daemon.run(admin, {"containersWithClass", "ContainerClass=2"});
    EXPECT_EQ(1u, listed.code());
    c.reset();
    daemon.stop();
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    c = connectTo(daemon);
    ASSERT_TRUE(c);
    EXPECT_EQ(again.path, createContainer(*c, "com.example.rename", 2).path);

    // A directory not named by a UUID (a well-known system group container): 11, and
    // it stays where it is.
    Created named = createContainer(*c, "systemgroup.com.tarrow.sharedsettings", 13);
    ASSERT_FALSE(named.path.empty());
    ASSERT_FALSE(Uuid::parse(lastPathComponent(named.path)));
    EXPECT_EQ(11u, replyCode(regenerateDirectoryUUID(*c, named.ref)));
    EXPECT_EQ(0, ::access(named.path.c_str(), F_OK));
    EXPECT_EQ(named.path, createContainer(*c, "systemgroup.com.tarrow.sharedsettings", 13).path);
}

namespace {

uint64_t usage(VSLConnection& c, const VSLContainerRef& ref) {
    auto r = diskUsage(c, ref);
    EXPECT_EQ(1u, replyCode(r));
    const Value* v = r.body.find("ReplyDiskUsage");
    return v && v->uint64Value() ? *v->uint64Value() : 0;
}

void addFile(const std::string& path, size_t bytes) { std::ofstream(path, std::ios::binary) << std::string(bytes, 'x'); }

}  // namespace

TEST(DiskUsage, BundleContainersAnswerFromTheCachedValueUnlessFastSizingIsOn) {
    for (bool fast : {false, true}) {
        SCOPED_TRACE(fast ? "fast sizing on" : "fast sizing off");
        DaemonProcess daemon;
        writeDeviceFacts(daemon, dict({{"FeatureFlags", dict({{"fast_container_sizing", Value::boolean(fast)}})}}));
        registerSelf(daemon);
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        auto c = connectTo(daemon);
        ASSERT_TRUE(c);
        Created bundle = createContainer(*c, "com.example.bundle", 1);
        Created data = createContainer(*c, "com.example.data", 2);
        ASSERT_FALSE(bundle.path.empty());
        ASSERT_FALSE(data.path.empty());
        addFile(joinPath(bundle.path, "one"), 1000);
        addFile(joinPath(data.path, "Documents/one"), 1000);
        const uint64_t first = usage(*c, bundle.ref);
        EXPECT_GE(first, 1000u);
        addFile(joinPath(bundle.path, "two"), 5000);
        addFile(joinPath(data.path, "Documents/two"), 5000);
        const uint64_t second = usage(*c, bundle.ref);
        uint64_t code = 0;
        Value cached = infoValue(*c, bundle.ref, "StaticDiskUsage", &code);
        if (fast) {
            EXPECT_EQ(first + 5000, second);
            EXPECT_EQ(24u, code);
        } else {
            EXPECT_EQ(first, second);
            EXPECT_EQ(Value::uint64(first), cached);
        }
        // Data containers are measured every time and cache nothing.
        EXPECT_GE(usage(*c, data.ref), 6000u);
        infoValue(*c, data.ref, "StaticDiskUsage", &code);
        EXPECT_EQ(24u, code);
        VSLContainerRef absent = data.ref;
        absent.uuid = Uuid::random();
        EXPECT_EQ(21u, replyCode(diskUsage(*c, absent)));
    }
}
