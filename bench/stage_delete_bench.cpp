// Reply latency of deleting a container that holds 50,000 files, against `rm -rf` of
// the same tree: the reply comes after a rename into death row, not after the
// removal. Starts a real vesseld on a scratch root (see daemon_roundtrip_bench).
//
//   stage_delete_bench [files, default 50000]
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>

#include "bench_daemon.h"

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
    int files = argc > 1 ? std::atoi(argv[1]) : 50000;
    vslbench::BenchDaemon daemon;
    if (!daemon.start()) return 1;
    const auto& c = daemon.connection();
    const std::string& root = daemon.root();
    auto r = c->sendRequest(dict({{"Command", Value::uint64(0)},
                                  {"Identifier", Value::string("com.example.big")},
                                  {"ContainerClass", Value::uint64(2)},
                                  {"CreateIfNecessary", Value::boolean(true)}}),
                            std::chrono::seconds(30));
    if (!r.ok() || !r.body.find("ReplyPath")) return 1;
    std::string path = *r.body.find("ReplyPath")->stringValue();
    fillTree(path + "/Documents", files);
    std::string twin = root + "/twin";
    mkdir(twin.c_str(), 0755);
    fillTree(twin, files);
    sync();

    auto t = Clock::now();
    auto d = c->sendRequest(dict({{"Command", Value::uint64(10)},
                                  {"Identifier", Value::string("com.example.big")},
                                  {"ContainerClass", Value::uint64(2)}}),
                            std::chrono::seconds(600));
    double reply = msSince(t);
    // Let death row finish before measuring rm, so the two do not share the disk.
    c->sendRequest(dict({{"Command", Value::uint64(4)}}), std::chrono::seconds(600));
    t = Clock::now();
    std::system(("rm -rf '" + twin + "'").c_str());
    double rm = msSince(t);
    std::printf("delete reply (%d files)   %10.2f ms  (code %llu)\n", files, reply,
                (unsigned long long)d.body.find("ReplyError")->uint64Value().value_or(0));
    std::printf("rm -rf of the same tree   %10.2f ms\n", rm);
    std::printf("ratio reply / rm -rf      %10.4f\n", reply / rm);
    return 0;
}
