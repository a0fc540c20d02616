// 64 clients at once, each creating, looking up, annotating and deleting containers
// of its own with a few broken frames in between, for two identical rounds. Counts
// decide: every request answered, the daemon's descriptors back to where they were,
// and its memory not growing from one round to the next beyond a small margin.
//
// VESSEL_LOAD_ITERATIONS sets the rounds per client (default 4, what CI runs).
#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "Client/VSLConnection.h"
#include "Client/VSLContainerInfo.h"
#include "Platform/IpcWire.h"
#include "Platform/UniqueFd.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

constexpr int kClients = 64;
constexpr auto kWait = std::chrono::seconds(120);
constexpr long kMemoryMarginKiB = 8 * 1024;

int iterations() {
    const char* v = std::getenv("VESSEL_LOAD_ITERATIONS");
    int n = v ? std::atoi(v) : 0;
    return n > 0 ? n : 4;
}

size_t openDescriptors(pid_t pid) {
    size_t n = 0;
    if (DIR* d = ::opendir(("/proc/" + std::to_string(pid) + "/fd").c_str())) {
        while (dirent* e = ::readdir(d))
            if (e->d_name[0] != '.') ++n;
        ::closedir(d);
    }
    return n;
}

long residentKiB(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0) return std::atol(line.c_str() + 6);
    return -1;
}

// A frame whose body is not a dictionary: the daemon must close this connection only.
bool brokenFrameClosesItsConnection(const std::string& socketPath) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);
    if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return false;
    const std::string frame("\x11\0\0\0VSLM\x01\0\0\0\x07\0\0\0\0\0\0\0\x03", 21);
    if (::send(fd.get(), frame.data(), frame.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(frame.size())) return false;
    timeval patience{60, 0};
    ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    char byte;
    ssize_t n = ::recv(fd.get(), &byte, 1, 0);
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

struct Tally {
    std::atomic<size_t> sent{0}, answered{0}, unexpected{0}, closed{0};
    std::string firstProblem;
    std::mutex mutex;
    void problem(const std::string& what) {
        ++unexpected;
        std::lock_guard<std::mutex> lock(mutex);
        if (firstProblem.empty()) firstProblem = what;
    }
};

// One client's share of a round: create, look up, set and read an info value,
// delete, over its own identifiers; every fourth iteration a broken frame too.
void runClient(const std::string& socketPath, int client, int rounds, Tally& tally) {
    std::string error;
    auto c = client::VSLConnection::connect(socketPath, &error);
    if (!c) return tally.problem("connect: " + error);
    auto ask = [&](Dictionary request, uint64_t expected, Value* reply = nullptr) {
        ++tally.sent;
        auto r = c->sendRequest(Value::dictionary(std::move(request)), kWait);
        if (!r.ok()) return tally.problem("no reply: " + r.error);
        ++tally.answered;
        const uint64_t code = client::replyCode(r);
        if (code != expected)
            tally.problem("client " + std::to_string(client) + ": code " + std::to_string(code) + ", expected " +
                          std::to_string(expected));
        if (reply) *reply = r.body;
    };
    for (int i = 0; i < rounds; ++i) {
        const Value id = Value::string("com.example.load." + std::to_string(client) + "." + std::to_string(i));
        const Value cls = Value::uint64(2);
        Value made;
        ask({{"Command", Value::uint64(0)}, {"Identifier", id}, {"ContainerClass", cls},
             {"CreateIfNecessary", Value::boolean(true)}},
            1, &made);
        const Value* uuid = made.find("ReplyUUID");
        const Value theUUID = uuid ? *uuid : Value();
        ask({{"Command", Value::uint64(0)}, {"Identifier", id}, {"ContainerClass", cls}}, 1);
        ask({{"Command", Value::uint64(5)}, {"Identifier", id}, {"ContainerClass", cls}, {"UUID", theUUID},
             {"Key", Value::string("load")}, {"Value", Value::uint64(static_cast<uint64_t>(i))}},
            1);
        ask({{"Command", Value::uint64(6)}, {"Identifier", id}, {"ContainerClass", cls}, {"UUID", theUUID},
             {"Key", Value::string("load")}},
            1);
        ask({{"Command", Value::uint64(6)}, {"Identifier", id}, {"ContainerClass", cls}, {"UUID", theUUID},
             {"Key", Value::string("absent")}},
            24);
        ask({{"Command", Value::uint64(10)}, {"Identifier", id}, {"ContainerClass", cls}}, 1);
        ask({{"Command", Value::uint64(0)}, {"Identifier", id}, {"ContainerClass", cls}}, 21);
        if (i % 4 == 0) {
            if (brokenFrameClosesItsConnection(socketPath))
                ++tally.closed;
            else
                tally.problem("a broken frame did not close its connection");
        }
    }
}

// Waits (bounded) for the daemon's descriptors to come back to `expected`: closed
// connections are released by the daemon's I/O threads, not before the client sees EOF.
size_t settledDescriptors(pid_t pid, size_t expected) {
    size_t now = openDescriptors(pid);
    for (int i = 0; i < 300 && now != expected; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        now = openDescriptors(pid);
    }
    return now;
}

}  // namespace

TEST(ConcurrentClients, EveryRequestIsAnsweredAndNothingLeaksAcrossRounds) {
    // Under AddressSanitizer freed memory waits in a quarantine that grows resident
    // memory by itself: off for the daemon, so the comparison sees the daemon's own.
    const char* asan = std::getenv("ASAN_OPTIONS");
    ::setenv("ASAN_OPTIONS",
             (std::string(asan ? asan : "") + ":quarantine_size_mb=0:thread_local_quarantine_size_kb=0").c_str(), 1);
    DaemonProcess daemon;
    char exe[PATH_MAX];
    ASSERT_TRUE(::realpath("/proc/self/exe", exe));
    ASSERT_TRUE(daemon.registerProgram(exe, "tester", "com.example.load",
                                       dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
                                             {"com.tarrow.private.Vesselry.userManagedAssets", Value::boolean(true)}})));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    const pid_t pid = daemon.pid();
    const int rounds = iterations();

    // Warm up what the daemon opens once and keeps (log, database, caches).
    Tally warmUp;
    runClient(daemon.socketPath(), 999, 1, warmUp);
    ASSERT_EQ(0u, warmUp.unexpected.load()) << warmUp.firstProblem;
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    const size_t descriptorsBefore = openDescriptors(pid);

    long resident[2] = {0, 0};
    for (int round = 0; round < 2; ++round) {
        SCOPED_TRACE("round " + std::to_string(round + 1));
        Tally tally;
        std::vector<std::thread> clients;
        for (int c = 0; c < kClients; ++c)
            clients.emplace_back(runClient, daemon.socketPath(), c, rounds, std::ref(tally));
        for (auto& t : clients) t.join();
        EXPECT_EQ(tally.sent.load(), tally.answered.load()) << tally.firstProblem;
        EXPECT_EQ(size_t(kClients) * size_t(rounds) * 7, tally.sent.load());
        EXPECT_EQ(0u, tally.unexpected.load()) << tally.firstProblem;
        EXPECT_EQ(size_t(kClients) * size_t((rounds + 3) / 4), tally.closed.load());
        // Deletions finish on death row: drained before counting.
        auto c = client::VSLConnection::connect(daemon.socketPath());
        ASSERT_TRUE(c);
        auto drained = c->sendRequest(dict({{"Command", Value::uint64(4)}}), kWait);
        EXPECT_EQ(1u, client::replyCode(drained));
        c->close();
        c.reset();
        EXPECT_EQ(descriptorsBefore, settledDescriptors(pid, descriptorsBefore)) << "descriptors after the round";
        resident[round] = residentKiB(pid);
        ASSERT_GT(resident[round], 0);
    }
    EXPECT_LE(resident[1], resident[0] + kMemoryMarginKiB)
        << "resident memory after the second round (KiB) against the first";
    std::printf("load: %d clients x %d iterations x 2 rounds; resident memory %ld KiB then %ld KiB\n", kClients,
                rounds, resident[0], resident[1]);
    EXPECT_EQ(0, daemon.stop());
}
