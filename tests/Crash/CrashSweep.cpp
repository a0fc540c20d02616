#include "Crash/CrashSweep.h"

#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <thread>

#include "Platform/NamedSemaphore.h"
#include "Platform/SystemRoot.h"
#include "Support/Boot.h"
#include "Support/TempRoot.h"

namespace vsl::test {

namespace {

const char* const kCleanupComplete = client::kCleanupCompleteNotification;
constexpr int kKilledStatus = 86;

std::string notificationPath(const DaemonProcess& d, const char* name) {
    return d.at(std::string("run/vesseld/notify/") + name);
}

bool posted(const DaemonProcess& d, const char* name) {
    struct stat st;
    return ::lstat(notificationPath(d, name).c_str(), &st) == 0;
}

void reboot(DaemonProcess& d) { simulateReboot(d); }

// The next kill point starts from a fresh copy at the same path: a boot of its own.
void forgetBoot(DaemonProcess& d) { removeSemaphore(firstBootMarkerName(d)); }

// Starts the daemon and waits until start-up's clean-up has finished, so that none of
// its steps is numbered as the scenario's and the checks see the repaired root. No
// request is sent before: the first one starts the numbering.
bool startSettled(DaemonProcess& d, const std::vector<std::string>& environment) {
    ::unlink(notificationPath(d, kCleanupComplete).c_str());  // the copy's, or the killed daemon's
    return d.start(environment, [] { return true; }) &&
           waitForNotification(d, kCleanupComplete, std::chrono::seconds(60));
}

bool copyRoot(const std::string& from, DaemonProcess& to, const Scenario& s) {
    std::string out, err;
    if (runProgram({"/bin/cp", "-a", from + "/.", to.root()}, &out, &err) != 0) return false;
    ::unlink(notificationPath(to, kCleanupComplete).c_str());  // posted by the daemon that made the copy
    if (s.setUp) s.setUp(to);
    return true;
}

off_t fileSize(const std::string& path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0 ? st.st_size : 0;
}

std::string tail(const std::string& text) { return text.size() > 600 ? text.substr(text.size() - 600) : text; }

// The clean-up can finish before the listener has bound its socket: wait (bounded)
// for it to answer a connection.
std::shared_ptr<client::VSLConnection> connect(const DaemonProcess& d) {
    for (int i = 0; i < 2000; i++) {
        if (auto c = client::VSLConnection::connect(d.socketPath())) return c;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return nullptr;
}

uint64_t budget() {
    const char* b = std::getenv("VESSEL_CRASH_BUDGET");
    return b ? std::strtoull(b, nullptr, 10) : 0;
}

// The step `crashAt` picks from a traced client run: a startup-scope sweep begins
// from the root that run leaves when killed there. Each kill point makes that root
// afresh: journals name their containers by absolute path, so a copy of a crashed
// root would repair the original.
uint64_t crashPoint(const Scenario& s, const PreparedRoot& prepared) {
    DaemonProcess traced;
    if (!copyRoot(prepared.daemon->root(), traced, s)) return 0;
    std::string trace = traced.at("durable.trace");
    if (!startSettled(traced, {"VESSELD_DURABLE_TRACE=" + trace})) return 0;
    SweepRun run(traced, prepared, connect(traced));
    s.drive(run);
    traced.kill();
    return s.crashAt(readTrace(trace), traced.root());
}

// A copy of the prepared root, crashed at `crashAt` when the sweep starts from one.
bool makeRoot(const Scenario& s, const PreparedRoot& prepared, uint64_t crashAt, DaemonProcess& d) {
    if (!copyRoot(prepared.daemon->root(), d, s)) return false;
    if (crashAt == 0) return true;
    if (!startSettled(d, {"VESSELD_KILL_AT=" + std::to_string(crashAt)})) return false;
    SweepRun run(d, prepared, connect(d));
    s.drive(run);
    run.connection.reset();
    return d.waitForExit(std::chrono::seconds(10)) == kKilledStatus;
}

// Waits for the kill of a start-up: -1 when start-up's clean-up finished without it.
int waitForStartupKill(DaemonProcess& d) {
    for (int i = 0; i < 1000; i++) {
        int status = d.waitForExit(std::chrono::milliseconds(20));
        if (status >= 0) return status;
        if (posted(d, kCleanupComplete)) return d.waitForExit(std::chrono::milliseconds(300));
    }
    return -1;
}

void runKillPoint(const Scenario& s, const PreparedRoot& prepared, uint64_t crashAt,
                  const std::vector<std::string>& scopeEnvironment, uint64_t n, bool rebooting,
                  SweepResult* result) {
    DaemonProcess d;
    const std::string where = s.name + " N=" + std::to_string(n) + (rebooting ? " (reboot)" : " (restart)");
    if (!makeRoot(s, prepared, crashAt, d)) {
        result->failures.push_back(where + ": cannot make the root to start from");
        return;
    }
    std::vector<std::string> environment = scopeEnvironment;
    environment.push_back("VESSELD_KILL_AT=" + std::to_string(n));
    SweepRun run(d, prepared);
    int status = -1;
    if (s.startupScope) {
        if (d.start(environment, [] { return true; })) status = waitForStartupKill(d);
    } else {
        if (!startSettled(d, environment)) {
            result->failures.push_back(where + ": the daemon did not start: " + tail(readFile(d.at("vesseld.stderr"))));
            forgetBoot(d);
            return;
        }
        run.connection = connect(d);
        s.drive(run);
        run.connection.reset();
        status = d.waitForExit(std::chrono::seconds(5));
    }
    if (status < 0) {
        result->unreached++;
        result->unreachedPoints.push_back(n);
        d.kill();
        forgetBoot(d);
        return;
    }
    if (status != kKilledStatus) {
        result->failures.push_back(where + ": the daemon exited with status " + std::to_string(status) + ": " +
                                   tail(readFile(d.at("vesseld.stderr"))));
        forgetBoot(d);
        return;
    }

    if (rebooting) reboot(d);
    if (!startSettled(d, {})) {
        result->failures.push_back(where + ": the repairing start failed: " + tail(readFile(d.at("vesseld.stderr"))));
        forgetBoot(d);
        return;
    }
    run.connection = connect(d);
    checkCommonInvariants(run, s.subjects);
    if (s.check) s.check(run);
    run.connection.reset();
    d.kill();
    forgetBoot(d);
    result->exercised++;
    for (const std::string& f : run.failures) result->failures.push_back(where + ": " + f);
}

}  // namespace

std::vector<uint64_t> killPoints(uint64_t steps, uint64_t limit) {
    std::vector<uint64_t> points;
    if (limit == 0 || limit >= steps) {
        for (uint64_t n = 1; n <= steps; n++) points.push_back(n);
        return points;
    }
    for (uint64_t i = 0; i < limit; i++) {
        uint64_t n = limit == 1 ? 1 : 1 + i * (steps - 1) / (limit - 1);
        if (points.empty() || points.back() != n) points.push_back(n);
    }
    return points;
}

SweepResult runSweep(const Scenario& s, const std::vector<uint64_t>& only, bool countOnly) {
    SweepResult result;
    const PreparedRoot& prepared = preparedRoot();
    if (!prepared.daemon) {
        result.failures.push_back(s.name + ": no prepared root");
        return result;
    }
    uint64_t crashAt = 0;
    std::vector<std::string> scopeEnvironment;
    if (s.startupScope) {
        crashAt = crashPoint(s, prepared);
        if (crashAt == 0) {
            result.failures.push_back(s.name + ": no step to crash the client run at");
            return result;
        }
        scopeEnvironment.push_back("VESSELD_KILL_SCOPE=startup");
    }

    // One traced run counts the steps and feeds the audit.
    {
        DaemonProcess d;
        std::string trace = d.at("durable.trace");
        std::vector<std::string> environment = scopeEnvironment;
        environment.push_back("VESSELD_DURABLE_TRACE=" + trace);
        if (!makeRoot(s, prepared, crashAt, d) || !startSettled(d, environment)) {
            result.failures.push_back(s.name + ": the traced run did not start");
            return result;
        }
        if (!s.startupScope) {
            SweepRun run(d, prepared, connect(d));
            s.drive(run);
        }
        // Work the scenario left in the background (death row destroyed after a
        // reply) counts too; a clean stop's own steps do not, no kill run gets there.
        for (off_t size = -1; size != fileSize(trace);) {
            size = fileSize(trace);
            std::this_thread::sleep_for(std::chrono::milliseconds(300));
        }
        d.kill();
        auto steps = readTrace(trace);
        result.steps = steps.size();
        result.trace = steps;
        result.root = d.root();
        result.auditFaults = auditRenames(steps, d.root());
        forgetBoot(d);
    }

    if (countOnly) return result;
    const auto points = only.empty() ? killPoints(result.steps, budget()) : only;
    for (size_t i = 0; i < points.size(); i++)
        runKillPoint(s, prepared, crashAt, scopeEnvironment, points[i], points[i] % 2 == 1, &result);
    return result;
}

void report(const Scenario& s, const SweepResult& r) {
    std::printf("crash sweep %s: %llu steps, %llu kill points exercised, %llu not reached, %zu invariant failures\n",
                s.name.c_str(), static_cast<unsigned long long>(r.steps), static_cast<unsigned long long>(r.exercised),
                static_cast<unsigned long long>(r.unreached), r.failures.size());
    std::string directory = std::string(VESSEL_BUILD_DIR) + "/tests/crash-sweep";
    ::mkdir(directory.c_str(), 0755);
    std::ofstream(directory + "/" + s.name + ".txt", std::ios::trunc)
        << r.exercised << " " << r.failures.size() << " " << r.unreached << "\n";
}

}  // namespace vsl::test
