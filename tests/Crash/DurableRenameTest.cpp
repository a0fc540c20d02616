// The durable-step trace of one creation and one deletion: every move of a container
// or daemon file is synced on both sides, and the audit catches a sync left out.
#include <gtest/gtest.h>

#include "Crash/CrashSupport.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

struct TracedRun {
    std::vector<std::string> faults;
    std::string container;  // where the container lived
    int movesAudited = 0;   // renames of the container itself
};

// `drop` names the fsync a test-only switch leaves out ("" for none).
TracedRun createAndDelete(const std::string& drop) {
    TracedRun run;
    DaemonProcess d;
    std::string trace = d.at("durable.trace");
    std::vector<std::string> env = {"VESSELD_DURABLE_TRACE=" + trace};
    if (!drop.empty()) env.push_back("VESSELD_TEST_DROP_FSYNC=" + drop);
    EXPECT_TRUE(d.start(env)) << readFile(d.at("vesseld.stderr"));
    auto made = createContainer(d);
    EXPECT_EQ(1u, made.code()) << made.err;
    EXPECT_EQ(1u, deleteContainer(d).code());
    EXPECT_EQ(1u, destroyDeathRow(d).code());
    EXPECT_EQ(0, d.stop());
    run.container = replyPath(made);
    auto steps = readTrace(trace);
    for (const auto& s : steps)
        if (s.kind == "rename" && (s.path == run.container || s.from == run.container)) run.movesAudited++;
    run.faults = auditRenames(steps, d.root());
    return run;
}

std::string joined(const std::vector<std::string>& lines) {
    std::string out;
    for (const auto& l : lines) out += l + "\n";
    return out;
}

}  // namespace

TEST(DurableRenames, EveryMoveSyncsTheItemAndBothDirectoriesAndTheAuditCatchesAGap) {
    TracedRun clean = createAndDelete("");
    EXPECT_TRUE(clean.faults.empty()) << joined(clean.faults);
    EXPECT_EQ(2, clean.movesAudited) << "into its class directory, then to death row";

    // Without the fsync of the directory a move leaves, or of the moved directory
    // itself, the audit must fail, naming the container's move.
    for (const char* drop : {"parent", "item"}) {
        SCOPED_TRACE(drop);
        TracedRun gap = createAndDelete(drop);
        ASSERT_FALSE(gap.faults.empty());
        bool named = false;
        for (const auto& f : gap.faults) named |= f.find(lastPathComponent(gap.container)) != std::string::npos;
        EXPECT_TRUE(named) << joined(gap.faults);
    }
}
