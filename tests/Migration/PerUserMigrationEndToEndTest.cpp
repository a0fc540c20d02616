// The per-user migration against a real daemon: skeletons restored once, retired
// containers removed every time, protection classes given to data containers of
// applications that are not installed, refused without the entitlement.
#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/xattr.h>

#include <chrono>
#include <functional>
#include <thread>

#include "Client/VSLContainerInfo.h"
#include "Client/VSLMigration.h"
#include "Client/VSLProtection.h"
#include "Client/VSLProtocol.h"
#include "Platform/ProtectionClass.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using namespace vsl::client;

namespace {

bool isDirectory(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The first file named `name` below `directory`, or "".
std::string findFile(const std::string& directory, const std::string& name) {
    DIR* d = ::opendir(directory.c_str());
    if (!d) return "";
    std::string found;
    while (auto* e = ::readdir(d)) {
        std::string entry = e->d_name;
        if (entry == "." || entry == "..") continue;
        std::string path = directory + "/" + entry;
        if (entry == name) found = path;
        else if (e->d_type == DT_DIR) found = findFile(path, name);
        if (!found.empty()) break;
    }
    ::closedir(d);
    return found;
}

int classOf(const std::string& path) {
    char buf[16];
    ssize_t n = ::lgetxattr(path.c_str(), protectionClassAttributeName(), buf, sizeof buf);
    return n <= 0 ? 0 : std::stoi(std::string(buf, static_cast<size_t>(n)));
}

// The immutable flag of a directory, cleared again at scope end.
struct Immutable {
    explicit Immutable(std::string path) : path(std::move(path)) {}
    ~Immutable() { set(false); }
    bool set(bool on) {
        int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
        int flags = 0;
        bool ok = fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
        flags = on ? flags | FS_IMMUTABLE_FL : flags & ~FS_IMMUTABLE_FL;
        ok = ok && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
        if (fd >= 0) ::close(fd);
        return ok;
    }
    std::string path;
};

}  // namespace

TEST(PerUserMigration, RestoresSkeletonsOnceRemovesRetiredContainersAndIsRefusedWithoutEntitlement) {
    DaemonProcess daemon;
    std::string admin =
        daemon.addClient("admin", "com.example.admin", dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
    std::string migrator = daemon.addClient("migrator", "com.example.migrator",
                                            dict({{"com.tarrow.private.Vesselry.dataMigration", Value::boolean(true)}}));
    std::string stranger = daemon.addClient("stranger", "com.example.stranger", Value::dictionary({}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto lookup = [&](const std::string& identifier, int containerClass, bool create) {
        return daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                  "ContainerClass=" + std::to_string(containerClass),
                                  std::string("CreateIfNecessary=") + (create ? "true" : "false")});
    };

    auto app = lookup("com.example.kept", 2, true);
    ASSERT_EQ(1u, app.code()) << app.err;
    auto group = lookup("group.example.kept", 7, true);
    ASSERT_EQ(1u, group.code()) << group.err;
    std::string appPath = app.string("ReplyPath");
    ASSERT_TRUE(isDirectory(appPath + "/Documents")) << appPath;
    ASSERT_EQ(0, ::rmdir((appPath + "/Documents").c_str()));
    ASSERT_EQ(1u, lookup("com.tarrow.Almanac", 2, true).code());
    ASSERT_EQ(1u, lookup("com.tarrow.Almanac.Glance", 4, true).code());

    EXPECT_EQ(55u, daemon.run(stranger, {"performPerUserDataMigration"}).code());
    EXPECT_FALSE(isDirectory(appPath + "/Documents")) << "refused: nothing ran";
    EXPECT_EQ(1u, lookup("com.tarrow.Almanac", 2, false).code());

    auto r = daemon.run(migrator, {"migrate-user"});
    ASSERT_EQ(1u, r.code()) << r.err << readFile(daemon.at("vesseld.stderr"));
    EXPECT_TRUE(isDirectory(appPath + "/Documents"));
    EXPECT_EQ(21u, lookup("com.tarrow.Almanac", 2, false).code());
    EXPECT_EQ(21u, lookup("com.tarrow.Almanac.Glance", 4, false).code());
    EXPECT_EQ(1u, lookup("com.example.kept", 2, false).code());
    std::string status = findFile(daemon.root(), "vsl_user_migration_status.plist");
    ASSERT_FALSE(status.empty());
    EXPECT_NE(std::string::npos, readFile(status).find("SubdirectoryMigration"));

    // Recorded: the skeleton pass does not run again; the retired containers, absent
    // now, are not reported.
    ASSERT_EQ(0, ::rmdir((appPath + "/Documents").c_str()));
    r = daemon.run(migrator, {"migrate-user"});
    ASSERT_EQ(1u, r.code()) << r.err;
    EXPECT_FALSE(isDirectory(appPath + "/Documents"));
    EXPECT_EQ(std::string::npos, readFile(daemon.at("vesseld.stderr")).find("Could not delete deprecated container"));
}

TEST(PerUserMigration, ProtectsDataOfApplicationsNotInstalledAndRecordsNothingAfterAFailure) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "tester", "com.example.tester",
                                       dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
                                             {"com.tarrow.private.Vesselry.dataMigration", Value::boolean(true)}})));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    std::string error;
    auto c = VSLConnection::connect(daemon.socketPath(), &error);
    ASSERT_TRUE(c) << error;
    auto request = [&](const char* command, Dictionary d, Value* reply = nullptr) {
        d["Command"] = Value::uint64(*commandNumberForName(command));
        auto r = c->sendRequest(Value::dictionary(std::move(d)), std::chrono::seconds(60));
        if (reply) *reply = r.body;
        return replyCode(r);
    };
    auto create = [&](const std::string& identifier, uint64_t containerClass) {
        Value reply;
        EXPECT_EQ(1u, request("createOrLookup", {{"Identifier", Value::string(identifier)},
                                                 {"ContainerClass", Value::uint64(containerClass)},
                                                 {"CreateIfNecessary", Value::boolean(true)}},
                              &reply))
            << identifier;
        const Value* path = reply.find("ReplyPath");
        return path && path->stringValue() ? *path->stringValue() : std::string();
    };

    // Two applications whose entitlements ask for class 4, their data at class 3; one
    // of them is installed (has a bundle container), so the installer decides its class.
    auto entitlements = dict({{"com.tarrow.Vesselry.Entitlements",
                               dict({{"com.tarrow.developer.default-data-protection",
                                      Value::string("com.tarrow.protection.none")}})}});
    std::string installed, lonely;
    for (auto [identifier, path] : {std::pair{"com.example.installed", &installed}, {"com.example.lonely", &lonely}}) {
        ASSERT_EQ(1u, request("processCodeSigningInfo",
                              {{"Identifier", Value::string(identifier)}, {"CodeSigningInfo", entitlements}}));
        *path = create(identifier, 2);
        ASSERT_EQ(1u, setDataProtection(*c, {identifier, 2, 3, false, false}, &error)) << error;
        ASSERT_EQ(3, classOf(*path + "/Documents"));
    }
    ASSERT_FALSE(create("com.example.installed", 1).empty());
    // A removed skeleton directory that cannot be made again: the subdirectory pass fails.
    std::string broken = create("com.example.broken", 2);
    ASSERT_EQ(0, ::rmdir((broken + "/Documents").c_str()));
    Immutable frozen(broken);
    ASSERT_TRUE(frozen.set(true));

    EXPECT_EQ(6u, replyCode(performPerUserDataMigration(*c)));
    std::string status = findFile(daemon.root(), "vsl_user_migration_status.plist");
    EXPECT_TRUE(status.empty() || readFile(status).find("SubdirectoryMigration") == std::string::npos);
    std::string log = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, log.find("Failed to perform per-user data migration : ")) << log;

    // The protection pass ran all the same: once no change is pending, only the
    // application that is not installed has its entitlement's class.
    const std::string pending = daemon.at("private/var/root/Library/Vesselry/PendingUpdates");
    for (int i = 0; i < 600 && (classOf(lonely + "/Documents") != 4 || !entriesOf(pending).empty()); i++)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(4, classOf(lonely + "/Documents"));
    EXPECT_EQ(3, classOf(installed + "/Documents"));

    ASSERT_TRUE(frozen.set(false));
    EXPECT_EQ(1u, replyCode(performPerUserDataMigration(*c)));
    status = findFile(daemon.root(), "vsl_user_migration_status.plist");
    ASSERT_FALSE(status.empty());
    EXPECT_NE(std::string::npos, readFile(status).find("SubdirectoryMigration"));
}
