// Walks over a container read each entry first and write only what differs: a walk
// over a tree that is already right changes no entry's ctime, and a real change
// writes each differing entry exactly once per differing attribute.
#include <fts.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <map>
#include <thread>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DurableIO.h"
#include "StorageTestUtil.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

using Ctimes = std::map<std::string, timespec>;

Ctimes ctimesBelow(const std::string& top) {
    Ctimes all;
    std::string path = top;
    char* paths[] = {path.data(), nullptr};
    FTS* fts = ::fts_open(paths, FTS_PHYSICAL | FTS_NOCHDIR, nullptr);
    while (FTSENT* e = ::fts_read(fts))
        if (e->fts_info != FTS_DP) all[e->fts_path] = e->fts_statp->st_ctim;
    ::fts_close(fts);
    return all;
}

bool same(const timespec& a, const timespec& b) { return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec; }

// ctime comes from a coarse clock: let it move before a walk that might write.
void letTheClockTick() { std::this_thread::sleep_for(std::chrono::milliseconds(30)); }

}  // namespace

TEST(WalkCtime, OwnershipWalkWritesOnlyWhatDiffersAndOnce) {
    TempRoot root;
    const bool root_ = runningAsRoot();
    const uid_t uid = root_ ? 501 : ::geteuid();
    const gid_t gid = root_ ? 501 : ::getegid();
    std::string c = root.at("c");
    // Per entry: how many attributes differ from the standard (owner, mode).
    std::map<std::string, int> differing;
    for (int d = 0; d < 3; d++) {
        for (int f = 0; f < 6; f++) {
            std::string rel = "c/d" + std::to_string(d) + "/f" + std::to_string(f);
            root.writeFile(rel, "x");
            std::string path = root.at(rel);
            bool wrongMode = f % 2 == 1, wrongOwner = root_ && f % 3 == 0;
            ::chmod(path.c_str(), wrongMode ? 0600 : 0644);
            ASSERT_EQ(0, ::lchown(path.c_str(), wrongOwner ? 0 : uid, wrongOwner ? 0 : gid));
            if (wrongMode || wrongOwner) differing[path] = int(wrongMode) + int(wrongOwner);
        }
        std::string dir = c + "/d" + std::to_string(d);
        ::chmod(dir.c_str(), d == 1 ? 0700 : 0755);
        ASSERT_EQ(0, ::lchown(dir.c_str(), uid, gid));
        if (d == 1) differing[dir] = 1;
    }
    ::chmod(c.c_str(), 0755);
    ASSERT_EQ(0, ::lchown(c.c_str(), uid, gid));

    Ctimes before = ctimesBelow(c);
    letTheClockTick();
    uint64_t steps = durable::stepCount();
    VSLErrorRef error;
    ASSERT_TRUE(VSLFileManager::defaultManager().standardizeOwnershipAtURL(c, uid, gid, &error));
    int expectedWrites = 0;
    for (const auto& [path, n] : differing) expectedWrites += n;
    EXPECT_EQ(uint64_t(expectedWrites), durable::stepCount() - steps) << "one write per differing attribute";
    Ctimes after = ctimesBelow(c);
    ASSERT_EQ(before.size(), after.size());
    for (const auto& [path, ctime] : before)
        EXPECT_EQ(differing.count(path) == 0, same(ctime, after[path])) << path;

    letTheClockTick();
    steps = durable::stepCount();
    ASSERT_TRUE(VSLFileManager::defaultManager().standardizeOwnershipAtURL(c, uid, gid, &error));
    EXPECT_EQ(steps, durable::stepCount());
    for (const auto& [path, ctime] : ctimesBelow(c)) EXPECT_TRUE(same(ctime, after[path])) << path << " was written";
}

TEST(WalkCtime, AclWalkOverAStandardTreeChangesNoCtime) {
    if (!runningAsRoot()) GTEST_SKIP() << "needs root: the walk gives every item to the unprivileged owner";
    TempRoot root;
    root.writeFile("etc/group", "wheel:x:0:\nmobile:x:501:\nsystemusers:x:4242:\n");
    for (int d = 0; d < 3; d++)
        for (int f = 0; f < 4; f++) root.writeFile("sys/d" + std::to_string(d) + "/f" + std::to_string(f), "x");
    std::string c = root.at("sys");
    VSLErrorRef error;
    Ctimes before = ctimesBelow(c);
    letTheClockTick();
    ASSERT_TRUE(VSLFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(c, &error))
        << error->description();
    Ctimes after = ctimesBelow(c);
    for (const auto& [path, ctime] : before) EXPECT_FALSE(same(ctime, after[path])) << path << " was not written";

    letTheClockTick();
    ASSERT_TRUE(VSLFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(c, &error));
    for (const auto& [path, ctime] : ctimesBelow(c)) EXPECT_TRUE(same(ctime, after[path])) << path << " was written";
}
