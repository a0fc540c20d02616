// Round-trip cost of the IPC transport against the machine's floor, measured in the
// same run: an IpcServer whose handler answers at once, driven by the client
// library, versus a minimal blocking echo (a thread per connection that reads a
// length-prefixed request and writes a canned reply). Both move the same bytes: a
// ~200-byte request frame and a ~300-byte reply frame.
//
//   ipc_echo_bench [round trips per run, default 20000]
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Client/VSLConnection.h"
#include "Platform/IpcServer.h"
#include "Platform/IpcWire.h"
#include "bench_socket.h"
#include "bench_table.h"

using namespace vsl;
using Clock = std::chrono::steady_clock;
using namespace vslbench;

namespace {

constexpr int kRuns = 5;
constexpr int kClients = 8;

Value request() {
    return dict({{"Command", Value::uint64(0)},
                 {"Identifier", Value::string("com.example.benchmark.application-" + std::string(60, 'x'))},
                 {"ContainerClass", Value::uint64(2)},
                 {"CreateIfNecessary", Value::boolean(true)},
                 {"Transient", Value::boolean(false)}});
}

Value reply() {
    return dict({{"ReplyError", Value::uint64(1)},
                 {"ReplyUUID", Value::uuid(Uuid::random())},
                 {"ReplyExisted", Value::boolean(true)},
                 {"ReplyPath", Value::string("/private/var/mobile/Containers/Data/Application/" + std::string(30, 'p'))},
                 {"ReplyIdentifier", Value::string("com.example.benchmark.application-" + std::string(60, 'x'))}});
}

struct Result {
    double microsPerRoundTrip;   // one client, median of the runs
    double aggregatePerSecond;   // kClients clients at once, median of the runs
};

// `makeClient` returns a function doing one round trip on its own connection.
Result measure(const std::function<std::function<void()>()>& makeClient, int roundTrips) {
    std::vector<double> single, aggregate;
    auto one = makeClient();
    for (int i = 0; i < roundTrips / 10; ++i) one();  // warm-up
    for (int run = 0; run < kRuns; ++run) {
        const auto start = Clock::now();
        for (int i = 0; i < roundTrips; ++i) one();
        const std::chrono::duration<double, std::micro> took = Clock::now() - start;
        single.push_back(took.count() / roundTrips);
    }
    std::vector<std::function<void()>> clients;
    for (int c = 0; c < kClients; ++c) clients.push_back(makeClient());
    for (int run = 0; run < kRuns; ++run) {
        std::atomic<bool> go{false};
        std::vector<std::thread> threads;
        const int each = roundTrips / kClients;
        for (auto& client : clients) {
            threads.emplace_back([&] {
                while (!go.load()) std::this_thread::yield();
                for (int i = 0; i < each; ++i) client();
            });
        }
        const auto start = Clock::now();
        go = true;
        for (auto& t : threads) t.join();
        const std::chrono::duration<double> took = Clock::now() - start;
        aggregate.push_back(each * kClients / took.count());
    }
    std::sort(single.begin(), single.end());
    std::sort(aggregate.begin(), aggregate.end());
    return {single[kRuns / 2], aggregate[kRuns / 2]};
}

}  // namespace

int main(int argc, char** argv) {
    const int roundTrips = argc > 1 ? std::max(100, std::atoi(argv[1])) : 20000;
    char dirTemplate[] = "/tmp/ipc-echo-bench-XXXXXX";
    if (!::mkdtemp(dirTemplate)) return 1;
    const std::string dir = dirTemplate;
    const std::string requestFrame = *encodeFrame(1, 0, request());
    const std::string replyFrame = *encodeFrame(1, kIpcFlagReply, reply());
    std::fprintf(stderr, "request frame %zu bytes, reply frame %zu bytes, %d round trips per run, median of %d runs\n",
                requestFrame.size(), replyFrame.size(), roundTrips, kRuns);

    Result floor;
    {
        RawEchoServer raw(dir + "/raw", replyFrame);
        floor = measure(
            [&] {
                const int fd = connectTo(dir + "/raw");
                return std::function<void()>([fd, &requestFrame, &replyFrame] {
                    std::string in(replyFrame.size(), '\0');
                    if (!writeAll(fd, requestFrame.data(), requestFrame.size()) ||
                        !readAll(fd, in.data(), in.size())) {
                        std::fprintf(stderr, "raw echo failed\n");
                        std::exit(1);
                    }
                });
            },
            roundTrips);
    }

    Result ipc;
    {
        IpcServerOptions options;
        options.path = dir + "/ipc";
        const Value answer = reply();
        options.onMessage = [answer](std::shared_ptr<IpcPeer> peer, IpcMessage m) { peer->sendReply(m.id, answer); };
        std::string error;
        auto server = IpcServer::start(std::move(options), &error);
        if (!server) {
            std::fprintf(stderr, "%s\n", error.c_str());
            return 1;
        }
        const Value body = request();
        ipc = measure(
            [&] {
                auto conn = client::VSLConnection::connect(dir + "/ipc");
                return std::function<void()>([conn, &body] {
                    if (!conn->sendRequest(body).ok()) {
                        std::fprintf(stderr, "ipc round trip failed\n");
                        std::exit(1);
                    }
                });
            },
            roundTrips);
    }

    vslbench::printRow("IpcServer round trip / raw blocking echo", ipc.microsPerRoundTrip, floor.microsPerRoundTrip,
                       "us", "(none)");
    vslbench::printRow("IpcServer, 8 clients / raw echo, 8 clients", ipc.aggregatePerSecond,
                       floor.aggregatePerSecond, "/s", ">= 0.8");
    ::unlink((dir + "/raw").c_str());
    ::unlink((dir + "/ipc.lock").c_str());
    ::rmdir(dir.c_str());
    return 0;
}
