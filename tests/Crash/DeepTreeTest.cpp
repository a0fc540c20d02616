// Trees deeper than any descriptor limit: a container holding a chain of 2,000
// directories is deleted and destroyed by a daemon allowed 256 descriptors, and a
// copy that fails halfway across devices leaves nothing behind.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "Crash/CrashSupport.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// A chain of `depth` directories below `top`, made with one descriptor at a time.
// Long names put the deepest path far beyond PATH_MAX.
bool makeChain(const std::string& top, int depth) {
    UniqueFd at(::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    for (int i = 0; i < depth && at.valid(); i++) {
        if (::mkdirat(at.get(), "a-rather-long-directory-name", 0755) != 0) return false;
        at.reset(::openat(at.get(), "a-rather-long-directory-name", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }
    if (!at.valid()) return false;
    UniqueFd file(::openat(at.get(), "bottom", O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    return file.valid();
}

// The descriptor limit under which exactly `count` more descriptors can be opened.
rlim_t limitLeavingFree(int count) {
    int fd = 0;
    for (int free = 0; free < count; fd++)
        if (::fcntl(fd, F_GETFD) < 0) free++;
    return static_cast<rlim_t>(fd);
}

std::string limitsLine(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/limits");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("Max open files", 0) == 0) return line;
    return {};
}

}  // namespace

TEST(DeepTrees, AChainTwoThousandDeepIsDestroyedByADaemonWith256Descriptors) {
    DaemonProcess d;
    d.setDescriptorLimit(256);
    ASSERT_TRUE(d.start()) << readFile(d.at("vesseld.stderr"));
    EXPECT_NE(std::string::npos, limitsLine(d.pid()).find(" 256 ")) << limitsLine(d.pid());

    auto made = createContainer(d);
    ASSERT_EQ(1u, made.code()) << made.err;
    std::string container = replyPath(made);
    ASSERT_TRUE(makeChain(joinPath(container, "Documents"), 2000));

    EXPECT_EQ(1u, deleteContainer(d).code());
    auto destroyed = destroyDeathRow(d);
    EXPECT_EQ(1u, destroyed.code()) << destroyed.out;
    struct stat st;
    EXPECT_NE(0, ::lstat(container.c_str(), &st));
    std::string dead = d.at("private/var/root/Library/Caches/com.tarrow.vesseld/Dead");
    if (::geteuid() == 0) {
        EXPECT_TRUE(entriesOf(dead).empty()) << "death row is empty again";
    }
    EXPECT_EQ(21u, lookUpContainer(d).code()) << "gone for good";
    EXPECT_EQ(1u, createContainer(d).code()) << "the daemon still has descriptors to serve";
    EXPECT_EQ(0, d.stop());
}

TEST(DeepTrees, AMoveAcrossDevicesCopiesDeepTreesAndLeavesNoPartialCopy) {
    struct stat shm, tmp;
    std::string scratch = makeTempDir("vessel-move-");
    if (::stat("/dev/shm", &shm) != 0 || ::stat(scratch.c_str(), &tmp) != 0 || shm.st_dev == tmp.st_dev) {
        removeTree(scratch);
        GTEST_SKIP() << "needs /dev/shm on a device of its own";
    }
    std::string source = "/dev/shm/vessel-move-XXXXXX";
    ASSERT_TRUE(::mkdtemp(source.data()));
    auto& fm = VSLFileManager::defaultManager();

    // A whole tree arrives, deeper than the descriptor limit allows levels, and the source goes.
    std::string tree = joinPath(source, "tree");
    ASSERT_EQ(0, ::mkdir(tree.c_str(), 0755));
    ASSERT_TRUE(makeChain(tree, 600));
    struct rlimit saved;
    ASSERT_EQ(0, ::getrlimit(RLIMIT_NOFILE, &saved));
    struct rlimit low = {128, saved.rlim_max};
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &low));
    VSLErrorRef error;
    bool moved = fm.moveItemAtURL(tree, joinPath(scratch, "tree"), &error);
    ::setrlimit(RLIMIT_NOFILE, &saved);
    EXPECT_TRUE(moved) << (error ? error->localizedDescription.value_or("") : "");
    EXPECT_TRUE(fm.itemDoesNotExistAtURL(tree));
    std::string bottom = joinPath(scratch, "tree");
    for (int i = 0; i < 600; i++) bottom = joinPath(bottom, "a-rather-long-directory-name");
    UniqueFd walk(::open(scratch.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::string rel = bottom.substr(scratch.size() + 1);
    // The copy's bottom, reached one component at a time (the path is too long for one call).
    for (size_t at = 0; walk.valid() && at < rel.size();) {
        size_t slash = rel.find('/', at);
        std::string name = rel.substr(at, slash == std::string::npos ? std::string::npos : slash - at);
        walk.reset(::openat(walk.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        at = slash == std::string::npos ? rel.size() : slash + 1;
    }
    ASSERT_TRUE(walk.valid());
    struct stat bottomStat;
    EXPECT_EQ(0, ::fstatat(walk.get(), "bottom", &bottomStat, 0));

    // A copy that runs out of descriptors halfway: the partial destination goes too.
    std::string second = joinPath(source, "second");
    ASSERT_EQ(0, ::mkdir(second.c_str(), 0755));
    for (const char* f : {"one", "two"}) std::ofstream(joinPath(second, f)) << f;
    // Room for the two directories, their two cursors and no file.
    struct rlimit tight = {limitLeavingFree(4), saved.rlim_max};
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &tight));
    moved = fm.moveItemAtURL(second, joinPath(scratch, "second"), &error);
    ::setrlimit(RLIMIT_NOFILE, &saved);
    EXPECT_FALSE(moved);
    EXPECT_TRUE(fm.itemDoesNotExistAtURL(joinPath(scratch, "second"))) << "no partial copy stays";
    EXPECT_TRUE(fm.itemExistsAtURL(joinPath(second, "one"))) << "the source is kept";

    removeTree(source);
    removeTree(scratch);
}
