#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {
VSLFileManager& fm() { return VSLFileManager::defaultManager(); }

class UmaskGuard {
public:
    explicit UmaskGuard(mode_t m) : old_(::umask(m)) {}
    ~UmaskGuard() { ::umask(old_); }

private:
    mode_t old_;
};
}  // namespace

TEST(FileManagerCreate, MakesParentsWithTheExactModeAndReappliesOwnerAndClassOnlyWhereTheyDiffer) {
    TempRoot root;
    UmaskGuard umask(077);  // must not narrow what was asked for
    std::string deep = root.at("a/b/c");
    VSLErrorRef error;
    ASSERT_TRUE(fm().createDirectoryAtURL(deep, true, 0755, &error)) << error->description();
    for (const char* p : {"a", "a/b", "a/b/c"}) EXPECT_EQ(0755u, modeOf(root.at(p))) << p;

    // Without intermediates a missing parent is an error carrying errno.
    ASSERT_FALSE(fm().createDirectoryAtURL(root.at("x/y"), false, 0755, &error));
    EXPECT_EQ(ENOENT, error->code);
    EXPECT_EQ("mkdir of " + root.at("x/y") + " failed: No such file or directory", *error->localizedDescription);

    // A file in the way is not a directory that "already exists".
    writeText(root.at("file"), "x");
    EXPECT_FALSE(fm().createDirectoryAtURL(root.at("file"), true, 0755, &error));

    // An existing directory gets the class; its mode stays as it was.
    ::chmod(deep.c_str(), 0700);
    ASSERT_TRUE(fm().createDirectoryAtURL(deep, true, 0755, VSLDataProtectionClass(4), &error));
    EXPECT_EQ("4", protectionClassAttribute(deep));
    EXPECT_EQ(0700u, modeOf(deep));

    if (runningAsRoot()) {
        ASSERT_EQ(0, ::chown(deep.c_str(), 0, 0));
        ASSERT_TRUE(fm().createDirectoryAtURL(deep, true, 0755, uid_t(33), &error));
        EXPECT_EQ(33u, lstatOf(deep).st_uid);
        EXPECT_EQ(33u, lstatOf(deep).st_gid);
    }
    // Asking again for what is already there writes nothing.
    uint64_t steps = durable::stepCount();
    ASSERT_TRUE(fm().createDirectoryAtURL(deep, true, 0755, runningAsRoot() ? 33 : 0, VSLDataProtectionClass(4),
                                          &error));
    EXPECT_EQ(steps, durable::stepCount());
}

TEST(FileManagerProtectionClass, ReadsWhatWasSetAndRefusesCompleteProtectionChangesWhileLocked) {
    TempRoot root;
    std::string file = root.at("f");
    writeText(file, "data");
    VSLDataProtectionClass cls = kVSLDataProtectionClassUnset;
    VSLErrorRef error;
    ASSERT_TRUE(fm().dataProtectionClassOfItemAtURL(file, &cls, &error));
    EXPECT_EQ(kVSLDataProtectionClassNotExplicit, cls);
    ASSERT_TRUE(fm().setDataProtectionClassOfItemAtURL(file, VSLDataProtectionClass(3), nullptr, &error));
    ASSERT_TRUE(fm().dataProtectionClassOfItemAtURL(file, &cls, &error));
    EXPECT_EQ(3u, cls);

    root.writeFile("run/vesseld/keybag/lockstate", "1");
    EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(file, kVSLDataProtectionClassComplete, nullptr, &error));
    EXPECT_EQ(EPERM, error->code);
    EXPECT_EQ("Failed to setclass(1) on file " + file + ": Operation not permitted", *error->localizedDescription);
    EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(file, VSLDataProtectionClass(4), nullptr, &error))
        << "classes other than 1 change while locked";

    root.writeFile("run/vesseld/keybag/lockstate", "0");
    ASSERT_TRUE(fm().setDataProtectionClassOfItemAtURL(file, kVSLDataProtectionClassComplete, nullptr, &error));
    root.writeFile("run/vesseld/keybag/lockstate", "1");
    EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(file, VSLDataProtectionClass(2), nullptr, &error));
    EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(file, kVSLDataProtectionClassComplete, nullptr, &error))
        << "no change is no refusal";

    // A predicate sees the current class and may decline: success without change.
    VSLDataProtectionClass seen = kVSLDataProtectionClassUnset;
    EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(
        file, VSLDataProtectionClass(3),
        [&](VSLDataProtectionClass current) {
            seen = current;
            return false;
        },
        &error));
    EXPECT_EQ(kVSLDataProtectionClassComplete, seen);
    EXPECT_EQ("1", protectionClassAttribute(file));

    // A link is not followed to its target.
    ASSERT_EQ(0, ::symlink(file.c_str(), root.at("link").c_str()));
    EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(root.at("link"), VSLDataProtectionClass(3), nullptr, &error));
    EXPECT_EQ("Failed to open " + root.at("link") + " : Too many levels of symbolic links", *error->localizedDescription);
    EXPECT_FALSE(fm().dataProtectionClassOfItemAtURL(root.at("missing"), &cls, &error));
    EXPECT_EQ(ENOENT, error->code);
}

TEST(FileManagerListing, ListsVisibleEntriesAndAnswersExistenceWithoutFollowingLinks) {
    TempRoot root;
    std::string dir = root.at("d");
    ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((dir + "/sub").c_str(), 0755));
    writeText(dir + "/file", "x");
    writeText(dir + "/.com.tarrow.vesselry.metadata.plist", "x");
    writeText(dir + "/.hidden", "x");
    ASSERT_EQ(0, ::symlink("sub", (dir + "/linkToDir").c_str()));
    ASSERT_EQ(0, ::symlink("nowhere", (dir + "/dangling").c_str()));

    VSLErrorRef error;
    auto items = fm().urlsForItemsInDirectoryAtURL(dir, &error);
    ASSERT_TRUE(items);
    std::vector<std::string> names;
    for (const auto& item : *items) {
        names.push_back(lastPathComponent(item.path));
        EXPECT_EQ(item.path == dir + "/sub", item.isDirectory) << item.path;
    }
    std::sort(names.begin(), names.end());
    EXPECT_EQ((std::vector<std::string>{"dangling", "file", "linkToDir", "sub"}), names);

    EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(root.at("missing"), &error));
    EXPECT_EQ(ENOENT, error->code);
    EXPECT_EQ("_IterateDirectory for " + root.at("missing") + " returned No such file or directory",
              *error->localizedDescription);

    EXPECT_TRUE(fm().itemExistsAtURL(dir + "/dangling"));
    EXPECT_FALSE(fm().itemDoesNotExistAtURL(dir + "/dangling"));
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(dir + "/missing"));
    // Neither answer is sure when lstat fails otherwise.
    EXPECT_FALSE(fm().itemExistsAtURL(dir + "/file/below"));
    EXPECT_FALSE(fm().itemDoesNotExistAtURL(dir + "/file/below"));
}

TEST(FileManagerTemporaryDirectory, MakesUniquePrivateDirectoriesWithThePrefix) {
    TempRoot root;
    VSLErrorRef error;
    auto a = fm().createTemporaryDirectoryInDirectoryURL(root.path(), &error);
    auto b = fm().createTemporaryDirectoryInDirectoryURL(root.path(), "com.tarrow.UserManagedAssets.", &error);
    ASSERT_TRUE(a && b);
    EXPECT_EQ(0u, lastPathComponent(*a).find("temp."));
    EXPECT_EQ(std::string("temp.").size() + 6, lastPathComponent(*a).size());
    EXPECT_EQ(0u, lastPathComponent(*b).find("com.tarrow.UserManagedAssets."));
    EXPECT_EQ(0700u, modeOf(*a));
    EXPECT_NE(*a, *fm().createTemporaryDirectoryInDirectoryURL(root.path(), &error));
    EXPECT_FALSE(fm().createTemporaryDirectoryInDirectoryURL(root.at("missing"), &error));
    EXPECT_EQ(ENOENT, error->code);
}

TEST(FileManagerHomeDirectory, ResolvesThePasswordEntryOrFallsBackToMobile) {
    TempRoot root;
    ASSERT_EQ(0, ::symlink("private/var", root.at("var").c_str()));
    root.writeFile("etc/passwd", "mobile:x:501:501::/var/mobile:/bin/sh\n");
    EXPECT_EQ(root.at("private/var/mobile"), VSLFileManager::homeDirectoryURLForPOSIXUID(501)) << "a real path";
    EXPECT_EQ(root.at("private/var/mobile"), VSLFileManager::homeDirectoryURLForPOSIXUID(777));
}
