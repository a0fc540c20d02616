// End to end: a daemon restarted on a root whose metadata files were tampered with or
// fail to read rebuilds its cache without hanging, skips what is damaged and never
// takes an unreadable container for an absent one.
#include <gtest/gtest.h>
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <future>
#include <optional>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kMetadataName = "/.com.tarrow.vesselry.metadata.plist";

size_t entriesIn(const std::string& dir) {
    size_t n = 0;
    if (auto d = opendir(dir.c_str())) {
        while (auto e = readdir(d)) n += e->d_name[0] != '.';
        closedir(d);
    }
    return n;
}

class RebuildFromDisk : public ::testing::Test {
protected:
    void SetUp() override {
        admin = daemon.addClient("admin", "com.example.admin",
                                 dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    }

    DaemonProcess::CtlResult lookup(const std::string& identifier, int containerClass, bool create = false) {
        return daemon.run(admin, {"createOrLookup", "Identifier=" + identifier,
                                  "ContainerClass=" + std::to_string(containerClass),
                                  std::string("CreateIfNecessary=") + (create ? "true" : "false")});
    }

    // The reply, or none when it did not come in time; the daemon is then killed so
    // that the waiting client returns.
    std::optional<DaemonProcess::CtlResult> answerWithin(std::chrono::seconds limit, const std::string& identifier,
                                                         int containerClass, bool create = false) {
        auto pending = std::async(std::launch::async, [=, this] { return lookup(identifier, containerClass, create); });
        if (pending.wait_for(limit) == std::future_status::ready) return pending.get();
        daemon.kill();
        pending.wait();
        return std::nullopt;
    }

    DaemonProcess daemon;
    std::string admin;
};

}  // namespace

TEST_F(RebuildFromDisk, MetadataReplacedByAFifoOrASymlinkIsSkippedWithoutBlocking) {
    auto fifo = lookup("com.example.fifo", 2, true);
    auto linked = lookup("com.example.linked", 2, true);
    auto kept = lookup("com.example.kept", 2, true);
    ASSERT_EQ(1u, fifo.code()) << fifo.err;
    ASSERT_EQ(1u, linked.code()) << linked.err;
    ASSERT_EQ(1u, kept.code()) << kept.err;
    ASSERT_EQ(0, daemon.stop());

    // The owner of a container can swap its metadata file for any node: a FIFO that no
    // one writes, or a symlink to a file that would otherwise read as valid.
    std::string fifoFile = fifo.string("ReplyPath") + kMetadataName;
    ASSERT_EQ(0, ::unlink(fifoFile.c_str()));
    ASSERT_EQ(0, ::mkfifo(fifoFile.c_str(), 0644));
    std::string linkedFile = linked.string("ReplyPath") + kMetadataName;
    std::string elsewhere = daemon.at("linked-metadata.plist");
    ASSERT_EQ(0, ::rename(linkedFile.c_str(), elsewhere.c_str()));
    ASSERT_EQ(0, ::symlink(elsewhere.c_str(), linkedFile.c_str()));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));

    // A blocked read would hold the class's index and the global read lock for good.
    constexpr auto kLimit = std::chrono::seconds(5);
    auto fifoLookup = answerWithin(kLimit, "com.example.fifo", 2);
    ASSERT_TRUE(fifoLookup) << "no answer: the rebuild is blocked on the FIFO";
    EXPECT_EQ(21u, fifoLookup->code()) << fifoLookup->err;
    auto again = answerWithin(kLimit, "com.example.fifo", 2);
    ASSERT_TRUE(again);
    EXPECT_EQ(21u, again->code());
    auto linkedLookup = answerWithin(kLimit, "com.example.linked", 2);
    ASSERT_TRUE(linkedLookup);
    EXPECT_EQ(21u, linkedLookup->code()) << "a symlinked metadata file is not followed";

    auto keptLookup = answerWithin(kLimit, "com.example.kept", 2);
    ASSERT_TRUE(keptLookup);
    ASSERT_EQ(1u, keptLookup->code()) << keptLookup->err;
    EXPECT_EQ(kept.uuid(), keptLookup->uuid()) << "the rest of the class still loads";
    for (int containerClass : {2, 4}) {
        auto made = answerWithin(kLimit, "com.example.other" + std::to_string(containerClass), containerClass, true);
        ASSERT_TRUE(made) << "creation waits behind the blocked read";
        EXPECT_EQ(1u, made->code()) << made->err;
        EXPECT_FALSE(made->existed());
    }

    // Damaged is not destroyed: the tampered nodes are still where they were.
    struct stat st;
    ASSERT_EQ(0, ::lstat(fifoFile.c_str(), &st));
    EXPECT_TRUE(S_ISFIFO(st.st_mode));
    ASSERT_EQ(0, ::lstat(linkedFile.c_str(), &st));
    EXPECT_TRUE(S_ISLNK(st.st_mode));
}

TEST_F(RebuildFromDisk, AFailedMetadataReadFailsTheLookupAndCreatesNothing) {
#ifndef VESSEL_KILLPOINTS
    GTEST_SKIP() << "read failures are injected in kill-point builds only";
#endif
    // A bundle class: no kernel sandbox item, so the first lookup after a restart
    // has to read the class directory.
    auto made = lookup("com.example.io", 1, true);
    ASSERT_EQ(1u, made.code()) << made.err;
    auto neighbour = lookup("com.example.io-neighbour", 1, true);
    ASSERT_EQ(1u, neighbour.code()) << neighbour.err;
    std::string path = made.string("ReplyPath");
    std::string classDirectory = path.substr(0, path.rfind('/'));
    std::string containerName = path.substr(path.rfind('/') + 1);
    ASSERT_EQ(2u, entriesIn(classDirectory));
    ASSERT_EQ(0, daemon.stop());

    // The next read of this container's metadata fails with EIO, once.
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_FAIL_READ=" + containerName + kMetadataName}))
        << readFile(daemon.at("vesseld.stderr"));
    auto failed = lookup("com.example.io", 1, true);
    EXPECT_EQ(43u, failed.code()) << "the cache could not be rebuilt: " << failed.err;
    EXPECT_EQ(2u, entriesIn(classDirectory)) << "no second container for the same identifier";

    // The fault is gone: the index is built now, and the original is found.
    auto found = lookup("com.example.io", 1, true);
    ASSERT_EQ(1u, found.code()) << found.err;
    EXPECT_TRUE(found.existed());
    EXPECT_EQ(made.uuid(), found.uuid());
    EXPECT_EQ(path, found.string("ReplyPath"));
    EXPECT_EQ(2u, entriesIn(classDirectory));
    auto other = lookup("com.example.io-neighbour", 1);
    ASSERT_EQ(1u, other.code());
    EXPECT_EQ(neighbour.uuid(), other.uuid());
}
