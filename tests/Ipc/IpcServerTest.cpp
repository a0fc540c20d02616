#include "Platform/IpcServer.h"

#include <gtest/gtest.h>
#include <limits.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <thread>
#include <vector>

#include "Client/VSLConnection.h"
#include "Ipc/IpcTestSupport.h"
#include "Platform/Transaction.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using vsl::client::VSLConnection;
using vsl::client::VSLConnectionStatus;

namespace {

// A socket bound at path and then abandoned, as a crashed server leaves it.
void leaveStaleSocket(const std::string& path, bool keepListening, int* listener = nullptr) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    if (keepListening) {
        ::listen(fd, 4);
        *listener = fd;
    } else {
        ::close(fd);
    }
}

class IpcServerTest : public ::testing::Test {
protected:
    void SetUp() override {
        dir_ = makeTempDir("vessel-ipc-");
        path_ = dir_ + "/run/vesseld/com.tarrow.vesseld";
    }
    void TearDown() override { removeTree(dir_); }

    // Tests keep the server in a local declared after whatever its handlers
    // capture, so it stops before those go away.
    std::unique_ptr<IpcServer> start(IpcServerOptions options) {
        options.path = path_;
        std::string error;
        auto server = IpcServer::start(std::move(options), &error);
        EXPECT_TRUE(server) << error;
        return server;
    }
    std::unique_ptr<IpcServer> startEcho() {
        IpcServerOptions options;
        options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
        return start(std::move(options));
    }
    std::shared_ptr<VSLConnection> connect() {
        std::string error;
        auto c = VSLConnection::connect(path_, &error);
        EXPECT_TRUE(c) << error;
        return c;
    }

    std::string dir_;
    std::string path_;
};

}  // namespace

TEST_F(IpcServerTest, PairsRepliesWithRequestsWhenPipelinedAndAnsweredOutOfOrder) {
    std::mutex mutex;
    std::vector<std::pair<std::shared_ptr<IpcPeer>, IpcMessage>> held;
    Counter heldArrived;
    auto later = WorkQueue::concurrent("test.later");
    IpcServerOptions options;
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        if (m.body.find("Hold")) {
            std::lock_guard lock(mutex);
            held.emplace_back(peer, m);
            heldArrived.add();
            return;
        }
        if (m.body.find("Release")) {
            std::lock_guard lock(mutex);
            // Answered from another thread, after the request that released them.
            for (auto& [p, h] : held) later->async([p = p, h = h] { p->sendReply(h.id, echoOf(h)); });
            held.clear();
        }
        if (m.body.find("Later")) {
            later->async([peer, m] { peer->sendReply(m.id, echoOf(m)); });
        } else {
            peer->sendReply(m.id, echoOf(m));
        }
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    auto conn = connect();
    ASSERT_TRUE(conn);

    // The first request is answered only after the second one.
    Value first = dict({{"Hold", Value::boolean(true)}, {"n", Value::uint64(1)}});
    std::thread waiter([&] {
        auto reply = conn->sendRequest(first);
        ASSERT_TRUE(reply.ok()) << reply.error;
        EXPECT_EQ(*reply.body.find("Echo"), first);
    });
    ASSERT_TRUE(heldArrived.waitFor(1));
    Value second = dict({{"Release", Value::boolean(true)}, {"n", Value::uint64(2)}});
    auto reply = conn->sendRequest(second);
    ASSERT_TRUE(reply.ok()) << reply.error;
    EXPECT_EQ(*reply.body.find("Echo"), second);
    waiter.join();

    // Many callers on one connection, replies inline or later, some large enough
    // that neither side's socket buffer takes them whole.
    std::vector<std::thread> threads;
    for (uint64_t t = 0; t < 6; ++t) {
        threads.emplace_back([&, t] {
            for (uint64_t i = 0; i < 60; ++i) {
                const size_t size = (i % 10 == 0) ? 300000 + t * 1000 : i * 7;
                Value request = dict({{"t", Value::uint64(t)},
                                      {"i", Value::uint64(i)},
                                      {"payload", Value::data(Data(size, static_cast<uint8_t>(t * 31 + i)))}});
                if (i % 3 == 0) {
                    request = dict({{"Later", Value::boolean(true)}, {"req", request}});
                }
                auto r = conn->sendRequest(request);
                ASSERT_TRUE(r.ok()) << r.error;
                ASSERT_EQ(*r.body.find("Echo"), request);
            }
        });
    }
    for (auto& th : threads) th.join();

    // Two frames in one write: both answered, each under its own id.
    RawClient raw(path_);
    ASSERT_TRUE(raw.connected());
    ASSERT_TRUE(raw.sendBytes(*encodeFrame(7, 0, dict({{"x", Value::string("seven")}})) +
                              *encodeFrame(3, 0, dict({{"x", Value::string("three")}}))));
    auto a = raw.readFrame();
    auto b = raw.readFrame();
    ASSERT_TRUE(a && b);
    EXPECT_EQ(a->messageId, 7u);
    EXPECT_EQ(a->flags, kIpcFlagReply);
    EXPECT_EQ(*a->body.find("Echo")->find("x")->stringValue(), "seven");
    EXPECT_EQ(b->messageId, 3u);
    EXPECT_EQ(*b->body.find("Echo")->find("x")->stringValue(), "three");
}

TEST_F(IpcServerTest, HandlesEachPeersMessagesInOrderAndPeersInParallel) {
    std::mutex mutex;
    std::map<uint64_t, std::vector<uint64_t>> seen;  // peer serial -> sequence numbers
    Gate unblock;
    Counter blocked;
    std::atomic<int> offQueue{0};
    IpcServerOptions options;
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        if (!peer->queue()->isCurrent()) ++offQueue;
        if (m.body.find("Block")) {
            blocked.add();
            // Only another peer's message can open this: a server handling peers one
            // at a time would never get here.
            EXPECT_TRUE(unblock.wait(std::chrono::seconds(20)));
        }
        if (m.body.find("Open")) unblock.open();
        if (const Value* seq = m.body.find("seq")) {
            std::lock_guard lock(mutex);
            seen[peer->serial()].push_back(*seq->uint64Value());
        }
        peer->sendReply(m.id, echoOf(m));
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);

    RawClient a(path_);
    ASSERT_TRUE(a.connected());
    std::string burst = *encodeFrame(100, 0, dict({{"Block", Value::boolean(true)}}));
    for (uint64_t i = 0; i < 200; ++i) burst += *encodeFrame(i, 0, dict({{"seq", Value::uint64(i)}}));
    ASSERT_TRUE(a.sendBytes(burst));
    ASSERT_TRUE(blocked.waitFor(1));

    auto b = connect();
    ASSERT_TRUE(b);
    EXPECT_TRUE(b->sendRequest(dict({{"Open", Value::boolean(true)}})).ok());

    auto first = a.readFrame();
    ASSERT_TRUE(first);
    EXPECT_EQ(first->messageId, 100u);
    for (uint64_t i = 0; i < 200; ++i) {
        auto reply = a.readFrame();
        ASSERT_TRUE(reply);
        ASSERT_EQ(reply->messageId, i);
    }
    std::lock_guard lock(mutex);
    ASSERT_EQ(seen.size(), 1u);
    std::vector<uint64_t> expected(200);
    for (uint64_t i = 0; i < 200; ++i) expected[i] = i;
    EXPECT_EQ(seen.begin()->second, expected);
    EXPECT_EQ(offQueue.load(), 0);
}

TEST_F(IpcServerTest, ClosesAPeerThatSendsGarbageAndKeepsServingOthers) {
    Counter disconnected;
    IpcServerOptions options;
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
    options.onDisconnect = [&](std::shared_ptr<IpcPeer> peer) {
        EXPECT_TRUE(peer->queue()->isCurrent());
        disconnected.add();
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    auto good = connect();
    ASSERT_TRUE(good);

    std::string badMagic = *encodeFrame(1, 0, dict({}));
    badMagic[4] = 'X';
    std::string tooLong("\x01\x00\x00\x01VSLM", 8);  // 16 MiB + 1
    std::string notDictionary = *encodeFrame(1, 0, dict({{"a", Value::array({})}}));
    notDictionary[20] = 0x0A;  // the body's tag
    const std::vector<std::string> garbage = {
        badMagic,
        tooLong,
        *encodeFrame(1, kIpcFlagReply, dict({})),  // a reply is no request
        notDictionary,
        std::string(64, '\xFF'),
    };
    size_t closed = 0;
    for (const std::string& bytes : garbage) {
        RawClient bad(path_);
        ASSERT_TRUE(bad.connected());
        ASSERT_TRUE(bad.sendBytes(bytes));
        EXPECT_TRUE(bad.waitForClose());
        ASSERT_TRUE(disconnected.waitFor(++closed));
        auto reply = good->sendRequest(dict({{"still", Value::uint64(closed)}}));
        ASSERT_TRUE(reply.ok()) << reply.error;
        EXPECT_EQ(*reply.body.find("Echo")->find("still")->uint64Value(), closed);
    }

    // A good frame ahead of the garbage in the same write is still answered.
    RawClient mixed(path_);
    ASSERT_TRUE(mixed.sendBytes(*encodeFrame(5, 0, dict({{"ok", Value::boolean(true)}})) + badMagic));
    auto answered = mixed.readFrame();
    ASSERT_TRUE(answered);
    EXPECT_EQ(answered->messageId, 5u);
    EXPECT_TRUE(mixed.waitForClose());
    ASSERT_TRUE(disconnected.waitFor(++closed));
    EXPECT_EQ(server->peerCount(), 1u);
}

TEST_F(IpcServerTest, OwnsItsSocketFile) {
    // A stale socket from a crash is replaced.
    ::mkdir((dir_ + "/run").c_str(), 0755);
    ::mkdir((dir_ + "/run/vesseld").c_str(), 0755);
    leaveStaleSocket(path_, false);
    auto server = startEcho();
    ASSERT_TRUE(server);
    struct stat st;
    ASSERT_EQ(::stat(path_.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0666u);
    auto conn = connect();
    ASSERT_TRUE(conn);
    EXPECT_TRUE(conn->sendRequest(dict({})).ok());

    // A second server is refused and leaves the first one working.
    std::string error;
    IpcServerOptions second;
    second.path = path_;
    EXPECT_FALSE(IpcServer::start(second, &error));
    EXPECT_FALSE(error.empty());
    EXPECT_TRUE(conn->sendRequest(dict({})).ok());

    // Stopping removes the file; the client learns its connection is gone.
    server->stop();
    EXPECT_NE(::lstat(path_.c_str(), &st), 0);
    auto after = conn->sendRequest(dict({}));
    EXPECT_EQ(after.status, VSLConnectionStatus::Closed);

    // Someone else answering on the path (without our lock) is not displaced.
    int foreign = -1;
    leaveStaleSocket(path_, true, &foreign);
    EXPECT_FALSE(IpcServer::start(second, &error));
    ::close(foreign);
    // Once it is gone its file is stale and gets replaced.
    EXPECT_TRUE(IpcServer::start(second, &error)) << error;

    // Not a socket: never deleted.
    ::unlink(path_.c_str());
    std::ofstream(path_) << "precious";
    EXPECT_FALSE(IpcServer::start(second, &error));
    EXPECT_EQ(readFile(path_), "precious");
}

TEST_F(IpcServerTest, ServesAnInheritedListeningSocket) {
    ::mkdir((dir_ + "/run").c_str(), 0755);
    ::mkdir((dir_ + "/run/vesseld").c_str(), 0755);
    int listener = -1;
    leaveStaleSocket(path_, true, &listener);
    IpcServerOptions options;
    options.listenFd = listener;  // as a service manager would hand it over
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
    auto server = IpcServer::start(std::move(options));
    ASSERT_TRUE(server);
    auto conn = connect();
    ASSERT_TRUE(conn);
    auto reply = conn->sendRequest(dict({{"x", Value::uint64(1)}}));
    ASSERT_TRUE(reply.ok()) << reply.error;
    // The file belongs to whoever made the socket: stopping leaves it.
    server->stop();
    struct stat st;
    EXPECT_EQ(::lstat(path_.c_str(), &st), 0);
}

TEST_F(IpcServerTest, KnowsWhoIsCalling) {
    std::mutex mutex;
    std::shared_ptr<IpcPeer> welcomed;
    auto listener = WorkQueue::serial("test.listener");
    bool onListenerQueue = false;
    IpcServerOptions options;
    options.connectionQueue = listener;
    options.onConnection = [&](std::shared_ptr<IpcPeer> peer) {
        std::lock_guard lock(mutex);
        welcomed = peer;
        onListenerQueue = listener->isCurrent();
    };
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        std::lock_guard lock(mutex);
        // The connection handler has run before the first message.
        peer->sendReply(m.id, dict({{"same", Value::boolean(peer == welcomed)}}));
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    auto conn = connect();
    auto reply = conn->sendRequest(dict({}));
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(reply.body.find("same")->boolValue(), true);

    std::lock_guard lock(mutex);
    ASSERT_TRUE(welcomed);
    EXPECT_TRUE(onListenerQueue);
    EXPECT_EQ(welcomed->pid(), ::getpid());
    EXPECT_EQ(welcomed->uid(), ::geteuid());
    EXPECT_EQ(welcomed->gid(), ::getegid());
    const AuditToken& token = welcomed->auditToken();
    EXPECT_EQ(token.pid(), ::getpid());
    EXPECT_EQ(token.uid(), ::geteuid());
    EXPECT_EQ(token.auid(), ::geteuid());
    EXPECT_EQ(token.gid(), ::getegid());
    EXPECT_EQ(token.ruid(), ::getuid());
    EXPECT_EQ(token.rgid(), ::getgid());
    EXPECT_EQ(token.pidGeneration(), static_cast<uint32_t>(*processStartTime(::getpid())));
    EXPECT_EQ(token, *AuditToken::forProcess(::getpid(), ::geteuid(), ::getegid()));
    char exe[PATH_MAX];
    ASSERT_TRUE(::realpath("/proc/self/exe", exe));
    EXPECT_EQ(welcomed->executablePath(), exe);
}

TEST_F(IpcServerTest, ClientSurfacesTimeoutsRefusalsAndClosedConnections) {
    Unanswered unanswered;
    IpcServerOptions options;
    options.onMessage = [&](std::shared_ptr<IpcPeer> peer, IpcMessage m) {
        if (m.body.find("Ignore")) {
            unanswered.keep(peer, m.id);
        } else if (m.body.find("Hangup")) {
            peer->cancel();
            EXPECT_FALSE(peer->sendReply(m.id, dict({})));
        } else {
            peer->sendReply(m.id, echoOf(m));
        }
    };
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    auto conn = connect();

    // No reply in time; a late reply is dropped and does not confuse the next request.
    auto lost = conn->sendRequest(dict({{"Ignore", Value::boolean(true)}}), std::chrono::milliseconds(50));
    EXPECT_EQ(lost.status, VSLConnectionStatus::Timeout);
    // While unanswered, the message keeps the process alive.
    auto names = openTransactionNames();
    EXPECT_EQ(std::count(names.begin(), names.end(), "com.tarrow.vesseld.peer-message"), 1);
    ASSERT_EQ(unanswered.size(), 1u);
    EXPECT_TRUE(unanswered.answerOldest(dict({{"late", Value::boolean(true)}})));
    names = openTransactionNames();
    EXPECT_EQ(std::count(names.begin(), names.end(), "com.tarrow.vesseld.peer-message"), 0);
    auto next = conn->sendRequest(dict({{"n", Value::uint64(2)}}));
    ASSERT_TRUE(next.ok()) << next.error;
    EXPECT_EQ(*next.body.find("Echo")->find("n")->uint64Value(), 2u);

    // What cannot be encoded is refused without harming the connection.
    EXPECT_EQ(conn->sendRequest(Value::array({})).status, VSLConnectionStatus::InvalidRequest);
    EXPECT_EQ(conn->sendRequest(dict({{"s", Value::string(std::string("\0", 1))}})).status,
              VSLConnectionStatus::InvalidRequest);
    EXPECT_TRUE(conn->sendRequest(dict({})).ok());

    // The server hanging up reaches the waiting caller and every later one.
    auto hung = conn->sendRequest(dict({{"Hangup", Value::boolean(true)}}));
    EXPECT_EQ(hung.status, VSLConnectionStatus::Closed);
    EXPECT_TRUE(conn->isClosed());
    EXPECT_EQ(conn->sendRequest(dict({})).status, VSLConnectionStatus::Closed);

    std::string error;
    EXPECT_FALSE(VSLConnection::connect(dir_ + "/nobody-here", &error));
    EXPECT_FALSE(error.empty());
    EXPECT_EQ(VSLConnection::socketPathForSystemRoot("/"), "/run/vesseld/com.tarrow.vesseld");
    EXPECT_EQ(VSLConnection::socketPathForSystemRoot(dir_ + "/"), dir_ + "/run/vesseld/com.tarrow.vesseld");
}

TEST_F(IpcServerTest, IdleConnectionsCostNoThreads) {
    IpcServerOptions options;
    options.onMessage = [](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, echoOf(m)); };
    options.ioThreadIdleTimeout = std::chrono::milliseconds(20);
    auto server = start(std::move(options));
    ASSERT_TRUE(server);
    std::vector<std::unique_ptr<RawClient>> idle;
    for (int i = 0; i < 300; ++i) {
        idle.push_back(std::make_unique<RawClient>(path_));
        ASSERT_TRUE(idle.back()->connected());
    }
    // Each one is served, then sits idle.
    for (auto& c : idle) ASSERT_TRUE(c->sendRequest(1, dict({})));
    for (auto& c : idle) ASSERT_TRUE(c->readFrame());
    EXPECT_EQ(server->peerCount(), 300u);
    // Threads a burst called up leave again; one is left to wait for all of them.
    const auto end = std::chrono::steady_clock::now() + kPatience;
    while (server->ioThreadCount() > 1 && std::chrono::steady_clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_EQ(server->ioThreadCount(), 1u);
    // And the survivors still answer.
    ASSERT_TRUE(idle.front()->sendRequest(2, dict({})));
    auto reply = idle.front()->readFrame();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->messageId, 2u);
}
