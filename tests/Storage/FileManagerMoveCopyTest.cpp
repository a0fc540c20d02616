#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/Storage/VSLFileManager.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {
VSLFileManager& fm() { return VSLFileManager::defaultManager(); }

std::string xattrOf(const std::string& path, const char* name) {
    char buf[256];
    ssize_t n = ::lgetxattr(path.c_str(), name, buf, sizeof buf);
    return n < 0 ? "(none)" : std::string(buf, static_cast<size_t>(n));
}

void setTimes(const std::string& path, time_t atime, time_t mtime) {
    struct timespec times[2] = {{atime, 111}, {mtime, 222}};
    ASSERT_EQ(0, ::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW)) << path;
}

void setAcl(const std::string& path, acl_type_t type, const char* text) {
    acl_t acl = acl_from_text(text);
    ASSERT_TRUE(acl);
    ASSERT_EQ(0, acl_set_file(path.c_str(), type, acl)) << path << ": " << std::strerror(errno);
    acl_free(acl);
}

// Everything a copy must keep, of one item.
void expectSameItem(const std::string& from, const std::string& to) {
    struct stat a = lstatOf(from), b = lstatOf(to);
    EXPECT_EQ(a.st_mode, b.st_mode) << to;
    EXPECT_EQ(a.st_uid, b.st_uid) << to;
    EXPECT_EQ(a.st_gid, b.st_gid) << to;
    EXPECT_EQ(a.st_mtim.tv_sec, b.st_mtim.tv_sec) << to;
    EXPECT_EQ(a.st_mtim.tv_nsec, b.st_mtim.tv_nsec) << to;
    if (S_ISLNK(a.st_mode)) return;
    EXPECT_EQ(a.st_atim.tv_sec, b.st_atim.tv_sec) << to;
    EXPECT_EQ(xattrOf(from, "user.note"), xattrOf(to, "user.note")) << to;
    EXPECT_EQ(aclText(from, ACL_TYPE_ACCESS), aclText(to, ACL_TYPE_ACCESS)) << to;
    if (S_ISDIR(a.st_mode)) {
        EXPECT_EQ(aclText(from, ACL_TYPE_DEFAULT), aclText(to, ACL_TYPE_DEFAULT)) << to;
    }
    if (S_ISREG(a.st_mode)) {
        EXPECT_EQ(readFile(from), readFile(to)) << to;
    }
}

// A small tree with every kind of item and attribute a copy must keep.
void makeRichTree(const std::string& tree, const std::string& outside) {
    ASSERT_EQ(0, ::mkdir(tree.c_str(), 0750));
    ASSERT_EQ(0, ::mkdir((tree + "/sub").c_str(), 0755));
    writeText(tree + "/sub/tool", "#!/bin/sh\n", 0751);
    writeText(tree + "/plain", std::string(100000, 'p'), 0640);
    ASSERT_EQ(0, ::setxattr((tree + "/plain").c_str(), "user.note", "kept", 4, 0));
    setAcl(tree + "/plain", ACL_TYPE_ACCESS, "u::rw-,g::r--,g:4242:rw-,m::rw-,o::---");
    setAcl(tree + "/sub", ACL_TYPE_DEFAULT, "u::rwx,g::---,g:4242:r-x,m::r-x,o::---");
    ASSERT_EQ(0, ::symlink(outside.c_str(), (tree + "/sub/out").c_str()));
    ASSERT_EQ(0, ::symlink("missing", (tree + "/dangling").c_str()));
    ASSERT_EQ(0, ::mkfifo((tree + "/fifo").c_str(), 0620));
    if (runningAsRoot()) {
        ASSERT_EQ(0, ::lchown((tree + "/plain").c_str(), 1234, 5678));
    }
    for (const char* p : {"/sub/tool", "/plain", "/sub/out", "/dangling", "/fifo", "/sub", ""})
        setTimes(tree + p, 4000000000, 1100000000);  // atime ahead: reading must not move it
}
}  // namespace

TEST(FileManagerMove, MissingSourceIsSuccessOnlyForTheIfExistsForm) {
    TempRoot root;
    VSLErrorRef error;
    EXPECT_TRUE(fm().moveItemIfExistsAtURL(root.at("nothing"), root.at("dest"), &error));
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(root.at("dest")));
    EXPECT_TRUE(fm().copyItemIfExistsAtURL(root.at("nothing"), root.at("dest"), &error));
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(root.at("dest")));

    EXPECT_FALSE(fm().moveItemAtURL(root.at("nothing"), root.at("dest"), &error));
    EXPECT_EQ(ENOENT, error->code);
    EXPECT_EQ("rename of " + root.at("nothing") + " to " + root.at("dest") + " failed: No such file or directory",
              *error->localizedDescription);
    EXPECT_FALSE(fm().copyItemAtURL(root.at("nothing"), root.at("dest"), &error));
    EXPECT_EQ(ENOENT, error->code);

    // A move replaces a destination file, as rename does.
    writeText(root.at("a"), "new");
    writeText(root.at("b"), "old");
    ASSERT_TRUE(fm().moveItemAtURL(root.at("a"), root.at("b"), &error));
    EXPECT_EQ("new", readFile(root.at("b")));
}

TEST(FileManagerMove, FallsBackToCopyAndRemoveAcrossFileSystems) {
    TempRoot root;
    char templ[] = "/dev/shm/vessel-xdev-XXXXXX";
    if (!::mkdtemp(templ)) GTEST_SKIP() << "no /dev/shm to move across to";
    std::string other = templ;
    if (lstatOf(other).st_dev == lstatOf(root.path()).st_dev) {
        removeTree(other);
        GTEST_SKIP() << "/dev/shm and " << root.path() << " are one file system; no second one to move across";
    }
    std::string source = root.at("tree");
    makeRichTree(source, root.at("outside"));
    std::string reference = root.at("reference");
    VSLErrorRef error;
    ASSERT_TRUE(fm().copyItemAtURL(source, reference, &error)) << error->description();

    std::string dest = other + "/moved";
    ASSERT_TRUE(fm().moveItemAtURL(source, dest, &error)) << error->description();
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(source));
    for (const char* p : {"", "/sub", "/sub/tool", "/plain", "/sub/out", "/dangling", "/fifo"})
        expectSameItem(reference + p, dest + p);
    removeTree(other);
}

TEST(FileManagerCopy, KeepsDataModeOwnerTimesXattrsAndACLsAndCopiesLinksAsLinks) {
    TempRoot root;
    std::string outside = root.at("outside");
    ASSERT_EQ(0, ::mkdir(outside.c_str(), 0755));
    writeText(outside + "/secret", "not to be copied");
    std::string source = root.at("tree");
    makeRichTree(source, outside);

    // The destination directory hands a default ACL to what is made in it; the copy
    // must carry the source's ACLs, not that inheritance.
    std::string destDir = root.at("inheriting");
    ASSERT_EQ(0, ::mkdir(destDir.c_str(), 0755));
    setAcl(destDir, ACL_TYPE_DEFAULT, "u::rwx,g::---,g:4343:rwx,m::rwx,o::---");

    std::string dest = destDir + "/copy";
    VSLErrorRef error;
    ASSERT_TRUE(fm().copyItemAtURL(source, dest, &error)) << error->description();
    for (const char* p : {"", "/sub", "/sub/tool", "/plain", "/sub/out", "/dangling", "/fifo"})
        expectSameItem(source + p, dest + p);
    EXPECT_TRUE(S_ISLNK(lstatOf(dest + "/sub/out").st_mode));
    char target[256] = {0};
    ASSERT_GT(::readlink((dest + "/sub/out").c_str(), target, sizeof target - 1), 0);
    EXPECT_EQ(outside, target);

    // Copying again merges into the directory and replaces files; into itself never.
    writeText(source + "/plain", "changed", 0600);
    ASSERT_TRUE(fm().copyItemAtURL(source, dest, &error)) << error->description();
    EXPECT_EQ("changed", readFile(dest + "/plain"));
    EXPECT_FALSE(fm().copyItemAtURL(source, source + "/sub/inner", &error));
    EXPECT_EQ(EINVAL, error->code);
    EXPECT_EQ("copyfile of " + source + " to " + source + "/sub/inner failed: Invalid argument",
              *error->localizedDescription);
}
