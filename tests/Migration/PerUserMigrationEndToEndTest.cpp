// The per-user migration against a real daemon: skeletons restored once, retired
// containers removed every time, refused without the entitlement.
#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

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
