// Round trip of the kernel's container query for an application whose containers
// already exist (data container, two groups, a system container), against the
// machine's floor measured in the same run: a bare blocking echo over the same kind
// of socket, moving the same request and reply bytes. Prints both and their ratio.
//
//   upcall_roundtrip_bench [round trips per run, default 5000]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Client/VSLUpcallClient.h"
#include "Client/VSLUpcallProtocol.h"
#include "bench_daemon.h"
#include "bench_socket.h"
#include "bench_table.h"

using namespace vsl;
using namespace vsl::client;
using namespace vslbench;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int kRuns = 5;
constexpr auto kWait = std::chrono::seconds(30);

// Median microseconds per call of `one` over kRuns runs of `count` calls.
template <class F>
double medianMicros(F&& one, int count) {
    for (int i = 0; i < std::max(1, count / 10); ++i) one();  // warm-up
    std::vector<double> runs;
    for (int run = 0; run < kRuns; ++run) {
        const auto start = Clock::now();
        for (int i = 0; i < count; ++i) one();
        const std::chrono::duration<double, std::micro> took = Clock::now() - start;
        runs.push_back(took.count() / count);
    }
    std::sort(runs.begin(), runs.end());
    return runs[kRuns / 2];
}

}  // namespace

int main(int argc, char** argv) {
    const int roundTrips = argc > 1 ? std::max(100, std::atoi(argv[1])) : 5000;
    BenchDaemon daemon;
    if (!daemon.start()) {
        std::fprintf(stderr, "the daemon did not start\n");
        return 1;
    }
    std::string error;
    // The channel opens during start-up, after the client socket.
    std::unique_ptr<VSLUpcallClient> upcall;
    for (int i = 0; i < 400 && !upcall; i++) {
        upcall = VSLUpcallClient::connect(VSLUpcallClient::socketPathForSystemRoot(daemon.root()), &error);
        if (!upcall) std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    if (!upcall) {
        std::fprintf(stderr, "no upcall channel: %s\n", error.c_str());
        return 1;
    }
    VSLUpcallQuery query;
    query.codeSignatureID = "com.example.benchmark.application";
    query.uid = 501;
    query.containerType = kVSLUpcallContainerTypeApplication;
    query.appGroupIDs = {"group.com.example.benchmark.one", "group.com.example.benchmark.two"};
    query.systemContainerID = "com.example.benchmark.system";
    query.personaID = kVSLUpcallNoPersona;
    const std::string request = *packUpcallQuery(query);

    // The first request makes the containers; the rest look them up.
    UpcallReplyFrame reply;
    if (upcall->getProcessContainers(request, &reply, kWait, &error) != VSLUpcallStatus::Ok || reply.returnCode != 0) {
        std::fprintf(stderr, "the first upcall failed: %s (code %d)\n", error.c_str(), reply.returnCode);
        return 1;
    }
    const double daemonMicros = medianMicros(
        [&] {
            UpcallReplyFrame r;
            if (upcall->getProcessContainers(request, &r, kWait, &error) != VSLUpcallStatus::Ok || r.returnCode != 0) {
                std::fprintf(stderr, "upcall failed: %s\n", error.c_str());
                std::exit(1);
            }
        },
        roundTrips);

    // The floor: the same frames, echoed by a server that does nothing else.
    const std::string requestFrame = *encodeUpcallRequestFrame(kVSLUpcallGetProcessContainersID, request);
    const std::string replyFrame = *encodeUpcallReplyFrame(kVSLUpcallGetProcessContainersID, 0, reply.packbuff);
    RawEchoServer raw(daemon.root() + "/raw-echo", replyFrame);
    const int fd = connectTo(daemon.root() + "/raw-echo");
    std::string in(replyFrame.size(), '\0');
    const double floorMicros = medianMicros(
        [&] {
            if (!writeAll(fd, requestFrame.data(), requestFrame.size()) || !readAll(fd, in.data(), in.size())) {
                std::fprintf(stderr, "raw echo failed\n");
                std::exit(1);
            }
        },
        roundTrips);
    ::close(fd);

    std::fprintf(stderr, "request frame %zu bytes, reply frame %zu bytes, %d round trips per run, median of %d runs\n",
                 requestFrame.size(), replyFrame.size(), roundTrips, kRuns);
    vslbench::printRow("upcall, existing containers / bare echo", daemonMicros, floorMicros, "us", "(none)");
    return 0;
}
