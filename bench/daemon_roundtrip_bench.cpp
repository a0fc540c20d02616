// Whole-daemon costs against the machine's floors, measured in one run:
//  - command 32 and the lookup of an existing container (command 0) over IPC, vs a
//    bare blocking echo of the same frame sizes over the same kind of socket;
//  - the creation of a new data container (command 0) vs the bare system-call
//    sequence it needs (mkdir of the skeleton, metadata written to a temporary file,
//    fsync, rename, directory fsync);
//  - lookups per second with 4, 16 and 64 concurrent clients, each looking up its
//    own container, vs a bare echo server (a thread per connection, in a process of
//    its own) answering the same frames to the same number of clients;
//  - the daemon's resident set once started and idle.
// Starts a real vesseld (next to this program's build tree) on a scratch root and
// registers this program in its policy store.
//
//   daemon_roundtrip_bench [round trips, default 5000]
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "bench_daemon.h"
#include "bench_socket.h"
#include "bench_table.h"
#include "Client/VSLConnection.h"
#include "Platform/IpcWire.h"

using namespace vsl;
using Clock = std::chrono::steady_clock;

namespace {

double usSince(Clock::time_point t) { return std::chrono::duration<double, std::micro>(Clock::now() - t).count(); }

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v.empty() ? 0 : v[v.size() / 2];
}

bool readAll(int fd, void* p, size_t n) {
    auto* c = static_cast<char*>(p);
    while (n) {
        ssize_t r = read(fd, c, n);
        if (r <= 0) return false;
        c += r;
        n -= static_cast<size_t>(r);
    }
    return true;
}

// The floor: read a length-prefixed frame, write a canned reply frame, in a process
// of its own as the daemon is.
double bareEchoMicros(const std::string& dir, size_t requestBytes, size_t replyBytes, int n) {
    std::string path = dir + "/echo.sock";
    int listener = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    listen(listener, 4);
    pid_t server = fork();
    if (server == 0) {
        int fd = accept(listener, nullptr, nullptr);
        std::string reply(replyBytes, 'r');
        std::vector<char> buf(1 << 16);
        for (;;) {
            uint32_t len;
            if (!readAll(fd, &len, 4) || !readAll(fd, buf.data(), len)) break;
            uint32_t out = static_cast<uint32_t>(reply.size());
            std::string frame(reinterpret_cast<char*>(&out), 4);
            frame += reply;
            if (write(fd, frame.data(), frame.size()) != static_cast<ssize_t>(frame.size())) break;
        }
        close(fd);
        _exit(0);
    }
    int c = socket(AF_UNIX, SOCK_STREAM, 0);
    connect(c, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    std::string request(requestBytes, 'q');
    uint32_t len = static_cast<uint32_t>(request.size());
    std::string frame(reinterpret_cast<char*>(&len), 4);
    frame += request;
    std::vector<char> buf(1 << 16);
    std::vector<double> samples;
    for (int i = 0; i < n; i++) {
        auto t = Clock::now();
        if (write(c, frame.data(), frame.size()) < 0) break;
        uint32_t rl;
        readAll(c, &rl, 4);
        readAll(c, buf.data(), rl);
        samples.push_back(usSince(t));
    }
    close(c);
    waitpid(server, nullptr, 0);
    close(listener);
    unlink(path.c_str());
    return median(samples);
}

// The floor of a creation: what a container needs from the kernel, done by hand.
double bareCreateMicros(const std::string& dir, int n) {
    std::vector<double> samples;
    std::string live = dir + "/live";
    mkdir(live.c_str(), 0755);
    std::string metadata(600, 'm');
    for (int i = 0; i < n; i++) {
        auto t = Clock::now();
        std::string staging = dir + "/stage-" + std::to_string(i);
        mkdir(staging.c_str(), 0755);
        for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"})
            mkdir((staging + "/" + sub).c_str(), 0755);
        std::string tmp = staging + "/.tmp-metadata";
        int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        if (write(fd, metadata.data(), metadata.size()) < 0) break;
        fsync(fd);
        close(fd);
        rename(tmp.c_str(), (staging + "/.metadata.plist").c_str());
        int d = open(staging.c_str(), O_RDONLY | O_DIRECTORY);
        fsync(d);
        close(d);
        rename(staging.c_str(), (live + "/" + std::to_string(i)).c_str());
        d = open(live.c_str(), O_RDONLY | O_DIRECTORY);
        fsync(d);
        close(d);
        samples.push_back(usSince(t));
    }
    return median(samples);
}

// Requests per second of `clients` threads sharing `total` round trips of `one`.
template <class MakeClient>
double throughput(int clients, int total, MakeClient&& makeClient) {
    std::vector<std::function<void()>> each;
    for (int k = 0; k < clients; k++) each.push_back(makeClient(k));
    std::atomic<bool> go{false};
    std::vector<std::thread> threads;
    const int per = std::max(1, total / clients);
    for (auto& one : each)
        threads.emplace_back([&] {
            while (!go.load()) std::this_thread::yield();
            for (int i = 0; i < per; i++) one();
        });
    auto t0 = Clock::now();
    go = true;
    for (auto& t : threads) t.join();
    return per * clients / (usSince(t0) / 1e6);
}

}  // namespace

int main(int argc, char** argv) {
    int n = argc > 1 ? std::atoi(argv[1]) : 5000;
    vslbench::BenchDaemon daemon;
    if (!daemon.start()) {
        std::fprintf(stderr, "daemon did not start\n");
        return 1;
    }
    const auto& c = daemon.connection();
    const std::string& root = daemon.root();
    std::string socketPath = client::VSLConnection::socketPathForSystemRoot(root);
    auto call = [&](const std::shared_ptr<client::VSLConnection>& conn, const Value& req) {
        auto r = conn->sendRequest(req, std::chrono::seconds(30));
        return r.ok() && r.body.find("ReplyError")->uint64Value() == 1u;
    };
    auto lookupOf = [](const std::string& identifier, bool create) {
        return dict({{"Command", Value::uint64(0)},
                     {"Identifier", Value::string(identifier)},
                     {"ContainerClass", Value::uint64(2)},
                     {"CreateIfNecessary", Value::boolean(create)}});
    };

    Value personas = dict({{"Command", Value::uint64(32)}});
    for (int i = 0; i < 200; i++) call(c, personas);  // warm up
    std::this_thread::sleep_for(std::chrono::seconds(1));
    const long idleKiB = daemon.residentKiB();
    if (!call(c, lookupOf("com.example.bench.app", true))) {
        std::fprintf(stderr, "create failed\n");
        return 1;
    }

    std::vector<double> s32, sLookup;
    for (int i = 0; i < n; i++) {
        auto t = Clock::now();
        call(c, personas);
        s32.push_back(usSince(t));
    }
    Value lookup = lookupOf("com.example.bench.app", false);
    for (int i = 0; i < n; i++) {
        auto t = Clock::now();
        call(c, lookup);
        sLookup.push_back(usSince(t));
    }
    size_t req = encodeFrame(1, 0, lookup)->size();
    size_t rep = 300;
    double echo = bareEchoMicros(root, req, rep, n);

    int creations = std::max(50, n / 50);
    std::vector<double> sCreate;
    for (int i = 0; i < creations; i++) {
        Value fresh = lookupOf("com.example.bench.new" + std::to_string(i), true);
        auto t = Clock::now();
        call(c, fresh);
        sCreate.push_back(usSince(t));
    }
    std::string bareDir = root + "/bare";
    mkdir(bareDir.c_str(), 0755);
    double bareCreate = bareCreateMicros(bareDir, creations);

    // Many clients, each with its own container, against a bare echo server with as
    // many clients in the same run.
    const int counts[] = {4, 16, 64};
    for (int k = 0; k < 64; k++)
        if (!call(c, lookupOf("com.example.bench.client" + std::to_string(k), true))) {
            std::fprintf(stderr, "create failed\n");
            return 1;
        }
    const std::string requestFrame = *encodeFrame(1, 0, lookup);
    std::string replyFrame(4 + rep, 'r');
    const uint32_t replyLength = static_cast<uint32_t>(rep);
    std::memcpy(replyFrame.data(), &replyLength, 4);
    const std::string echoPath = root + "/many-echo.sock";
    pid_t echoServer = fork();
    if (echoServer == 0) {
        vslbench::RawEchoServer server(echoPath, replyFrame);
        pause();
        _exit(0);
    }
    for (int i = 0; i < 400 && access(echoPath.c_str(), F_OK) != 0; i++)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    const int total = std::max(2000, n * 2);
    std::vector<std::pair<double, double>> many;
    for (int clients : counts) {
        double ours = throughput(clients, total, [&](int k) {
            auto conn = client::VSLConnection::connect(socketPath, nullptr);
            Value mine = lookupOf("com.example.bench.client" + std::to_string(k), false);
            return std::function<void()>([conn, mine, &call] {
                if (!call(conn, mine)) {
                    std::fprintf(stderr, "lookup failed\n");
                    std::exit(1);
                }
            });
        });
        double floor = throughput(clients, total, [&](int) {
            int fd = vslbench::connectTo(echoPath);
            return std::function<void()>([fd, &requestFrame, &replyFrame] {
                std::string in(replyFrame.size(), '\0');
                if (!vslbench::writeAll(fd, requestFrame.data(), requestFrame.size()) ||
                    !vslbench::readAll(fd, in.data(), in.size())) {
                    std::fprintf(stderr, "echo failed\n");
                    std::exit(1);
                }
            });
        });
        many.emplace_back(ours, floor);
    }
    kill(echoServer, SIGKILL);
    waitpid(echoServer, nullptr, 0);

    vslbench::printRow("command 32 round trip / bare echo", median(s32), echo, "us", "(none)");
    vslbench::printRow("lookup (existing) over IPC / bare echo", median(sLookup), echo, "us", "<= 1.3");
    vslbench::printRow("create data container / bare syscalls", median(sCreate), bareCreate, "us", "<= 1.3");
    for (size_t i = 0; i < many.size(); i++)
        vslbench::printRow("lookups/s, " + std::to_string(counts[i]) + " clients / bare echo server", many[i].first,
                           many[i].second, "/s", ">= 0.7");
    vslbench::printFigure("idle resident set", idleKiB / 1024.0, "MiB", "<= 6 MiB");
    return 0;
}
