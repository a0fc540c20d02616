#include "Platform/FileWatcher.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace vsl {
namespace {

namespace fs = std::filesystem;

void writeFile(const fs::path& p, const std::string& text) { std::ofstream(p) << text; }

// One watcher serves every watch: a directory that appears late, one that is swapped
// for another, several watches on one directory, and removal of one of them.
TEST(FileWatcher, FollowsTheDirectoryThroughItsLifeAndServesSeveralWatches) {
    char templ[] = "/tmp/vsl-watch-XXXXXX";
    const fs::path top = ::mkdtemp(templ);
    const fs::path dir = top / "conf";
    FileWatcher& watcher = FileWatcher::shared();

    std::atomic<int> named{0}, any{0}, other{0};
    const uint64_t namedToken = watcher.watch(dir, "list.plist", [&] { named++; });
    ASSERT_NE(namedToken, 0u);  // the directory is missing: its parent is watched
    const uint64_t anyToken = watcher.watch(dir, "", [&] { any++; });
    ASSERT_NE(anyToken, 0u);

    fs::create_directory(dir);
    writeFile(dir / "list.plist", "a");
    watcher.sync();
    EXPECT_GE(named.load(), 1);
    EXPECT_GE(any.load(), 1);

    // Another entry: only the watch of any entry hears it.
    const int namedBefore = named, anyBefore = any;
    writeFile(dir / "unrelated", "x");
    watcher.sync();
    EXPECT_EQ(named.load(), namedBefore);
    EXPECT_GT(any.load(), anyBefore);

    // The directory is replaced by another one: the watch moves to the newcomer.
    fs::rename(dir, top / "old");
    fs::create_directory(dir);
    watcher.sync();
    const int afterSwap = named;
    writeFile(dir / "list.plist", "b");
    watcher.sync();
    EXPECT_GT(named.load(), afterSwap);
    writeFile(top / "old" / "list.plist", "stale");
    const int beforeStale = named;
    watcher.sync();
    EXPECT_EQ(named.load(), beforeStale);

    // Removing one watch leaves the others on the same directory working.
    watcher.unwatch(anyToken);
    const uint64_t otherToken = watcher.watch(dir, "list.plist", [&] { other++; });
    ASSERT_NE(otherToken, 0u);
    const int anyAfterUnwatch = any, namedBeforeLast = named;
    writeFile(dir / "list.plist", "c");
    watcher.sync();
    EXPECT_EQ(any.load(), anyAfterUnwatch);
    EXPECT_GT(named.load(), namedBeforeLast);
    EXPECT_GE(other.load(), 1);

    watcher.unwatch(namedToken);
    watcher.unwatch(otherToken);
    const int namedFinal = named, otherFinal = other;
    writeFile(dir / "list.plist", "d");
    watcher.sync();
    EXPECT_EQ(named.load(), namedFinal);
    EXPECT_EQ(other.load(), otherFinal);

    // Neither the directory nor its parent: nothing to watch.
    EXPECT_EQ(watcher.watch(top / "no" / "such" / "dir", "", [] {}), 0u);
    fs::remove_all(top);
}

}  // namespace
}  // namespace vsl
