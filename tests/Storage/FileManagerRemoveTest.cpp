#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DurableIO.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {
VSLFileManager& fm() { return VSLFileManager::defaultManager(); }

// Sets or clears the immutable flag; the errno when the file system or the process cannot.
int setImmutable(const std::string& path, bool on) {
    int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) return errno;
    int flags = 0;
    int rc = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 ? 0 : errno;
    if (rc == 0) {
        flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
        rc = ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0 ? 0 : errno;
    }
    ::close(fd);
    return rc;
}

#define SKIP_WITHOUT_IMMUTABLE_FLAG(path)                                                                    \
    do {                                                                                                     \
        if (int rc_ = setImmutable(path, true))                                                              \
            GTEST_SKIP() << "cannot set the immutable flag here (" << std::strerror(rc_)                     \
                         << "): needs root (CAP_LINUX_IMMUTABLE) and a file system with inode flags, e.g. ext4"; \
    } while (0)
}  // namespace

TEST(FileManagerRemove, RemovesWholeTreesThroughDurableStepsWithoutFollowingLinks) {
    TempRoot root;
    std::string outside = root.at("outside");
    ASSERT_EQ(0, ::mkdir(outside.c_str(), 0755));
    writeText(outside + "/keep", "precious");

    std::string tree = root.at("tree");
    ASSERT_EQ(0, ::mkdir(tree.c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((tree + "/a").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((tree + "/a/b").c_str(), 0755));
    writeText(tree + "/a/b/f", "x", 0000);
    writeText(tree + "/top", "x");
    ASSERT_EQ(0, ::symlink(outside.c_str(), (tree + "/a/toOutside").c_str()));
    ASSERT_EQ(0, ::mkfifo((tree + "/fifo").c_str(), 0600));

    uint64_t steps = durable::stepCount();
    VSLErrorRef error;
    ASSERT_TRUE(fm().removeItemAtURL(tree, &error)) << error->description();
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(tree));
    EXPECT_EQ("precious", readFile(outside + "/keep"));
    EXPECT_EQ(steps + 7, durable::stepCount()) << "one durable step per item removed";

    // A missing item, or a single file, is no special case.
    EXPECT_TRUE(fm().removeItemAtURL(tree, &error));
    EXPECT_TRUE(fm().removeItemAtURL(outside + "/keep", &error));
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(outside + "/keep"));

    EXPECT_FALSE(fm().removeItemAtURL("", &error));
    EXPECT_EQ(14, error->code);
    EXPECT_EQ("nil url passed to -removeItemAtURL:error:", *error->localizedDescription);
}

TEST(FileManagerRemove, ClearsAnImmutableFlagThatBlocksRemoval) {
    TempRoot root;
    std::string tree = root.at("tree");
    ASSERT_EQ(0, ::mkdir(tree.c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((tree + "/d").c_str(), 0755));
    writeText(tree + "/d/locked", "x");
    SKIP_WITHOUT_IMMUTABLE_FLAG(tree + "/d/locked");
    ASSERT_EQ(EPERM, ::unlink((tree + "/d/locked").c_str()) == 0 ? 0 : errno) << "the flag must block removal";

    VSLErrorRef error;
    EXPECT_TRUE(fm().removeItemAtURL(tree, &error)) << (error ? error->description() : "");
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(tree));
}

TEST(FileManagerRemove, GoesOnPastItemsItCannotRemoveAndReportsTheFirstFailure) {
    TempRoot root;
    std::string tree = root.at("tree");
    ASSERT_EQ(0, ::mkdir(tree.c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((tree + "/frozen").c_str(), 0755));
    writeText(tree + "/frozen/inside", "x");
    for (const char* name : {"/a", "/z"}) writeText(tree + name, "x");
    // The directory, not the file, carries the flag: the file cannot be unlinked and
    // clearing a flag on the file itself does not help.
    SKIP_WITHOUT_IMMUTABLE_FLAG(tree + "/frozen");

    VSLErrorRef error;
    EXPECT_FALSE(fm().removeItemAtURL(tree, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(EPERM, error->code);
    EXPECT_EQ("removefile of " + tree + " failed: Operation not permitted", *error->localizedDescription);
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(tree + "/a"));
    EXPECT_TRUE(fm().itemDoesNotExistAtURL(tree + "/z"));
    EXPECT_TRUE(fm().itemExistsAtURL(tree + "/frozen/inside"));

    setImmutable(tree + "/frozen", false);
    EXPECT_TRUE(fm().removeItemAtURL(tree, &error));
}
