#include "Platform/CodeSigningPolicy.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include "Client/VSLConnection.h"
#include "Ipc/IpcTestSupport.h"
#include "Platform/IpcServer.h"
#include "Platform/PropertyList.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

std::string selfExecutable() {
    char exe[PATH_MAX];
    return ::realpath("/proc/self/exe", exe) ? exe : "";
}

AuditToken selfToken() { return *AuditToken::forProcess(::getpid(), ::geteuid(), ::getegid()); }

// Writes a policy file the way an operator's tool would: complete, then renamed in.
void writePolicy(const std::string& dir, const std::string& name, const Value& contents, mode_t mode = 0644) {
    auto bytes = encodeBinaryPropertyList(contents, nullptr);
    ASSERT_TRUE(bytes);
    const std::string tmp = dir + "/." + name + ".tmp";
    const int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::write(fd, bytes->data(), bytes->size()), static_cast<ssize_t>(bytes->size()));
    ::fchmod(fd, mode);
    ::close(fd);
    ASSERT_EQ(::rename(tmp.c_str(), (dir + "/" + name).c_str()), 0);
}

Value record(const std::string& exe, const std::string& identifier, Value entitlements = dict({}),
             bool sandboxed = false) {
    return dict({{"Executable", Value::string(exe)},
                 {"SigningIdentifier", Value::string(identifier)},
                 {"Entitlements", entitlements},
                 {"Sandboxed", Value::boolean(sandboxed)}});
}

class CodeSigningPolicyTest : public ::testing::Test {
protected:
    void SetUp() override {
        root_ = makeTempDir("vessel-policy-");
        dir_ = root_ + "/code-signatures";
    }
    void TearDown() override { removeTree(root_); }

    std::string root_;
    std::string dir_;
};

}  // namespace

TEST_F(CodeSigningPolicyTest, NamesARegisteredProcessAndNobodyElse) {
    ASSERT_EQ(::mkdir(dir_.c_str(), 0755), 0);
    const Value entitlements = dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
                                     {"groups", Value::array({Value::string("g1")})}});
    // Registered under a symlink: matched by the real path all the same.
    const std::string link = root_ + "/tests-link";
    ASSERT_EQ(::symlink(selfExecutable().c_str(), link.c_str()), 0);
    writePolicy(dir_, "tests.plist", record(link, "com.example.ipc-tests", entitlements, true));
    writePolicy(dir_, "other.plist", record("/usr/bin/env", "com.example.env"));

    CodeSigningPolicy policy(dir_);
    CodeSigningInfo info = policy.infoForAuditToken(selfToken());
    ASSERT_EQ(info.signingIdentifier, "com.example.ipc-tests") << info.error;
    EXPECT_EQ(Value::dictionary(info.entitlements), entitlements);
    EXPECT_TRUE(info.sandboxed);
    EXPECT_EQ(info.executable, selfExecutable());

    // The same through a real connection, from what was captured at connect.
    const std::string socket = root_ + "/s";
    std::mutex mutex;
    CodeSigningInfo viaPeer;
    IpcServerOptions options;
    options.path = socket;
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        {
            std::lock_guard lock(mutex);
            viaPeer = policy.infoForPeer(*peer);
        }
        peer->sendReply(m.id, dict({}));
    };
    auto server = IpcServer::start(options);
    ASSERT_TRUE(server);
    auto conn = client::VSLConnection::connect(socket);
    ASSERT_TRUE(conn && conn->sendRequest(dict({})).ok());
    server->stop();
    EXPECT_EQ(viaPeer.signingIdentifier, "com.example.ipc-tests");
    EXPECT_TRUE(viaPeer.sandboxed);

    // An executable without a record: no identifier, nothing granted.
    CodeSigningInfo stranger = policy.infoForExecutable("/usr/bin/definitely-not-registered");
    EXPECT_FALSE(stranger.signingIdentifier);
    EXPECT_TRUE(stranger.entitlements.empty());
    EXPECT_FALSE(stranger.sandboxed);
    EXPECT_FALSE(stranger.error.empty());

    // A token whose pid now belongs to another process start: nothing.
    AuditToken t = selfToken();
    AuditToken recycled = AuditToken::make(t.pid(), t.uid(), t.gid(), t.ruid(), t.rgid(), t.pidGeneration() + 1);
    EXPECT_FALSE(recycled == t);
    EXPECT_FALSE(recycled.processIsAlive());
    CodeSigningInfo impostor = policy.infoForAuditToken(recycled);
    EXPECT_FALSE(impostor.signingIdentifier);
    EXPECT_TRUE(impostor.entitlements.empty());

    auto byIdentifier = policy.recordsWithSigningIdentifier("com.example.env");
    ASSERT_EQ(byIdentifier.size(), 1u);
    EXPECT_EQ(byIdentifier[0].sourceFile, dir_ + "/other.plist");
}

TEST_F(CodeSigningPolicyTest, PicksUpChangesToTheStore) {
    // The store does not exist yet.
    CodeSigningPolicy policy(dir_);
    const std::string exe = selfExecutable();
    EXPECT_FALSE(policy.infoForExecutable(exe).signingIdentifier);

    ASSERT_EQ(::mkdir(dir_.c_str(), 0755), 0);
    writePolicy(dir_, "a.plist", record(exe, "com.example.first"));
    EXPECT_EQ(policy.infoForExecutable(exe).signingIdentifier, "com.example.first");

    // Rewritten with other rights.
    writePolicy(dir_, "a.plist",
                record(exe, "com.example.second", dict({{"k", Value::boolean(true)}})));
    CodeSigningInfo info = policy.infoForExecutable(exe);
    EXPECT_EQ(info.signingIdentifier, "com.example.second");
    EXPECT_EQ(info.entitlements.count("k"), 1u);

    // Rewritten in place, without a rename.
    {
        auto bytes = encodeBinaryPropertyList(record(exe, "com.example.third"), nullptr);
        const int fd = ::open((dir_ + "/a.plist").c_str(), O_WRONLY | O_TRUNC);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(::write(fd, bytes->data(), bytes->size()), static_cast<ssize_t>(bytes->size()));
        ::close(fd);
    }
    EXPECT_EQ(policy.infoForExecutable(exe).signingIdentifier, "com.example.third");

    // Made writable by others: no longer trusted.
    ASSERT_EQ(::chmod((dir_ + "/a.plist").c_str(), 0666), 0);
    EXPECT_FALSE(policy.infoForExecutable(exe).signingIdentifier);
    ASSERT_EQ(::chmod((dir_ + "/a.plist").c_str(), 0644), 0);
    EXPECT_EQ(policy.infoForExecutable(exe).signingIdentifier, "com.example.third");

    ASSERT_EQ(::unlink((dir_ + "/a.plist").c_str()), 0);
    EXPECT_FALSE(policy.infoForExecutable(exe).signingIdentifier);

    // The whole directory replaced by a new one.
    ASSERT_EQ(::rmdir(dir_.c_str()), 0);
    ASSERT_EQ(::mkdir(dir_.c_str(), 0755), 0);
    writePolicy(dir_, "b.plist", record(exe, "com.example.fourth"));
    EXPECT_EQ(policy.infoForExecutable(exe).signingIdentifier, "com.example.fourth");
}

TEST_F(CodeSigningPolicyTest, SkipsWhatItCannotTrust) {
    ASSERT_EQ(::mkdir(dir_.c_str(), 0755), 0);
    const std::string exe = selfExecutable();
    // One file with an array of records, some malformed: the good ones count.
    writePolicy(dir_, "a.plist",
                Value::array({
                    dict({{"Executable", Value::string("relative/path")}, {"SigningIdentifier", Value::string("x")}}),
                    dict({{"Executable", Value::string("/bin/a")}}),
                    dict({{"Executable", Value::string("/bin/b")}, {"SigningIdentifier", Value::string("y")},
                          {"Entitlements", Value::string("all of them")}}),
                    dict({{"Executable", Value::string("/bin/c")}, {"SigningIdentifier", Value::string("z")},
                          {"Sandboxed", Value::string("no")}}),
                    Value::string("not a record"),
                    record(exe, "com.example.good"),
                }));
    // A later file cannot take over an executable already named.
    writePolicy(dir_, "b.plist", record(exe, "com.example.usurper", dict({{"root", Value::boolean(true)}})));
    // Writable by group, or not a property list, or not ending in .plist: ignored.
    writePolicy(dir_, "c.plist", record("/bin/true", "com.example.groupwritable"), 0664);
    writePolicy(dir_, "d.txt", record("/bin/false", "com.example.txt"));
    {
        const int fd = ::open((dir_ + "/e.plist").c_str(), O_WRONLY | O_CREAT, 0644);
        ASSERT_EQ(::write(fd, "garbage", 7), 7);
        ::close(fd);
    }

    CodeSigningPolicy policy(dir_);
    auto records = policy.records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].signingIdentifier, "com.example.good");
    EXPECT_TRUE(records[0].entitlements.empty());
    EXPECT_FALSE(policy.recordForExecutable("/bin/true"));

    // A store directory others may write to is not trusted at all.
    ASSERT_EQ(::chmod(dir_.c_str(), 0777), 0);
    EXPECT_TRUE(policy.records().empty());
}

TEST(AuditToken, ReadsTheStartTimeWhateverTheProcessIsCalled) {
    const auto before = processStartTime(::getpid());
    ASSERT_TRUE(before);
    // The command name may hold spaces and parentheses; fields are found after the last ')'.
    char saved[17] = {};
    ::prctl(PR_GET_NAME, saved);
    ::prctl(PR_SET_NAME, "a) b (c) 1 2 3");
    EXPECT_EQ(processStartTime(::getpid()), before);
    ::prctl(PR_SET_NAME, saved);

    EXPECT_FALSE(processStartTime(0));
    EXPECT_FALSE(AuditToken::forProcess(-5, 0, 0));
    AuditToken zero;
    EXPECT_TRUE(zero.isZero());
    EXPECT_FALSE(selfToken().isZero());
    EXPECT_TRUE(selfToken().processIsAlive());
    std::string error;
    EXPECT_FALSE(processExecutablePath(zero, &error));
    EXPECT_FALSE(error.empty());
    EXPECT_EQ(processExecutablePath(selfToken()), selfExecutable());
}
