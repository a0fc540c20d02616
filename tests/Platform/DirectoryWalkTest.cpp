// Directory walks that follow only the links root alone could have placed.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "Platform/DurableIO.h"
#include "Platform/UniqueFd.h"

using namespace vsl;

namespace {

struct Scratch {
    Scratch() {
        char templ[] = "/tmp/vessel-walk-XXXXXX";
        path = ::mkdtemp(templ);
        ::chmod(path.c_str(), 0755);
    }
    ~Scratch() { EXPECT_EQ(0, std::system(("rm -rf '" + path + "'").c_str())); }
    std::string path;
};

int open(const std::string& path) {
    UniqueFd fd;
    int rc = durable::openDirectoryNoFollow(path, fd.out());
    if (rc == 0) {
        EXPECT_TRUE(fd.valid());
    }
    return rc;
}

}  // namespace

TEST(DirectoryWalk, FollowsOnlyLinksNobodyButRootCouldPlace) {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to make directories of other owners";
    Scratch s;
    std::string p = s.path;
    ASSERT_EQ(0, ::mkdir((p + "/target").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((p + "/target/sub").c_str(), 0755));

    // Root's directory, root's links: followed, absolute, relative and through "..".
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/abs").c_str()));
    ASSERT_EQ(0, ::symlink("target/../target", (p + "/rel").c_str()));
    EXPECT_EQ(0, open(p + "/abs/sub"));
    EXPECT_EQ(0, open(p + "/rel/sub"));

    // A user's directory: no link in it is followed, whoever owns the link.
    ASSERT_EQ(0, ::mkdir((p + "/home").c_str(), 0755));
    ASSERT_EQ(0, ::chown((p + "/home").c_str(), 501, 501));
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/home/link").c_str()));
    EXPECT_EQ(ELOOP, open(p + "/home/link"));
    EXPECT_EQ(ELOOP, open(p + "/home/link/sub"));
    // ... nor below it, in a root-owned directory the user could have swapped in.
    ASSERT_EQ(0, ::mkdir((p + "/home/rootdir").c_str(), 0755));
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/home/rootdir/link").c_str()));
    EXPECT_EQ(ELOOP, open(p + "/home/rootdir/link"));
    // ... nor from a root link that leads into it.
    ASSERT_EQ(0, ::symlink((p + "/home/link").c_str(), (p + "/via").c_str()));
    EXPECT_EQ(ELOOP, open(p + "/via"));

    // A sticky, world-writable directory: root's link is followed, a user's is not.
    ASSERT_EQ(0, ::mkdir((p + "/sticky").c_str(), 0755));
    ASSERT_EQ(0, ::chmod((p + "/sticky").c_str(), 01777));
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/sticky/root").c_str()));
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/sticky/user").c_str()));
    ASSERT_EQ(0, ::lchown((p + "/sticky/user").c_str(), 501, 501));
    EXPECT_EQ(0, open(p + "/sticky/root/sub"));
    EXPECT_EQ(ELOOP, open(p + "/sticky/user/sub"));
    // Group-writable without the sticky bit: nothing in it is root's alone.
    ASSERT_EQ(0, ::mkdir((p + "/shared").c_str(), 0775));
    ASSERT_EQ(0, ::chmod((p + "/shared").c_str(), 0775));
    ASSERT_EQ(0, ::symlink((p + "/target").c_str(), (p + "/shared/link").c_str()));
    EXPECT_EQ(ELOOP, open(p + "/shared/link"));

    // Not a directory, missing, a loop.
    ASSERT_EQ(0, ::close(::open((p + "/file").c_str(), O_WRONLY | O_CREAT, 0644)));
    EXPECT_EQ(ENOTDIR, open(p + "/file"));
    EXPECT_EQ(ENOTDIR, open(p + "/file/x"));
    EXPECT_EQ(ENOENT, open(p + "/missing"));
    ASSERT_EQ(0, ::symlink("loop", (p + "/loop").c_str()));
    EXPECT_EQ(ELOOP, open(p + "/loop"));
}

TEST(DirectoryWalk, MakesWhatIsMissingWithTheExactModeAndStopsAtLinks) {
    Scratch s;
    std::string p = s.path;
    mode_t old = ::umask(077);
    UniqueFd fd;
    EXPECT_EQ(0, durable::makeDirectoryNoFollow(p + "/a/b/c", 0755, true, fd.out()));
    ::umask(old);
    struct stat st;
    for (const char* d : {"/a", "/a/b", "/a/b/c"}) {
        ASSERT_EQ(0, ::lstat((p + d).c_str(), &st)) << d;
        EXPECT_EQ(0755u, st.st_mode & 07777) << d;
    }
    ASSERT_TRUE(fd.valid());
    struct stat opened;
    ASSERT_EQ(0, ::fstat(fd.get(), &opened));
    EXPECT_EQ(st.st_ino, opened.st_ino) << "the descriptor is the directory made";

    // Existing directories are success and keep their mode; without intermediates a
    // missing parent is not made.
    ASSERT_EQ(0, ::chmod((p + "/a").c_str(), 0700));
    EXPECT_EQ(0, durable::makeDirectoryNoFollow(p + "/a/b", 0755, false, fd.out()));
    ASSERT_EQ(0, ::lstat((p + "/a").c_str(), &st));
    EXPECT_EQ(0700u, st.st_mode & 07777);
    EXPECT_EQ(ENOENT, durable::makeDirectoryNoFollow(p + "/x/y", 0755, false, fd.out()));
    EXPECT_NE(0, ::access((p + "/x").c_str(), F_OK));

    // A link of the caller's own making below a directory it owns: never followed, and
    // nothing is made where it leads.
    ASSERT_EQ(0, ::mkdir((p + "/elsewhere").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((p + "/user").c_str(), 0777));
    ASSERT_EQ(0, ::chmod((p + "/user").c_str(), 0777));
    ASSERT_EQ(0, ::symlink((p + "/elsewhere").c_str(), (p + "/user/link").c_str()));
    EXPECT_EQ(ELOOP, durable::makeDirectoryNoFollow(p + "/user/link/new", 0755, true, fd.out()));
    EXPECT_NE(0, ::access((p + "/elsewhere/new").c_str(), F_OK));
}
