// Reply latency of deleting a container that holds 100,000 files, against the reply
// for one of 1,000 files in the same run: the reply comes after a rename into death
// row, not after the removal, so it must not grow with the container. Starts a real
// vesseld on a scratch root (see daemon_roundtrip_bench).
//
//   stage_delete_bench [files, default 100000]
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>

#include "bench_daemon.h"
#include "bench_table.h"

using namespace vsl;
using Clock = std::chrono::steady_clock;

namespace {

void fillTree(const std::string& dir, int files) {
    for (int i = 0; i < files; i++) {
        std::string sub = dir + "/d" + std::to_string(i / 500);
        if (i % 500 == 0) mkdir(sub.c_str(), 0755);
        int fd = open((sub + "/f" + std::to_string(i)).c_str(), O_WRONLY | O_CREAT, 0644);
        if (fd >= 0) {
            if (write(fd, "x", 1) < 0) {
            }
            close(fd);
        }
    }
}

double msSince(Clock::time_point t) { return std::chrono::duration<double, std::milli>(Clock::now() - t).count(); }

}  // namespace

int main(int argc, char** argv) {
    int files = argc > 1 ? std::max(1000, std::atoi(argv[1])) : 100000;
    vslbench::BenchDaemon daemon;
    if (!daemon.start()) return 1;
    const auto& c = daemon.connection();
    auto request = [&](uint64_t command, const std::string& identifier, bool create) {
        return c->sendRequest(dict({{"Command", Value::uint64(command)},
                                    {"Identifier", Value::string(identifier)},
                                    {"ContainerClass", Value::uint64(2)},
                                    {"CreateIfNecessary", Value::boolean(create)}}),
                              std::chrono::seconds(600));
    };
    // Times the delete reply of a container holding `count` files, then lets death
    // row finish so that the next measure does not share the disk with it.
    auto deleteReply = [&](const std::string& identifier, int count) {
        auto r = request(0, identifier, true);
        if (!r.ok() || !r.body.find("ReplyPath")) {
            std::fprintf(stderr, "create failed\n");
            std::exit(1);
        }
        fillTree(*r.body.find("ReplyPath")->stringValue() + "/Documents", count);
        sync();
        auto t = Clock::now();
        auto d = request(10, identifier, false);
        double ms = msSince(t);
        if (!d.ok() || d.body.find("ReplyError")->uint64Value().value_or(0) != 1) {
            std::fprintf(stderr, "delete failed\n");
            std::exit(1);
        }
        c->sendRequest(dict({{"Command", Value::uint64(4)}}), std::chrono::seconds(600));
        return ms;
    };
    double small = deleteReply("com.example.small", 1000);
    double big = deleteReply("com.example.big", files);
    vslbench::printRow("delete reply, " + std::to_string(files / 1000) + "k files / 1k files", big, small, "ms",
                       "<= 1.2");
    return 0;
}
