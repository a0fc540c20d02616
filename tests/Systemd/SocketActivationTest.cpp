// The daemon started the way the service manager starts it: sockets passed in by name
// (systemd-socket-activate does the passing without a service manager), readiness and
// stopping reported on a notification socket the test binds.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Client/VSLConnection.h"
#include "Client/VSLUpcallClient.h"
#include "Platform/UniqueFd.h"
#include "Support/DaemonProcess.h"
#include "Support/Json.h"
#include "Support/TempRoot.h"
#include "Systemd/DatagramListener.h"

namespace vsl::test {
namespace {

const char* const kActivator = "/usr/bin/systemd-socket-activate";

// The notification socket a service manager would listen on.
class NotifySocket {
public:
    explicit NotifySocket(const std::string& path) : listener_(path) {}
    bool bound() const { return listener_.bound(); }
    // Every notification that has arrived so far, one per line.
    std::string drain() {
        std::string all;
        for (const auto& message : listener_.receive()) all += message + "\n";
        return all;
    }
    // Waits until a notification holding `text` arrives; everything seen on the way is kept.
    bool waitFor(const std::string& text, std::chrono::seconds limit) {
        const auto deadline = std::chrono::steady_clock::now() + limit;
        while (std::chrono::steady_clock::now() < deadline) {
            seen_ += drain();
            if (seen_.find(text) != std::string::npos) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return false;
    }

private:
    DatagramListener listener_;
    std::string seen_;
};

// systemd-socket-activate, which binds the sockets and execs the daemon in its own
// place on the first connection, so its pid becomes the daemon's.
class ActivatedDaemon {
public:
    ActivatedDaemon(const DaemonProcess& root, const std::vector<std::string>& activatorOptions,
                    const std::vector<std::string>& environment) {
        std::vector<std::string> argv = {kActivator};
        argv.insert(argv.end(), activatorOptions.begin(), activatorOptions.end());
        argv.push_back("-E");
        argv.push_back("VESSELD_OSLOG=off");
        for (const auto& e : environment) {
            argv.push_back("-E");
            argv.push_back(e);
        }
        argv.insert(argv.end(), {vesseldPath(), "--root", root.root(), "--init"});
        output_ = root.at("activated.out");
        pid_ = ::fork();
        if (pid_ == 0) {
            const int fd = ::open(output_.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
            ::dup2(fd, 1);
            ::dup2(fd, 2);
            std::vector<char*> cargv;
            for (auto& a : argv) cargv.push_back(a.data());
            cargv.push_back(nullptr);
            ::execv(cargv[0], cargv.data());
            ::_exit(127);
        }
    }
    ~ActivatedDaemon() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
        }
    }
    // SIGTERM and the exit status.
    int stop() {
        ::kill(pid_, SIGTERM);
        int status = 0;
        while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
        }
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    std::string output() const { return readFile(output_); }
    pid_t pid() const { return pid_; }

private:
    pid_t pid_ = -1;
    std::string output_;
};

bool waitForPath(const std::string& path, std::chrono::seconds limit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    struct stat st;
    while (::stat(path.c_str(), &st) != 0) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return true;
}

ino_t inodeOf(const std::string& path) {
    struct stat st{};
    return ::lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

const Value kPing = Value::dictionary({{"Command", Value::uint64(27)}});

TEST(SocketActivationTest, ServesOnPassedSocketsAndAnswersRequestsSentBeforeReadiness) {
    if (::access(kActivator, X_OK) != 0) GTEST_SKIP() << kActivator << " is missing: socket activation not tested";
    DaemonProcess root;
    ASSERT_EQ(0, ::mkdir(root.at("run").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir(root.at("run/vesseld").c_str(), 0755));
    NotifySocket notify(root.at("notify"));
    ASSERT_TRUE(notify.bound());
    const std::string socket = root.socketPath();
    const std::string upcall = root.at("run/vesseld/com.tarrow.vesseld.upcall");
    ActivatedDaemon daemon(root, {"-l", socket, "-l", upcall, "--fdname=vesseld:upcall"},
                           {"NOTIFY_SOCKET=" + root.at("notify")});
    ASSERT_TRUE(waitForPath(upcall, std::chrono::seconds(30))) << daemon.output();
    const ino_t socketNode = inodeOf(socket), upcallNode = inodeOf(upcall);

    // The daemon is not even running yet: the connection starts it, and the request
    // waits in the socket until start-up has finished.
    auto connection = client::VSLConnection::connect(socket, nullptr);
    ASSERT_TRUE(connection);
    EXPECT_EQ("", notify.drain()) << "nothing may report ready before the daemon runs";
    auto reply = connection->sendRequest(kPing, std::chrono::seconds(60));
    ASSERT_TRUE(reply.ok()) << reply.error << "\n" << daemon.output();
    EXPECT_TRUE(notify.waitFor("READY=1", std::chrono::seconds(30))) << daemon.output();

    // Both names were served on the passed sockets: none was bound anew.
    EXPECT_EQ(socketNode, inodeOf(socket));
    EXPECT_EQ(upcallNode, inodeOf(upcall));
    auto kernel = client::VSLUpcallClient::connect(upcall);
    ASSERT_TRUE(kernel);
    UpcallReplyFrame frame;
    EXPECT_EQ(client::VSLUpcallStatus::Ok,
              kernel->getProcessContainers(std::string(), &frame, std::chrono::seconds(30)));
    auto ctl = root.run(vesselctlPath(), {"createOrLookup", "Identifier=com.example.activated", "ContainerClass=2",
                                          "CreateIfNecessary=true"});
    EXPECT_EQ(1u, ctl.code()) << ctl.err;
    // The socket's peer is the service manager; status must still name the daemon.
    auto status = root.run(vesselctlPath(), {"status", "--json"});
    auto json = parseJson(status.out);
    ASSERT_TRUE(json && json->find("Pid")) << status.out;
    EXPECT_EQ(static_cast<int64_t>(daemon.pid()), json->find("Pid")->int64Value().value_or(-1)) << status.out;

    EXPECT_EQ(0, daemon.stop());
    EXPECT_TRUE(notify.waitFor("STOPPING=1", std::chrono::seconds(5)));
    EXPECT_EQ(std::string::npos, daemon.output().find("Refusing")) << daemon.output();
}

TEST(SocketActivationTest, RefusesAPassedSocketThatIsNotAStreamListenerAndBindsItsOwn) {
    if (::access(kActivator, X_OK) != 0) GTEST_SKIP() << kActivator << " is missing: socket activation not tested";
    DaemonProcess root;
    ASSERT_EQ(0, ::mkdir(root.at("run").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir(root.at("run/vesseld").c_str(), 0755));
    const std::string socket = root.socketPath();
    ActivatedDaemon daemon(root, {"--datagram", "-l", socket, "--fdname=vesseld"}, {});
    ASSERT_TRUE(waitForPath(socket, std::chrono::seconds(30))) << daemon.output();

    // A datagram wakes the activator, which starts the daemon with it.
    UniqueFd poke(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, socket.c_str(), sizeof addr.sun_path - 1);
    ASSERT_EQ(1, ::sendto(poke.get(), "x", 1, 0, reinterpret_cast<sockaddr*>(&addr), sizeof addr));

    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    bool answered = false;
    while (!answered && std::chrono::steady_clock::now() < deadline) {
        if (auto c = client::VSLConnection::connect(socket, nullptr))
            answered = c->sendRequest(kPing, std::chrono::seconds(10)).ok();
        if (!answered) std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    EXPECT_TRUE(answered) << "the daemon serves on a socket of its own instead\n" << daemon.output();
    EXPECT_NE(std::string::npos,
              daemon.output().find("Refusing passed socket 3 named \"vesseld\": not a listening Unix stream socket"))
        << daemon.output();
    EXPECT_EQ(0, daemon.stop());
}

}  // namespace
}  // namespace vsl::test
