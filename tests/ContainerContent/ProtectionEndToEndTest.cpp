// Protection-class changes end to end: the walk over a data container's user data,
// the pending-update file, a locked device with retry after unlock under a
// termination assertion, superseded changes, and changes resumed at the next start.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <future>
#include <thread>

#include "Client/VSLProtection.h"
#include "Client/VSLReplaceContainer.h"
#include "ContainerContent/ContentSupport.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/ProtectionClass.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using namespace vsl::client;
namespace fs = std::filesystem;

namespace {

constexpr const char* kApp = "com.example.app";
constexpr const char* kClassKey = "com.tarrow.Stowage.ContentProtectionClass";

int classOf(const std::string& path) {
    char buf[16];
    ssize_t n = ::lgetxattr(path.c_str(), protectionClassAttributeName(), buf, sizeof buf);
    return n <= 0 ? 0 : std::stoi(std::string(buf, static_cast<size_t>(n)));
}

void setClassOf(const std::string& path, int cls) {
    std::string text = std::to_string(cls);
    ASSERT_EQ(0, ::setxattr(path.c_str(), protectionClassAttributeName(), text.data(), text.size(), 0)) << path;
}

void makeFile(const std::string& path, int cls) {
    fs::create_directories(fs::path(path).parent_path());
    { std::ofstream(path) << "data"; }
    if (cls) setClassOf(path, cls);
}

std::string pendingDirectory(const DaemonProcess& daemon) {
    return daemon.at("private/var/root/Library/Vesselry/PendingUpdates");
}

std::vector<std::string> pendingFiles(const DaemonProcess& daemon) {
    std::vector<std::string> names;
    std::error_code ec;
    for (const auto& e : fs::directory_iterator(pendingDirectory(daemon), ec))
        if (e.path().filename().string()[0] != '.') names.push_back(e.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

std::string pendingName(const Created& c) {
    struct stat st {};
    ::stat(c.path.c_str(), &st);
    return c.ref.identifier + "-2-" + std::to_string(st.st_uid) + ".plist";
}

std::string internalID(const DaemonProcess& daemon, const std::string& name) {
    VSLErrorRef error;
    auto d = VSL_dictionaryWithContentsOfURL(pendingDirectory(daemon) + "/" + name, 0, &error);
    const Value* v = d ? d->find("VSLDataOperationInternalID") : nullptr;
    return v && v->stringValue() ? *v->stringValue() : std::string();
}

uint64_t protect(const DaemonProcess& daemon, const std::string& identifier, int64_t cls, bool retry = false,
                 bool thirdParty = false) {
    auto c = connectTo(daemon);
    if (!c) return 0;
    std::string error;
    return setDataProtection(*c, {identifier, 2, cls, thirdParty, retry}, &error, std::chrono::seconds(60));
}

std::future<uint64_t> protectAsync(const DaemonProcess& daemon, const std::string& identifier, int64_t cls) {
    auto c = connectTo(daemon);
    return std::async(std::launch::async, [c, identifier, cls] {
        std::string error;
        return c ? setDataProtection(*c, {identifier, 2, cls, false, true}, &error) : 0;
    });
}

std::optional<int64_t> recordedClass(client::VSLConnection& c, const Created& created) {
    auto r = infoValueForKey(c, created.ref, kClassKey);
    const Value* v = r.body.find("ReplyInfoValue");
    return v ? v->signedNumber() : std::nullopt;
}

void startDaemon(DaemonProcess& daemon) {
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
}

void keybag(const DaemonProcess& daemon, const char* verb) {
    auto r = daemon.run(vesselctlPath(), {"keybag", verb});
    ASSERT_EQ(0, r.exitCode) << r.err;
}

bool exitsKilled(pid_t pid) {
    for (int i = 0; i < 1000; i++) {
        int status = 0;
        if (::waitpid(pid, &status, WNOHANG) == pid) return WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

// Two class-2 containers at class 3, each with a file at class 3; the daemon is then
// restarted with the device locked, so that changes to class 1 park.
std::pair<Created, Created> preparedAndLocked(DaemonProcess& daemon, const std::string& second) {
    Created first, other;
    {
        auto c = connectTo(daemon);
        if (!c) return {};
        first = createContainer(*c, kApp, 2);
        other = createContainer(*c, second, 2);
        EXPECT_EQ(1u, protect(daemon, kApp, 3));
        EXPECT_EQ(1u, protect(daemon, second, 3));
        makeFile(first.path + "/Documents/a", 3);
        makeFile(other.path + "/Documents/a", 3);
    }
    EXPECT_EQ(0, daemon.stop());
    keybag(daemon, "lock");
    startDaemon(daemon);
    return {first, other};
}

}  // namespace

TEST(Protection, ReclassesUserDataThroughTheWalkAndRecordsTheClass) {
    DaemonProcess daemon;
    registerSelf(daemon);
    startDaemon(daemon);
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created app = createContainer(*c, kApp, 2);
    ASSERT_FALSE(app.path.empty());
    const std::string p = app.path;
    fs::create_directories(p + "/Tillbox/inner");
    fs::create_directories(p + "/Library/kept2");
    setClassOf(p + "/Library/kept2", 2);
    makeFile(p + "/Documents/deep/a", 3);
    makeFile(p + "/Library/b2", 2);
    makeFile(p + "/tmp/c1", 1);
    makeFile(p + "/Tillbox/inner/d", 3);
    makeFile(p + "/SystemData/outside-user-data", 3);
    makeFile(daemon.at("outside"), 3);
    fs::create_symlink(daemon.at("outside"), p + "/Documents/link");
    fs::create_symlink(daemon.at("outside"), p + "/Tillbox/inner/dlink");

    // 0 -> 3: directories only.
    ASSERT_EQ(1u, protect(daemon, kApp, 3));
    for (const char* d : {"/Documents", "/Documents/deep", "/Library", "/tmp", "/Tillbox", "/Tillbox/inner"})
        EXPECT_EQ(3, classOf(p + d)) << d;
    EXPECT_EQ(2, classOf(p + "/Library/kept2"));
    EXPECT_EQ(0, classOf(p + "/SystemData"));
    EXPECT_EQ(3, recordedClass(*c, app));

    // 3 -> 1: directories and files, class-2 items and links left alone.
    ASSERT_EQ(1u, protect(daemon, kApp, 1));
    for (const char* d : {"/Documents", "/Documents/deep", "/Library", "/tmp", "/Tillbox", "/Tillbox/inner"})
        EXPECT_EQ(1, classOf(p + d)) << d;
    EXPECT_EQ(1, classOf(p + "/Documents/deep/a"));
    EXPECT_EQ(1, classOf(p + "/Tillbox/inner/d"));
    EXPECT_EQ(1, classOf(p + "/tmp/c1"));
    EXPECT_EQ(2, classOf(p + "/Library/b2"));
    EXPECT_EQ(2, classOf(p + "/Library/kept2"));
    EXPECT_EQ(3, classOf(p + "/SystemData/outside-user-data"));
    EXPECT_EQ(3, classOf(daemon.at("outside")));  // never reached through the links
    EXPECT_EQ(1, recordedClass(*c, app));
    EXPECT_TRUE(pendingFiles(daemon).empty());

    // 1 -> 3: directories only; files keep class 1.
    ASSERT_EQ(1u, protect(daemon, kApp, 3));
    EXPECT_EQ(3, classOf(p + "/Documents/deep"));
    EXPECT_EQ(1, classOf(p + "/Documents/deep/a"));
    EXPECT_EQ(3, recordedClass(*c, app));

    // The recorded class again: a stale pending file goes, nothing is walked.
    setClassOf(p + "/Documents", 4);
    writeRootFile(daemon, "private/var/root/Library/Vesselry/PendingUpdates/" + pendingName(app), "stale");
    ASSERT_EQ(1u, protect(daemon, kApp, 3));
    EXPECT_TRUE(pendingFiles(daemon).empty());
    EXPECT_EQ(4, classOf(p + "/Documents"));

    // Refused before anything is written.
    EXPECT_EQ(38u, protect(daemon, kApp, 2));
    EXPECT_EQ(38u, protect(daemon, kApp, 4, false, true));
    EXPECT_EQ(38u, protect(daemon, kApp, 2, false, true));
    EXPECT_EQ(1u, protect(daemon, kApp, 0, false, true));
    for (const char* bad : {"..", ".", "a/b", "../../x"}) EXPECT_EQ(11u, protect(daemon, bad, 1)) << bad;
    auto bundle = daemon.run(vesselctlPath(), {"protect", "1", std::string("Identifier=") + kApp, "ContainerClass=1"});
    EXPECT_EQ(11u, bundle.code());
    EXPECT_TRUE(pendingFiles(daemon).empty());
    EXPECT_EQ(21u, protect(daemon, "com.example.none", 1));

    // vesselctl protect --json answers from the completion too.
    std::string out, err;
    EXPECT_EQ(0, runProgram({vesselctlPath(), "--root", daemon.root(), "--json", "protect", "1",
                             std::string("Identifier=") + kApp},
                            &out, &err))
        << err;
    EXPECT_NE(std::string::npos, out.find("\"ReplyError\":1")) << out;
    EXPECT_EQ(1, recordedClass(*c, app));
}

TEST(Protection, ALockedDeviceParksTheChangeUntilUnlockWithTheAppHeldTerminated) {
    DaemonProcess daemon;
    writeDeviceFacts(daemon, dict({{"InternalBuild", Value::boolean(true)}}));
    registerSelf(daemon);
    std::string victimPath = daemon.at("victim-sleep");
    fs::copy_file("/bin/sleep", victimPath);
    ASSERT_TRUE(daemon.registerProgram(victimPath, "victim", kApp, dict({})));
    startDaemon(daemon);
    Created app = preparedAndLocked(daemon, "com.example.other").first;
    ASSERT_FALSE(app.path.empty());
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);

    // Without retry the change fails at once and leaves no file.
    EXPECT_EQ(61u, protect(daemon, "com.example.other", 1));
    EXPECT_TRUE(pendingFiles(daemon).empty());

    pid_t victim = ::fork();
    if (victim == 0) {
        ::execl(victimPath.c_str(), victimPath.c_str(), "300", static_cast<char*>(nullptr));
        ::_exit(127);
    }
    ASSERT_GT(victim, 0);

    auto first = protectAsync(daemon, kApp, 1);
    ASSERT_TRUE(waitForLog(daemon, "Retrying container protection update to 1 on next unlock"));
    ASSERT_EQ(std::vector<std::string>{pendingName(app)}, pendingFiles(daemon));
    std::string firstID = internalID(daemon, pendingName(app));
    EXPECT_EQ(std::future_status::timeout, first.wait_for(std::chrono::milliseconds(200)));

    // A second request replaces the first one's file and parks too.
    auto second = protectAsync(daemon, kApp, 1);
    ASSERT_TRUE(waitForLog(daemon, "Retrying container protection update to 1 on next unlock", 2));
    ASSERT_EQ(std::vector<std::string>{pendingName(app)}, pendingFiles(daemon));
    EXPECT_NE(firstID, internalID(daemon, pendingName(app)));
    int status = 0;
    EXPECT_EQ(0, ::waitpid(victim, &status, WNOHANG));  // nothing was killed while locked
    EXPECT_FALSE(isLaunchBlocked(daemon.root(), kApp));

    ASSERT_EQ(1u, replyCode(setTestLock(*c, 5, true)));
    keybag(daemon, "unlock");
    ASSERT_EQ(std::future_status::ready, first.wait_for(std::chrono::seconds(30)));
    EXPECT_EQ(69u, first.get());
    ASSERT_TRUE(waitForLog(daemon, "Waiting on lock: 5"));
    EXPECT_TRUE(exitsKilled(victim));
    EXPECT_TRUE(isLaunchBlocked(daemon.root(), kApp));
    EXPECT_EQ("installation\n", readFile(daemon.at("run/vesseld/launch-block/com.example.app")));
    EXPECT_EQ(std::vector<std::string>{pendingName(app)}, pendingFiles(daemon));
    EXPECT_EQ(std::future_status::timeout, second.wait_for(std::chrono::milliseconds(0)));
    EXPECT_EQ(3, classOf(app.path + "/Documents/a"));

    ASSERT_EQ(1u, replyCode(setTestLock(*c, 5, false)));
    ASSERT_EQ(std::future_status::ready, second.wait_for(std::chrono::seconds(30)));
    EXPECT_EQ(1u, second.get());
    EXPECT_EQ(1, classOf(app.path + "/Documents/a"));
    EXPECT_FALSE(isLaunchBlocked(daemon.root(), kApp));
    EXPECT_TRUE(pendingFiles(daemon).empty());
    EXPECT_EQ(1, recordedClass(*c, app));
}

TEST(Protection, PendingChangesResumeAtTheNextStartAndAMovedContainerCancelsItsChange) {
    DaemonProcess daemon;
    registerSelf(daemon);
    startDaemon(daemon);
    auto [app, moved] = preparedAndLocked(daemon, "com.example.moved");
    ASSERT_FALSE(moved.path.empty());
    auto parkedApp = protectAsync(daemon, kApp, 1);
    auto parkedMoved = protectAsync(daemon, "com.example.moved", 1);
    ASSERT_TRUE(waitForLog(daemon, "Retrying container protection update to 1 on next unlock", 2));
    daemon.kill();
    EXPECT_EQ(0u, parkedApp.get());  // the daemon died before answering
    EXPECT_EQ(0u, parkedMoved.get());
    ASSERT_EQ(2u, pendingFiles(daemon).size());
    writeRootFile(daemon, "private/var/root/Library/Vesselry/PendingUpdates/damaged.plist", "not a property list");

    startDaemon(daemon);
    EXPECT_TRUE(waitForLog(daemon, "Found pending data protection operation at", 3));
    EXPECT_TRUE(waitForLog(daemon, "Failed to read data protection change operation at"));
    EXPECT_TRUE(waitForLog(daemon, "Retrying container protection update to 1 on next unlock", 4));

    // An update replaces the moved container while its change is parked.
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Value reply;
    ASSERT_EQ(1u, send(*c,
                       {{"Command", Value::uint64(0)},
                        {"Identifier", Value::string("com.example.moved")},
                        {"ContainerClass", Value::uint64(2)},
                        {"CreateIfNecessary", Value::boolean(true)},
                        {"Transient", Value::boolean(true)}},
                       &reply));
    ASSERT_TRUE(reply.find("ReplyUUID"));
    std::string error;
    ASSERT_EQ(1u, replaceContainer(*c, VSLContainerReference{"com.example.moved", 2, moved.ref.uuid, std::nullopt},
                                   VSLContainerReference{"com.example.moved", 2, *reply.find("ReplyUUID")->uuidValue(),
                                                         std::nullopt},
                                   &error))
        << error;

    keybag(daemon, "unlock");
    EXPECT_TRUE(waitForLog(daemon, "Cancelling data protection operation because container path changed on disk"));
    for (int i = 0; i < 1000 && pendingFiles(daemon).size() > 1; i++)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(std::vector<std::string>{"damaged.plist"}, pendingFiles(daemon));
    EXPECT_EQ(1, classOf(app.path + "/Documents/a"));
    EXPECT_EQ(1, recordedClass(*c, app));
}

TEST(Protection, NewDataContainersTakeTheClassTheirEntitlementsName) {
    DaemonProcess daemon;
    registerSelf(daemon);
    startDaemon(daemon);
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    auto store = [&](const std::string& identifier, const char* key, const char* level) {
        Dictionary entitlements;
        if (key) entitlements.emplace(key, Value::string(level));
        return send(*c, {{"Command", Value::uint64(18)},
                         {"Identifier", Value::string(identifier)},
                         {"CodeSigningInfo", dict({{"com.tarrow.Vesselry.Entitlements", Value::dictionary(entitlements)},
                                                   {"Version", Value::uint64(3)}})}});
    };
    struct Case {
        const char* identifier;
        const char* key;
        const char* level;
        int expected;
    } cases[] = {
        {"com.example.complete", "com.tarrow.developer.default-data-protection", "com.tarrow.protection.complete", 1},
        {"com.example.none", "data-protection-class", "com.tarrow.protection.none", 4},
        {"com.example.writeonly", "DataProtectionClass", "com.tarrow.protection.write-only", 2},
        {"com.example.firstauth", "DataProtectionClass", "com.tarrow.protection.complete-until-user-authentication", 3},
        {"com.example.unknown", "DataProtectionClass", "complete", 0},
        {"com.example.plain", nullptr, nullptr, 0},
    };
    for (const auto& k : cases) {
        ASSERT_EQ(1u, store(k.identifier, k.key, k.level)) << k.identifier;
        Created made = createContainer(*c, k.identifier, 2);
        ASSERT_FALSE(made.path.empty());
        EXPECT_EQ(k.expected, classOf(made.path + "/Documents")) << k.identifier;
        EXPECT_EQ(0, classOf(made.path + "/SystemData")) << k.identifier;
    }
    EXPECT_TRUE(waitForLog(daemon, "Unknown value for DataProtectionClass entitlement: complete; defaulting to class 0"));
}

// The walk reads each entry's class first: an entry already at the new class is not
// written (its ctime stays), every entry that changes class is written once.
TEST(Protection, TheWalkWritesOnlyEntriesWhoseClassDiffers) {
    DaemonProcess daemon;
    registerSelf(daemon);
    const std::string trace = daemon.at("durable.trace");
    ASSERT_TRUE(daemon.start({"VESSELD_DURABLE_TRACE=" + trace})) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectTo(daemon);
    ASSERT_TRUE(c);
    Created app = createContainer(*c, kApp, 2);
    ASSERT_FALSE(app.path.empty());
    const std::string p = app.path;
    std::vector<std::string> files, dirs{p + "/Documents", p + "/Documents/x", p + "/Library", p + "/tmp"};
    for (const char* f : {"/Documents/a", "/Documents/x/b", "/Library/c", "/tmp/d"}) {
        makeFile(p + f, 3);
        files.push_back(p + f);
    }
    ASSERT_EQ(1u, protect(daemon, kApp, 3));
    ASSERT_EQ(1u, protect(daemon, kApp, 1));  // directories and files to class 1
    ASSERT_EQ(1u, protect(daemon, kApp, 3));  // directories only: the files stay at class 1
    for (const auto& f : files) ASSERT_EQ(1, classOf(f)) << f;
    auto ctimeOf = [](const std::string& path) {
        struct stat st {};
        ::lstat(path.c_str(), &st);
        return std::pair(st.st_ctim.tv_sec, st.st_ctim.tv_nsec);
    };
    std::map<std::string, std::pair<time_t, long>> before;
    for (const auto& e : files) before[e] = ctimeOf(e);
    for (const auto& e : dirs) before[e] = ctimeOf(e);
    std::this_thread::sleep_for(std::chrono::milliseconds(30));  // ctime comes from a coarse clock

    const size_t traced = readFile(trace).size();
    ASSERT_EQ(1u, protect(daemon, kApp, 1));
    std::map<std::string, int> classWrites;  // "<n> xattr <path>" lines of this change
    std::istringstream lines(readFile(trace).substr(traced));
    for (std::string n, kind, path; lines >> n >> kind && std::getline(lines >> std::ws, path);)
        if (kind == "xattr") classWrites[path]++;
    for (const auto& d : dirs) EXPECT_EQ(1, classWrites[d]) << d << " is written once";
    for (const auto& f : files) EXPECT_EQ(0, classWrites[f]) << f;
    for (const auto& f : files) {
        EXPECT_EQ(1, classOf(f)) << f;
        EXPECT_EQ(before[f], ctimeOf(f)) << f << " was written though its class was already right";
    }
    for (const auto& d : dirs) {
        EXPECT_EQ(1, classOf(d)) << d;
        EXPECT_NE(before[d], ctimeOf(d)) << d << " changed class without a write";
    }
}
