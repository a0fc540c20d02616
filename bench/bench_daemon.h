// A real vesseld on a scratch root for the whole-daemon benchmarks: started from the
// build tree next to the benchmark, with the benchmark program itself registered in
// the policy store with the general entitlement.
#pragma once

#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>

#include "Client/VSLConnection.h"
#include "bench_table.h"
#include "Daemon/Core/VSLPropertyListFile.h"

namespace vslbench {

inline std::string selfPath() {
    char buf[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
    buf[n > 0 ? n : 0] = 0;
    return buf;
}

class BenchDaemon {
public:
    BenchDaemon() {
        char templ[] = "/tmp/vessel-bench-XXXXXX";
        root_ = mkdtemp(templ);
    }
    ~BenchDaemon() {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
        }
        std::system(("rm -rf '" + root_ + "'").c_str());
    }

    // Starts the daemon and connects; false when it does not answer.
    bool start() {
        using namespace vsl;
        std::string daemonPath = selfPath();
        daemonPath = daemonPath.substr(0, daemonPath.rfind('/')) + "/../src/vesseld";
        std::string policyDir = root_ + "/etc/vesseld/code-signatures";
        if (std::system(("mkdir -p '" + policyDir + "'").c_str()) != 0) return false;
        VSLErrorRef error;
        VSL_writeToURL(dict({{"Executable", Value::string(selfPath())},
                             {"SigningIdentifier", Value::string("com.example.bench")},
                             {"Entitlements", dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}})}}),
                       policyDir + "/bench.plist", kVSLWriteAtomic, &error);
        chmod((policyDir + "/bench.plist").c_str(), 0644);
        pid_ = fork();
        if (pid_ == 0) {
            setenv("VESSELD_OSLOG", "off", 1);
            int devnull = open("/dev/null", O_WRONLY);
            dup2(devnull, 2);
            execl(daemonPath.c_str(), daemonPath.c_str(), "--root", root_.c_str(), "--init", nullptr);
            _exit(127);
        }
        for (int i = 0; i < 400 && !connection_; i++) {
            connection_ = connect();
            if (!connection_) std::this_thread::sleep_for(std::chrono::milliseconds(25));
        }
        return connection_ != nullptr;
    }

    std::shared_ptr<vsl::client::VSLConnection> connect() const {
        return vsl::client::VSLConnection::connect(vsl::client::VSLConnection::socketPathForSystemRoot(root_),
                                                   nullptr);
    }
    const std::shared_ptr<vsl::client::VSLConnection>& connection() const { return connection_; }
    const std::string& root() const { return root_; }
    pid_t pid() const { return pid_; }
    // The daemon's resident set in KiB, or -1.
    long residentKiB() const { return vslbench::residentKiB(std::to_string(pid_)); }

private:
    std::string root_;
    pid_t pid_ = -1;
    std::shared_ptr<vsl::client::VSLConnection> connection_;
};

}  // namespace vslbench
