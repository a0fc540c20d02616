// The replacement inside the daemon: keeping the old UUID, a move into place that
// fails (settled back), the order of the death-row moves, argument checks that take
// no lock, and journals that cannot be trusted.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <fstream>
#include <future>
#include <thread>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLReplaceJournal.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReplaceFileOperations.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// The mobile user as the shared caches resolve it, so that a rebuild from disk
// accepts the metadata the test writes.
VSLUserIdentityRef mobileUser() {
    return VSLUserIdentityCache::userIdentityForLegacyMobileUser();
}

class ReplaceOperation : public CodeSigningTest {
protected:
    void SetUp() override {
        CodeSigningTest::SetUp();
        VSLContainerCache::sharedInstance()->invalidateUserIdentity(mobileUser());
        // Built now, from empty class directories: later adds go into these indexes
        // (this root's identity cache cannot vouch for the mobile user's metadata).
        uint64_t code = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(mobileUser(), "com.example.none",
                                                                               kVSLClassApplicationData, &code);
        VSLErrorRef error;
        for (bool transient : {false, true})
            VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, transient, false, &error);
    }
    void TearDown() override {
        setReplaceFileOperationsForTesting(std::nullopt);
        CodeSigningTest::TearDown();
    }
    static std::vector<std::string> entries(const std::string& directory) {
        std::vector<std::string> out;
        VSLErrorRef error;
        if (auto items = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &error))
            for (const auto& item : *items) out.push_back(item.path);
        return out;
    }
    // Every item below death row (one level of unique directories).
    static std::vector<std::string> deathRowItems() {
        std::vector<std::string> out;
        for (const auto& unique : entries(VSLGlobalConfiguration::sharedInstance()->deathrowDirectory()))
            for (const auto& item : entries(unique)) out.push_back(lastPathComponent(item));
        return out;
    }
    static void drainDeathRow(const VSLClientConnectionRef& connection) {
        std::promise<uint64_t> done;
        connection->deleteContainersOnDeathRowWithCompletion([&done](uint64_t code) { done.set_value(code); });
        ASSERT_EQ(std::future_status::ready, done.get_future().wait_for(std::chrono::seconds(30)));
    }
    static VSLMetadataRef lookUp(const std::string& identifier) {
        uint64_t code = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(
            mobileUser(), identifier, kVSLClassApplicationData, &code);
        VSLErrorRef error;
        return VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false, &error);
    }

    VSLClientConnectionRef connection = VSLClientConnection::createPrivileged();
};

void writeText(const std::string& path, const std::string& text) { std::ofstream(path) << text; }
std::string readText(const std::string& path) {
    std::ifstream in(path);
    return std::string((std::istreambuf_iterator<char>(in)), {});
}

}  // namespace

TEST_F(ReplaceOperation, KeepingTheOldUUIDPutsTheNewContainerInTheOldPlace) {
    auto user = mobileUser();
    auto old = makeContainer(user, kVSLClassApplicationData, "com.example.app");
    auto fresh = makeContainer(user, kVSLClassApplicationData, "com.example.app", true);
    writeText(fresh->url() + "/new.txt", "new content");
    const std::string freshURL = fresh->url();
    const Uuid freshUUID = fresh->uuid();

    // The order of the moves to death row, and where destruction starts.
    std::vector<std::pair<std::string, bool>> deathRowMoves;
    auto ops = defaultReplaceFileOperations();
    auto real = ops.moveToDeathRow;
    ops.moveToDeathRow = [&](VSLClientConnection& c, const std::string& url, bool isDir, bool start,
                             VSLErrorRef* error) {
        deathRowMoves.emplace_back(url, start);
        return real(c, url, isDir, start, error);
    };
    setReplaceFileOperationsForTesting(ops);

    uint64_t code = kVSLSuccess;
    connection->replaceContainerIdentity(old->containerIdentity(), fresh->containerIdentity(), true, true, &code);
    ASSERT_EQ(kVSLSuccess, code);

    EXPECT_EQ("new content", readText(old->url() + "/new.txt"));
    EXPECT_FALSE(exists(freshURL));
    auto found = lookUp("com.example.app");
    ASSERT_TRUE(found);
    EXPECT_EQ(old->url(), found->url());
    EXPECT_EQ(old->uuid(), found->uuid());
    EXPECT_EQ(found.get(), VSLContainerCache::sharedInstance()->containerForContainerIdentity(old->containerIdentity()).get())
        << "answers to the old UUID";
    // Records handed out before stay as they were.
    EXPECT_EQ(freshURL, fresh->url());
    EXPECT_EQ(freshUUID, fresh->uuid());
    // The disk says the same, for the next start.
    VSLErrorRef error;
    auto onDisk = VSL_dictionaryWithContentsOfURL(old->url() + "/.com.tarrow.vesselry.metadata.plist", 0, &error);
    ASSERT_TRUE(onDisk);
    const Value* uuid = onDisk->find("VSLMetadataUUID");
    ASSERT_TRUE(uuid);
    EXPECT_EQ(old->uuid().string(), uuid->stringValue() ? *uuid->stringValue()
                                                        : uuid->uuidValue().value_or(Uuid{}).string());

    ASSERT_EQ(2u, deathRowMoves.size());
    EXPECT_FALSE(deathRowMoves[0].second) << "the staged old container goes first, without starting destruction";
    EXPECT_EQ(".plist", deathRowMoves[1].first.substr(deathRowMoves[1].first.size() - 6));
    EXPECT_TRUE(deathRowMoves[1].second) << "destruction starts with the journal's move, the last one";
    drainDeathRow(connection);
    EXPECT_TRUE(deathRowItems().empty());
    EXPECT_TRUE(entries(VSLGlobalConfiguration::sharedInstance()->replaceDirectory()).empty());
}

TEST_F(ReplaceOperation, AFailedMoveIntoPlaceBringsTheOldContainerBack) {
    auto user = mobileUser();
    auto old = makeContainer(user, kVSLClassApplicationData, "com.example.app");
    writeText(old->url() + "/old.txt", "old content");
    auto fresh = makeContainer(user, kVSLClassApplicationData, "com.example.app", true);

    bool failRestore = false;
    auto ops = defaultReplaceFileOperations();
    auto realMove = ops.moveItem;
    ops.moveItem = [&](const std::string& from, const std::string& to, VSLErrorRef* error) {
        bool restore = to == old->url();
        if (from == fresh->url() || (restore && failRestore)) {
            *error = createPOSIXError("test", __LINE__, EIO, "injected");
            return false;
        }
        return realMove(from, to, error);
    };
    setReplaceFileOperationsForTesting(ops);

    uint64_t code = kVSLSuccess;
    connection->replaceContainerIdentity(old->containerIdentity(), fresh->containerIdentity(), false, false, &code);
    EXPECT_EQ(kVSLErrorReplaceFailed, code);
    EXPECT_EQ("old content", readText(old->url() + "/old.txt"));
    auto found = lookUp("com.example.app");
    ASSERT_TRUE(found) << "the old container is known again";
    EXPECT_EQ(old->uuid(), found->uuid());
    EXPECT_TRUE(exists(fresh->url()));
    auto parked = deathRowItems();
    ASSERT_EQ(1u, parked.size()) << "the journal; staging is empty again";
    EXPECT_EQ(".plist", parked[0].substr(parked[0].size() - 6));
    EXPECT_TRUE(entries(VSLGlobalConfiguration::sharedInstance()->replaceDirectory()).empty());
    auto staging = VSLGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(user, kVSLClassApplicationData);
    ASSERT_TRUE(staging);
    EXPECT_TRUE(entries(*staging).empty());

    // When the way back fails too, the old container stays in staging under its
    // journal, and the next start brings it back.
    failRestore = true;
    code = kVSLSuccess;
    connection->replaceContainerIdentity(old->containerIdentity(), fresh->containerIdentity(), false, false, &code);
    EXPECT_EQ(kVSLErrorReadReplaceRecord, code);
    EXPECT_FALSE(exists(old->url()));
    ASSERT_EQ(1u, entries(VSLGlobalConfiguration::sharedInstance()->replaceDirectory()).size());
    ASSERT_EQ(1u, entries(*staging).size());

    setReplaceFileOperationsForTesting(std::nullopt);
    VSLErrorRef error;
    EXPECT_TRUE(VSLClientConnection::sharedClientConnection()->_recoverFromReplaceOperationsWithError(&error));
    EXPECT_EQ("old content", readText(old->url() + "/old.txt"));
    EXPECT_TRUE(entries(VSLGlobalConfiguration::sharedInstance()->replaceDirectory()).empty());
    EXPECT_TRUE(entries(*staging).empty());
}

TEST_F(ReplaceOperation, BadArgumentsAreRefusedWithoutWaitingForTheLock) {
    auto user = mobileUser();
    auto old = makeContainer(user, kVSLClassApplicationData, "com.example.app");
    auto fresh = makeContainer(user, kVSLClassApplicationData, "com.example.app", true);
    auto plugin = makeContainer(user, kVSLClassPluginData, "com.example.app.widget", true);
    auto otherUser = VSLUserIdentity::create(user->posixUID() + 1, user->posixGID() + 1,
                                             user->homeDirectoryURL(), std::string("P"), 0, 1000);
    ASSERT_TRUE(otherUser);
    uint64_t idCode = kVSLSuccess;
    auto otherPersona = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), otherUser,
                                                                                "com.example.app", kVSLClassApplicationData,
                                                                                &idCode);
    ASSERT_TRUE(otherPersona);
    auto plainNew = VSLContainerIdentity::containerIdentityWithUserIdentity(user, "com.example.app", kVSLClassApplicationData,
                                                                           &idCode);

    // Another thread holds the global write lock throughout: a check made under the
    // lock would never return.
    std::promise<void> held, release;
    std::thread holder([&] {
        lock_all_identifiers_for_writing();
        held.set_value();
        release.get_future().wait();
        unlock_all_identifiers();
    });
    held.get_future().wait();
    auto codes = std::async(std::launch::async, [&] {
        std::vector<uint64_t> out;
        auto run = [&](const VSLContainerIdentityRef& o, const VSLContainerIdentityRef& n, bool preserve) {
            uint64_t code = kVSLSuccess;
            connection->replaceContainerIdentity(o, n, preserve, false, &code);
            out.push_back(code);
        };
        run(old->containerIdentity(), plainNew, false);
        run(old->containerIdentity(), nullptr, false);
        run(old->containerIdentity(), plugin->containerIdentity(), false);
        run(old->containerIdentity(), otherPersona, false);
        run(nullptr, fresh->containerIdentity(), true);
        return out;
    });
    auto status = codes.wait_for(std::chrono::seconds(10));
    release.set_value();
    holder.join();
    ASSERT_EQ(std::future_status::ready, status);
    EXPECT_EQ((std::vector<uint64_t>{kVSLErrorInvalidObject, kVSLErrorInvalidObject, kVSLErrorReplaceClassMismatch,
                                     kVSLErrorWrongPersona, kVSLErrorInvalidObject}),
              codes.get());
    EXPECT_TRUE(exists(old->url()));
    EXPECT_TRUE(exists(fresh->url()));
}

TEST_F(ReplaceOperation, JournalsThatCannotBeTrustedAreRefused) {
    std::string dir = freshDirectory("journals");
    auto write = [&](const std::string& name, const Value& v) {
        VSLErrorRef error;
        EXPECT_TRUE(VSL_writeToURL(v, joinPath(dir, name), kVSLWriteAtomic, &error));
        return joinPath(dir, name);
    };
    auto journal = [](const Value& old, const Value& fresh, const Value& staging, const Value& dest) {
        return dict({{kVSLReplaceOperationOldURL, old},
                     {kVSLReplaceOperationNewURL, fresh},
                     {kVSLReplaceOperationStagingURL, staging},
                     {kVSLReplaceOperationDestURL, dest}});
    };
    auto s = [](const char* text) { return Value::string(text); };

    VSLErrorRef error;
    ASSERT_TRUE(_writeToDiskReplaceAt(joinPath(dir, "good.plist"), "/a/old/", "/a/new", "/s/x", "/a/dest", &error));
    auto good = _readAndValidateReplaceFileAtUrl(joinPath(dir, "good.plist"), &error);
    ASSERT_TRUE(good);
    EXPECT_EQ("/a/old", good->oldURL);
    EXPECT_EQ("/a/dest", good->destURL);
    EXPECT_FALSE(_writeToDiskReplaceAt(joinPath(dir, "partial.plist"), "/a", std::nullopt, "/s", "/d", &error));
    EXPECT_TRUE(errorHasCode(error, kVSLErrorInvalidReplaceRecord));
    EXPECT_FALSE(exists(joinPath(dir, "partial.plist")));

    std::vector<std::string> bad = {
        joinPath(dir, "missing.plist"),
        write("array.plist", Value::array({s("/a")})),
        write("short.plist", dict({{kVSLReplaceOperationOldURL, s("/a")}})),
        write("number.plist", journal(Value::uint64(1), s("/b"), s("/c"), s("/d"))),
        write("relative.plist", journal(s("a/b"), s("/b"), s("/c"), s("/d"))),
        write("climbing.plist", journal(s("/a"), s("/b"), s("/c/../../etc"), s("/d"))),
        write("empty.plist", journal(s("/a"), s(""), s("/c"), s("/d"))),
        write("root.plist", journal(s("/a"), s("/b"), s("/c"), s("//"))),
    };
    std::ofstream(joinPath(dir, "garbage.plist")) << "garbage";
    bad.push_back(joinPath(dir, "garbage.plist"));
    ASSERT_EQ(0, ::symlink(joinPath(dir, "good.plist").c_str(), joinPath(dir, "link.plist").c_str()));
    bad.push_back(joinPath(dir, "link.plist"));
    ASSERT_EQ(0, ::mkdir(joinPath(dir, "directory.plist").c_str(), 0755));
    bad.push_back(joinPath(dir, "directory.plist"));
    for (const auto& path : bad) {
        error.reset();
        EXPECT_FALSE(_readAndValidateReplaceFileAtUrl(path, &error)) << path;
        EXPECT_TRUE(errorHasCode(error, kVSLErrorReadReplaceRecord)) << path;
    }
}
