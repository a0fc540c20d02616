// A real daemon against a handler stuck for long, a user holding its whole share of
// connections, and a stream of lookups with the default log settings.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <limits.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <future>
#include <thread>

#include "Client/VSLConnection.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Service/VSLService.h"
#include "Ipc/OtherUser.h"
#include "Platform/PropertyList.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
using Clock = std::chrono::steady_clock;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";

DaemonProcess::CtlResult lookup(const DaemonProcess& daemon, const std::string& id, int timeoutSeconds) {
    return daemon.run(vesselctlPath(), {"--timeout", std::to_string(timeoutSeconds), "createOrLookup",
                                        "Identifier=" + id, "ContainerClass=2", "CreateIfNecessary=true"});
}

size_t fileSize(const std::string& path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0 ? static_cast<size_t>(st.st_size) : 0;
}

std::string logPath(const DaemonProcess& daemon) {
    return daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log");
}

}  // namespace

TEST(DaemonLiveness, AHandlerBlockedForLongNeitherSilencesTheDaemonNorDelaysItsStop) {
#ifndef VESSEL_KILLPOINTS
    GTEST_SKIP() << "needs the test-only handler delay of kill-point builds";
#else
    DaemonProcess daemon;
    // Command 32 sleeps 30 s in its handler, as one stuck on a FIFO or a dying disk.
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_HANDLER_DELAY=32:30"}));
    const auto blockedSince = Clock::now();
    auto blocked = std::async(std::launch::async, [&] {
        return daemon.run(vesselctlPath(), {"--timeout", "60", "personaUniqueStrings"});
    });
    for (int i = 0; i < 3; ++i) {
        auto r = lookup(daemon, "com.example.early" + std::to_string(i), 5);
        EXPECT_EQ(r.code(), 1u) << "served beside the blocked handler: " << r.err;
    }
    // Longer than an idle I/O thread waits before it leaves.
    std::this_thread::sleep_for(std::chrono::seconds(7));
    for (int i = 0; i < 3; ++i) {
        auto r = lookup(daemon, "com.example.late" + std::to_string(i), 5);
        EXPECT_EQ(r.code(), 1u) << "served after a quiet spell: " << r.err;
    }
    ASSERT_EQ(blocked.wait_for(std::chrono::seconds(0)), std::future_status::timeout) << "still blocked";

    const auto stopAsked = Clock::now();
    EXPECT_EQ(daemon.stop(), 0);
    EXPECT_LT(Clock::now() - stopAsked, std::chrono::seconds(5)) << "SIGTERM ends the daemon within seconds";
    auto r = blocked.get();
    EXPECT_EQ(r.exitCode, 3);
    EXPECT_NE(r.err.find("vesseld stopped before answering"), std::string::npos) << r.err;
    EXPECT_GT(Clock::now() - blockedSince, std::chrono::seconds(7));
    EXPECT_NE(readFile(logPath(daemon)).find("Stopping with request handlers still running"), std::string::npos);
#endif
}

TEST(DaemonLiveness, AUserAtItsConnectionCapIsToldSoWhileOtherUsersAreServed) {
    if (!canSwitchUser()) GTEST_SKIP() << "needs root to run clients as another user";
    DaemonProcess daemon;
    ASSERT_EQ(::chmod(daemon.root().c_str(), 0755), 0);  // reachable by the other user
    ASSERT_TRUE(daemon.start());
    const std::string request = *encodeFrame(1, 0, dict({{"Command", Value::uint64(27)}}));
    const std::vector<std::string> ctl = {vesselctlPath(), "--root", daemon.root(), "--timeout", "10", "27"};
    {
        HeldConnections holder(daemon.socketPath(), kOtherUid, kVSLConnectionsPerUser, request);
        EXPECT_EQ(holder.replies(), kVSLConnectionsPerUser) << "every connection within the cap is served";

        std::string err;
        EXPECT_EQ(runProgramAs(kOtherUid, ctl, &err), 3);
        EXPECT_NE(err.find("vesseld refused the connection: too many connections from uid " +
                           std::to_string(kOtherUid) + " (limit " + std::to_string(kVSLConnectionsPerUser) + ")"),
                  std::string::npos)
            << err;
        EXPECT_EQ(err.find("database"), std::string::npos) << err;

        // Root, and any other user, are still served meanwhile.
        EXPECT_EQ(lookup(daemon, "com.example.root", 10).code(), 1u);
        std::string other;
        EXPECT_EQ(runProgramAs(kOtherUid + 1, ctl, &other), 1) << other;
        EXPECT_EQ(other.find("refused"), std::string::npos) << other;
    }
    // Once the holder lets go, its user gets in again.
    std::string err;
    int status = 0;
    for (int i = 0; i < 100; ++i) {
        err.clear();
        status = runProgramAs(kOtherUid, ctl, &err);
        if (status != 3) break;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    EXPECT_EQ(status, 1) << err;
    const std::string log = readFile(logPath(daemon));
    EXPECT_NE(log.find("Connection limit reached for uid " + std::to_string(kOtherUid)), std::string::npos) << log;
    EXPECT_EQ(daemon.stop(), 0);

    // With no daemon, the client says so rather than guess at a cause.
    std::string gone;
    EXPECT_EQ(runProgramAs(0, ctl, &gone), 3);
    EXPECT_NE(gone.find("vesseld is not running"), std::string::npos) << gone;
}

TEST(DaemonLiveness, ConnectionsBeyondWhatTheDescriptorLimitAllowsAreRefusedNotLeftHanging) {
    DaemonProcess daemon;
    const std::string program = vesseldPath();
    const std::string stderrPath = daemon.at("vesseld.stderr");
    // A daemon whose descriptor limit is 256, soft and hard.
    const pid_t pid = ::fork();
    if (pid == 0) {
        const rlimit low{256, 256};
        const int log = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
        if (::setrlimit(RLIMIT_NOFILE, &low) != 0 || log < 0) ::_exit(126);
        ::dup2(log, 2);
        ::setenv("VESSELD_OSLOG", "off", 1);
        ::execl(program.c_str(), "vesseld", "--root", daemon.root().c_str(), "--init", nullptr);
        ::_exit(127);
    }
    ASSERT_GT(pid, 0);
    auto stop = [pid] {
        ::kill(pid, SIGTERM);
        int status = 0;
        while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
        }
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    };
    DaemonProcess::CtlResult r;
    for (int i = 0; i < 400 && r.code() != 1u; ++i) {
        r = lookup(daemon, "com.example.crowded", 10);
        if (r.code() != 1u) std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    ASSERT_EQ(r.code(), 1u) << r.err << readFile(daemon.at("vesseld.stderr"));

    // Two clients of root, whose own share is larger than the total: the total stops them.
    const std::string request = *encodeFrame(1, 0, dict({{"Command", Value::uint64(27)}}));
    {
        HeldConnections first(daemon.socketPath(), 0, 150, request);
        HeldConnections second(daemon.socketPath(), 0, 150, request);
        EXPECT_EQ(first.replies(), 150u);
        ASSERT_EQ(second.frames().size(), 150u);
        EXPECT_GT(second.refusals(), 0u);
        EXPECT_EQ(second.replies() + second.refusals(), 150u) << "every connection answered or refused at once";
        r = lookup(daemon, "com.example.crowded", 10);
        EXPECT_EQ(r.exitCode, 3);
        EXPECT_NE(r.err.find("too many connections to the daemon"), std::string::npos) << r.err;
    }
    for (int i = 0; i < 100; ++i) {
        r = lookup(daemon, "com.example.crowded", 10);
        if (r.exitCode != 3) break;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    EXPECT_EQ(r.code(), 1u) << r.err;
    EXPECT_EQ(stop(), 0);
    const std::string log = readFile(logPath(daemon));
    EXPECT_NE(log.find("Connection limit reached: "), std::string::npos) << log;
    EXPECT_EQ(readFile(daemon.at("vesseld.stderr")).find("Too many open files"), std::string::npos);
}

TEST(DaemonLogVolume, LookupsWriteNoLogLinesUnlessALevelAsksForThem) {
    DaemonProcess daemon;
    // This test binary is the client: many lookups on one connection, as an app does.
    char exe[PATH_MAX];
    ASSERT_TRUE(::realpath("/proc/self/exe", exe));
    const std::string policy = daemon.at("etc/vesseld/code-signatures");
    ASSERT_EQ(std::system(("mkdir -p '" + policy + "'").c_str()), 0);
    VSLErrorRef error;
    ASSERT_TRUE(VSL_writeToURL(dict({{"Executable", Value::string(exe)},
                                     {"SigningIdentifier", Value::string("com.example.tests")},
                                     {"Entitlements", dict({{kAllowed, Value::boolean(true)}})},
                                     {"Sandboxed", Value::boolean(false)}}),
                               policy + "/tests.plist", kVSLWriteAtomic, &error));

    const Value request = dict({{"Command", Value::uint64(0)},
                                {"Identifier", Value::string("com.example.logged")},
                                {"ContainerClass", Value::uint64(2)},
                                {"CreateIfNecessary", Value::boolean(true)}});
    auto lookups = [&](int count) {
        auto connection = client::VSLConnection::connect(daemon.socketPath());
        ASSERT_TRUE(connection);
        for (int i = 0; i < count; ++i) {
            auto reply = connection->sendRequest(request, std::chrono::seconds(30));
            ASSERT_TRUE(reply.ok()) << reply.error;
            ASSERT_EQ(*reply.body.find("ReplyError")->uint64Value(), 1u) << "lookup " << i;
        }
    };

    // Without a journal, structured lines go to stderr, where the daemon's is a file.
    ASSERT_TRUE(daemon.start({"VESSELD_OSLOG=stderr", "VESSELD_DEBUG=0"}));
    lookups(1);  // creates it
    const size_t stderrBefore = fileSize(daemon.at("vesseld.stderr"));
    const size_t logBefore = fileSize(logPath(daemon));
    lookups(10000);
    const size_t written = fileSize(daemon.at("vesseld.stderr")) - stderrBefore + fileSize(logPath(daemon)) - logBefore;
    EXPECT_LT(written, 100u * 1024) << readFile(daemon.at("vesseld.stderr")).substr(0, 2000);
    EXPECT_EQ(daemon.stop(), 0);

    // Asked for in device.plist, the per-request lines are written.
    const std::string factsPath = daemon.at("etc/vesseld/device.plist");
    const std::string bytes = readFile(factsPath);
    auto facts = decodePropertyList(bytes.data(), bytes.size(), nullptr);
    ASSERT_TRUE(facts && facts->dictionaryValue());
    Dictionary withLevel = *facts->dictionaryValue();
    withLevel.insert_or_assign("LogLevel", Value::string("info"));
    ASSERT_TRUE(VSL_writeToURL(Value::dictionary(std::move(withLevel)), factsPath, kVSLWriteAtomic, &error));
    ASSERT_TRUE(daemon.start({"VESSELD_OSLOG=stderr", "VESSELD_DEBUG=0"}));
    const size_t before = fileSize(daemon.at("vesseld.stderr"));
    lookups(10);
    const std::string text = readFile(daemon.at("vesseld.stderr")).substr(before);
    EXPECT_NE(text.find("command=0, client=com.example.tests, error=1"), std::string::npos) << text;
    EXPECT_NE(text.find("signpost begin IPCEventProcessing"), std::string::npos) << text;
    EXPECT_EQ(daemon.stop(), 0);
}
