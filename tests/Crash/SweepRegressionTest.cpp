// Faults the sweep found, each at the kill point that showed it. The point is found
// in the scenario's trace by what the step does, so that it stays the same point when
// steps are added before it.
#include <gtest/gtest.h>

#include <functional>

#include "Crash/CrashSweep.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// Runs the kill point `offset` steps after the first step of the traced run that
// `matches` (given the root of the traced run); false when no step matches.
SweepResult killAt(const std::string& scenario, const std::function<bool(const TraceStep&, const std::string&)>& matches,
                   uint64_t offset = 0) {
    const Scenario& s = scenarioNamed(scenario);
    SweepResult counted = runSweep(s, {}, true);
    const std::string& root = counted.root;
    for (const TraceStep& step : counted.trace)
        if (matches(step, root)) return runSweep(s, {step.n + offset});
    ADD_FAILURE() << "no such step in " << scenario;
    return {};
}

std::string joined(const std::vector<std::string>& lines) {
    std::string out;
    for (const auto& l : lines) out += l + "\n";
    return out;
}

bool isTemporaryRename(const TraceStep& step, const char* directory) {
    return step.kind == "rename" && step.from.find(std::string(directory) + "/.") != std::string::npos;
}

}  // namespace

// Killed between the write of a journal's (or pending update's) temporary file and its
// rename: the file, hidden from every listing, stayed for ever.
TEST(CrashRegression, ReplaceWithOldAndProtectKilledBeforeTheirFileIsRenamedIntoPlaceLeaveNoTemporaryFile) {
    SweepResult replace = killAt("ReplaceWithOld", [](const TraceStep& s, const std::string&) {
        return isTemporaryRename(s, "Vesselry/Replace");
    });
    EXPECT_EQ(1u, replace.exercised);
    EXPECT_TRUE(replace.failures.empty()) << joined(replace.failures);
    SweepResult protect = killAt("Protect", [](const TraceStep& s, const std::string&) {
        return isTemporaryRename(s, "Vesselry/PendingUpdates");
    });
    EXPECT_EQ(1u, protect.exercised);
    EXPECT_TRUE(protect.failures.empty()) << joined(protect.failures);
}

// Killed just after the fresh container of a wipe moved into the old one's place: the
// old UUID was written into its metadata only after the move, so the container came
// back under the fresh container's UUID.
TEST(CrashRegression, WipeKilledOnceTheFreshContainerIsInPlaceKeepsTheOldUUID) {
    const KnownContainer* target = preparedRoot().find(kTarget);
    ASSERT_TRUE(target);
    SweepResult wipe = killAt(
        "Wipe",
        [&](const TraceStep& s, const std::string& root) {
            return s.kind == "rename" && s.path == joinPath(root, target->path);
        },
        1);
    EXPECT_EQ(1u, wipe.exercised);
    EXPECT_TRUE(wipe.failures.empty()) << joined(wipe.failures);
}
