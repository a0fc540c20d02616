// The server stays reachable whatever its handlers do and whatever one user opens:
// blocked handlers, a thread cap, connection limits per user and in all, idle
// connections, and a stop that does not wait forever.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <sstream>
#include <thread>
#include <vector>

#include "Client/VSLConnection.h"
#include "Ipc/IpcTestSupport.h"
#include "Ipc/OtherUser.h"
#include "Platform/IpcServer.h"
#include "Platform/Log.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using vsl::client::VSLConnection;
using vsl::client::VSLConnectionStatus;

namespace {

// How long a served client may wait for its answer before the server counts as deaf.
constexpr auto kAnswerWithin = std::chrono::seconds(5);

class IpcLivenessTest : public ::testing::Test {
protected:
    void SetUp() override {
        dir_ = makeTempDir("vessel-live-");
        ::chmod(dir_.c_str(), 0755);  // reachable by the other user's clients
        path_ = dir_ + "/run/vesseld/com.tarrow.vesseld";
    }
    void TearDown() override { removeTree(dir_); }

    std::unique_ptr<IpcServer> start(IpcServerOptions options, const std::string& name = "a") {
        options.path = path_ + "." + name;
        std::string error;
        auto server = IpcServer::start(std::move(options), &error);
        EXPECT_TRUE(server) << error;
        return server;
    }

    // A new connection gets its request answered in time.
    static bool answers(const std::string& path) {
        RawClient c(path);
        if (!c.connected() || !c.sendRequest(5, dict({{"ping", Value::boolean(true)}}))) return false;
        auto reply = c.readFrame(kAnswerWithin);
        return reply && reply->messageId == 5;
    }

    std::string dir_;
    std::string path_;
};

// Handlers that block on "Block" until released; everything else is echoed.
struct Blocker {
    Gate release;
    Counter blocked;
    std::atomic<int> lateRepliesRefused{0};

    IpcServerOptions options() {
        IpcServerOptions o;
        o.onMessage = [this](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
            if (m.body.find("Block")) {
                blocked.add();
                release.wait();
                if (!peer->sendReply(m.id, echoOf(m))) ++lateRepliesRefused;
                return;
            }
            peer->sendReply(m.id, echoOf(m));
        };
        return o;
    }
};

}  // namespace

TEST_F(IpcLivenessTest, BlockedHandlersNeverLeaveTheServerDeafAndAStopGivesUpOnThem) {
    Blocker blocker;
    // Idle threads would leave within 20 ms: long before the blocked handler returns.
    IpcServerOptions spare = blocker.options();
    spare.ioThreadIdleTimeout = std::chrono::milliseconds(20);
    // A single I/O thread: a blocking handler must not take it away from the socket.
    IpcServerOptions single = blocker.options();
    single.maxIoThreads = 1;
    auto server = start(std::move(spare), "spare");
    auto capped = start(std::move(single), "single");
    ASSERT_TRUE(server && capped);

    std::vector<std::unique_ptr<RawClient>> stuck;
    auto block = [&](const std::string& path) {
        stuck.push_back(std::make_unique<RawClient>(path));
        ASSERT_TRUE(stuck.back()->sendRequest(1, dict({{"Block", Value::boolean(true)}})));
    };
    block(path_ + ".spare");
    for (int i = 0; i < 3; ++i) block(path_ + ".single");
    ASSERT_TRUE(blocker.blocked.waitFor(4));

    // Many idle timeouts pass while the handlers stay blocked.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    for (int i = 0; i < 5; ++i) {
        EXPECT_TRUE(answers(path_ + ".spare")) << "new client " << i << " beside a blocked handler";
        EXPECT_TRUE(answers(path_ + ".single")) << "new client " << i << " with the only thread's handler blocked";
    }
    EXPECT_EQ(capped->ioThreadCount(), 1u);

    // The stop gives up on the blocked handler instead of waiting for it.
    EXPECT_FALSE(server->stop(std::chrono::milliseconds(200)));
    struct stat st;
    EXPECT_NE(::lstat((path_ + ".spare").c_str(), &st), 0) << "the socket file is gone";
    EXPECT_TRUE(stuck.front()->waitForClose(kAnswerWithin));
    EXPECT_TRUE(server->stop(std::chrono::milliseconds(0))) << "a second stop returns at once";

    // Released later, the handler finds its peer closed and its thread leaves.
    blocker.release.open();
    const auto end = std::chrono::steady_clock::now() + kPatience;
    while (server->ioThreadCount() > 0 && std::chrono::steady_clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_EQ(server->ioThreadCount(), 0u);
    for (size_t i = 1; i < stuck.size(); ++i) {
        auto reply = stuck[i]->readFrame(kAnswerWithin);
        EXPECT_TRUE(reply && reply->messageId == 1) << "released while still served, answered";
    }
    EXPECT_EQ(blocker.lateRepliesRefused.load(), 1);
    EXPECT_TRUE(capped->stop(std::chrono::seconds(30)));
}

TEST_F(IpcLivenessTest, ConnectionsOverAUsersShareOrOverTheTotalAreRefusedWithAReason) {
    const std::string logDir = dir_ + "/logs";
    LogFileOptions logOptions;
    logOptions.directory = logDir;
    ASSERT_TRUE(openLogFile(logOptions));
    IpcServerOptions options;
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
    // The suite's own uid is root or the server's own: both have the privileged share.
    options.maxConnectionsPerUid = 3;
    options.maxConnectionsPrivileged = 3;
    options.maxConnections = 5;
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    const std::string path = path_ + ".a";
    EXPECT_EQ(server->connectionLimit(), 5u);

    std::vector<std::unique_ptr<RawClient>> mine;
    for (int i = 0; i < 3; ++i) {
        mine.push_back(std::make_unique<RawClient>(path));
        ASSERT_TRUE(mine.back()->sendRequest(1, dict({})));
        ASSERT_TRUE(mine.back()->readFrame(kAnswerWithin)) << "connection " << i << " within the share";
    }
    // Over the share: the client library reports the refusal and its reason.
    for (int i = 0; i < 4; ++i) {
        std::string error;
        auto extra = VSLConnection::connect(path, &error);
        ASSERT_TRUE(extra) << error;
        auto reply = extra->sendRequest(dict({}), kAnswerWithin);
        EXPECT_EQ(reply.status, VSLConnectionStatus::Refused) << reply.error;
        EXPECT_NE(reply.error.find("too many connections from uid " + std::to_string(::geteuid()) + " (limit 3)"),
                  std::string::npos)
            << reply.error;
        EXPECT_TRUE(extra->wasRefused());
    }

    if (canSwitchUser()) {
        // Another user still gets in, up to what the total leaves.
        HeldConnections other(path, kOtherUid, 3, *encodeFrame(1, 0, dict({})));
        EXPECT_EQ(other.replies(), 2u);
        ASSERT_EQ(other.refusals(), 1u);
        const auto& last = *other.frames().back();
        EXPECT_EQ(last.messageId, kIpcNoticeMessageId);
        EXPECT_NE(last.body.find(kIpcRefusalKey)->stringValue()->find("(limit 5)"), std::string::npos);
    }

    // A closed connection gives its place back.
    mine.pop_back();
    const auto end = std::chrono::steady_clock::now() + kPatience;
    while (server->peerCount() > 2 && std::chrono::steady_clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_TRUE(answers(path));
    server->stop();
    closeLogFile();

    // One line for the refusals of a user (not one per refusal), naming the limit.
    std::stringstream log(readFile(logDir + "/vesseld.log"));
    size_t perUser = 0, total = 0;
    for (std::string line; std::getline(log, line);) {
        perUser += line.find("Connection limit reached for uid " + std::to_string(::geteuid()) + ": 3 open (limit 3)") !=
                   std::string::npos;
        total += line.find("Connection limit reached: 5 open (limit 5)") != std::string::npos;
    }
    EXPECT_EQ(perUser, 1u);
    EXPECT_EQ(total, canSwitchUser() ? 1u : 0u);
}

TEST_F(IpcLivenessTest, ClosesConnectionsLeftIdleButNotOnesInUseOrAwaitingAReply) {
    Unanswered held;
    IpcServerOptions options;
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        if (m.body.find("Hold")) return held.keep(peer, m.id);
        peer->sendReply(m.id, echoOf(m));
    };
    // Long enough that a loaded machine's scheduling gaps between the busy client's
    // requests stay well below it.
    options.idleConnectionTimeout = std::chrono::milliseconds(500);
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    const std::string path = path_ + ".a";

    RawClient idle(path), waiting(path), busy(path);
    ASSERT_TRUE(idle.sendRequest(1, dict({})));
    ASSERT_TRUE(idle.readFrame());
    ASSERT_TRUE(waiting.sendRequest(1, dict({{"Hold", Value::boolean(true)}})));
    // Busy for several timeouts: never cut off in the middle.
    for (uint64_t i = 0; i < 20; ++i) {
        ASSERT_TRUE(busy.sendRequest(i, dict({})));
        auto reply = busy.readFrame(kAnswerWithin);
        ASSERT_TRUE(reply && reply->messageId == i) << "request " << i;
        std::this_thread::sleep_for(std::chrono::milliseconds(75));
    }
    EXPECT_TRUE(idle.waitForClose(kAnswerWithin));
    // The one awaiting its reply stays open however long the reply takes.
    EXPECT_FALSE(waiting.waitForClose(std::chrono::milliseconds(1200)));
    ASSERT_EQ(held.size(), 1u);
    EXPECT_TRUE(held.answerOldest(dict({})));
    auto late = waiting.readFrame(kAnswerWithin);
    ASSERT_TRUE(late);
    EXPECT_EQ(late->messageId, 1u);
    // Then it is idle too.
    EXPECT_TRUE(waiting.waitForClose(kAnswerWithin));
    EXPECT_TRUE(busy.waitForClose(kAnswerWithin));
    // A client sees the close at the shutdown, just before the server drops the peer.
    for (int i = 0; i < 200 && server->peerCount() != 0; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(server->peerCount(), 0u);
}

TEST_F(IpcLivenessTest, AStopWaitsForTheDisconnectHandlersOfPeersThatLeftJustBefore) {
    std::atomic<int> finished{0};
    IpcServerOptions options;
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
    options.onDisconnect = [&](std::shared_ptr<IpcPeer>) {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        ++finished;
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    {
        RawClient gone(path_ + ".a");
        ASSERT_TRUE(gone.sendRequest(1, dict({})));
        ASSERT_TRUE(gone.readFrame());
    }
    // Out of the table, its handler still running: the stop must not return before it.
    const auto end = std::chrono::steady_clock::now() + kPatience;
    while (server->peerCount() > 0 && std::chrono::steady_clock::now() < end) {
        std::this_thread::yield();
    }
    ASSERT_EQ(finished.load(), 0);
    server->stop();
    EXPECT_EQ(finished.load(), 1);
}
