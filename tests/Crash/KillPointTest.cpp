// One creation and one deletion, with the daemon killed before each durable step they
// take in turn: after a restart on the same root the class directory holds only
// whole containers, an acknowledged creation is found, an acknowledged deletion stays
// done, no identifier has two containers, and death row can be emptied.
#include <gtest/gtest.h>

#include <map>

#include "Crash/CrashSupport.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// Made before the kill point can fall, then deleted while it may.
const char* const kOlder = "com.example.crash.older";

struct Reference {
    uint64_t firstStep = 0;  // the creation's first step
    uint64_t lastStep = 0;   // the destruction's last
    std::string classDirectory, deathRow;  // relative to the root
};

std::string relativeTo(const std::string& root, const std::string& path) {
    return path.compare(0, root.size() + 1, root + "/") == 0 ? path.substr(root.size() + 1) : std::string();
}

Reference traceOnce() {
    Reference ref;
    DaemonProcess d;
    std::string trace = d.at("durable.trace");
    EXPECT_TRUE(d.start({"VESSELD_DURABLE_TRACE=" + trace}));
    EXPECT_EQ(1u, createContainer(d, kOlder).code());
    ref.firstStep = readTrace(trace).size() + 1;
    auto made = createContainer(d);
    EXPECT_EQ(1u, made.code()) << made.err;
    EXPECT_EQ(1u, deleteContainer(d, kOlder).code());
    EXPECT_EQ(1u, destroyDeathRow(d).code());
    EXPECT_EQ(0, d.stop());
    auto steps = readTrace(trace);
    ref.lastStep = steps.size();
    ref.classDirectory = relativeTo(d.root(), parentPath(replyPath(made)));
    for (const auto& s : steps)
        if (s.kind == "mkdir" && lastPathComponent(s.path) == "Dead") ref.deathRow = relativeTo(d.root(), s.path);
    return ref;
}

// Containers per identifier in the class directory; every entry must be a whole
// container, with a readable metadata file naming its identifier.
std::map<std::string, int> wholeContainers(const std::string& classDirectory) {
    std::map<std::string, int> count;
    for (const std::string& name : entriesOf(classDirectory)) {
        std::string metadata = joinPath(joinPath(classDirectory, name), kVSLMetadataFileName);
        VSLErrorRef error;
        auto dictionary = VSL_dictionaryWithContentsOfURL(metadata, 0, &error);
        const Value* identifier = dictionary ? dictionary->find(kVSLMetadataIdentifierKey) : nullptr;
        EXPECT_TRUE(identifier && identifier->stringValue()) << "not a whole container: " << name;
        if (identifier && identifier->stringValue()) count[*identifier->stringValue()]++;
    }
    return count;
}

}  // namespace

TEST(KillPoints, CreationAndDeletionKilledAtEveryStepLeaveOnlyWholeContainers) {
    Reference ref = traceOnce();
    ASSERT_FALSE(ref.classDirectory.empty());
    ASSERT_FALSE(ref.deathRow.empty());
    ASSERT_GE(ref.lastStep - ref.firstStep, 24u) << "a few dozen kill points";

    for (uint64_t n = ref.firstStep; n <= ref.lastStep; n++) {
        SCOPED_TRACE("killed before step " + std::to_string(n));
        DaemonProcess d;
        ASSERT_TRUE(d.start({"VESSELD_KILL_AT=" + std::to_string(n)})) << readFile(d.at("vesseld.stderr"));
        ASSERT_EQ(1u, createContainer(d, kOlder).code());
        bool created = createContainer(d).code() == 1;
        bool deleted = created && deleteContainer(d, kOlder).code() == 1;
        if (deleted) destroyDeathRow(d);
        ASSERT_EQ(86, d.stop()) << "the kill point was reached";

        ASSERT_TRUE(d.start()) << readFile(d.at("vesseld.stderr"));
        std::string classDirectory = d.at(ref.classDirectory);
        auto found = wholeContainers(classDirectory);
        EXPECT_LE(found[kIdentifier], 1);
        EXPECT_LE(found[kOlder], 1);
        if (created) {
            EXPECT_EQ(1u, lookUpContainer(d).code()) << "an acknowledged creation survives";
        }
        if (deleted) {
            EXPECT_EQ(21u, lookUpContainer(d, kOlder).code()) << "an acknowledged deletion stays done";
            EXPECT_EQ(0, found[kOlder]);
        }
        EXPECT_EQ(1u, createContainer(d).code());
        EXPECT_EQ(1, wholeContainers(classDirectory)[kIdentifier]) << "one container for the identifier";
        EXPECT_EQ(1u, destroyDeathRow(d).code());
        EXPECT_TRUE(entriesOf(d.at(ref.deathRow)).empty()) << "death row emptied";
        EXPECT_EQ(0, d.stop());
    }
}
