// The kill-point sweep: a scenario's client part is traced once to count its durable
// steps S, then, for each N in 1..S, run on a fresh copy of a prepared root with the
// daemon killed before its Nth step, the daemon restarted (or the machine rebooted)
// and, once the start-up clean-up is done, the root checked against the invariants
// every crash must keep.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Client/VSLConnection.h"
#include "Crash/CrashSupport.h"
#include "Support/DaemonProcess.h"

namespace vsl::test {

// Layout below a root, relative to it.
extern const char* const kDeathRow;
extern const char* const kReplaceDirectory;
extern const char* const kPendingDirectory;

// A container of the prepared root: what it must still be after any crash that did
// not act on it.
struct KnownContainer {
    std::string identifier;
    uint64_t containerClass = 0;
    std::string uuid;
    std::string path;                           // relative to the root
    std::map<std::string, std::string> files;  // relative to the container -> contents
};

// Identifiers of the prepared root.
extern const char* const kTarget;       // data container that delete, replace and wipe act on
extern const char* const kProtected;    // data container with a tree of a few hundred items at class 3
extern const char* const kStagedPrefix; // kStagedPrefix + "1".."3": removed together

struct PreparedRoot {
    std::unique_ptr<DaemonProcess> daemon;  // stopped; its root is what every run copies
    std::vector<KnownContainer> containers;
    std::vector<std::string> protectedItems;  // relative to the root: every item the protection walk re-classes
    const KnownContainer* find(const std::string& identifier) const;
};
// Built once per process.
const PreparedRoot& preparedRoot();

// One run of a scenario on a copy of the prepared root.
struct SweepRun {
    SweepRun(DaemonProcess& d, const PreparedRoot& p, std::shared_ptr<client::VSLConnection> c = nullptr)
        : daemon(d), prepared(p), connection(std::move(c)) {}

    DaemonProcess& daemon;
    const PreparedRoot& prepared;
    std::shared_ptr<client::VSLConnection> connection;
    // What the client was told, by the scenario's own names: 1 means acknowledged.
    std::map<std::string, uint64_t> codes;
    std::map<std::string, std::string> values;
    std::vector<std::string> failures;  // invariants broken, one line each
    std::string lastError;              // why the last request got no answer
    // Containers found in class directories, by "<identifier> in <class directory>".
    std::map<std::string, int> onDisk;

    // Sends a request; false when the daemon is gone (the drive stops there).
    bool send(const Value& request, const std::string& name, Value* reply = nullptr);
    bool acknowledged(const std::string& name) const;
    void fail(const std::string& what) { failures.push_back(what); }
    void expect(bool holds, const std::string& what) {
        if (!holds) fail(what);
    }
};

struct Lookup {
    uint64_t code = 0;
    std::string uuid, path;  // path relative to the root
};
Lookup lookUp(SweepRun& run, const std::string& identifier, uint64_t containerClass);
Value createRequest(const std::string& identifier, uint64_t containerClass, bool transient = false, bool create = true);

// Whether the container at `path` (relative) holds the known files of `c` with their
// contents.
bool holdsFiles(const SweepRun& run, const std::string& path, const KnownContainer& c);
// Whether it holds none of them: a fresh skeleton in its place.
bool holdsNoneOf(const SweepRun& run, const std::string& path, const KnownContainer& c);
// How many containers of `identifier` the class directories hold (transient ones
// included when asked).
int containersOnDisk(const SweepRun& run, const std::string& identifier, bool transient = false);
// The invariants every scenario keeps; `subjects` are exempt from the check of
// untouched containers.
void checkCommonInvariants(SweepRun& run, const std::set<std::string>& subjects);

struct Scenario {
    std::string name;
    // Identifiers the scenario acts on: exempt from the check of untouched containers.
    std::set<std::string> subjects;
    // On the copy before the daemon's first start (for example a locked keybag).
    std::function<void(DaemonProcess&)> setUp;
    // The client part; returns when done or when the daemon has gone.
    std::function<void(SweepRun&)> drive;
    // The scenario's own invariants, after the repair.
    std::function<void(SweepRun&)> check;
    // Kill points inside the start-up of a root that `drive`, killed before the step
    // `crashAt` picks from its trace, left behind.
    bool startupScope = false;
    std::function<uint64_t(const std::vector<TraceStep>&, const std::string& root)> crashAt;
};

struct SweepResult {
    uint64_t steps = 0;        // S
    uint64_t exercised = 0;    // kill points reached and checked
    uint64_t unreached = 0;    // N the daemon never got to
    std::vector<uint64_t> unreachedPoints;
    std::vector<std::string> failures;  // "<scenario> N=<n>: <invariant>"
    std::vector<std::string> auditFaults;
    std::vector<TraceStep> trace;  // of the traced run
    std::string root;              // where the traced run ran (gone now)
};

// Every scenario of the sweep, by name.
std::vector<Scenario> allScenarios();
const Scenario& scenarioNamed(const std::string& name);

// Runs the sweep; VESSEL_CRASH_BUDGET=K keeps at most K evenly spaced kill points.
// `only` runs the given kill points instead (regression tests, the long run);
// `countOnly` stops after the traced run.
SweepResult runSweep(const Scenario& scenario, const std::vector<uint64_t>& only = {}, bool countOnly = false);
// Records the result for the run's summary and prints it.
void report(const Scenario& scenario, const SweepResult& result);

// The kill points of 1..steps that a budget of `budget` (0: all) keeps.
std::vector<uint64_t> killPoints(uint64_t steps, uint64_t budget);

}  // namespace vsl::test
