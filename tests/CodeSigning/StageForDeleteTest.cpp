// Staging bundle containers: their code-signing records go with them unless a
// transient copy leaves while the permanent one stays.
#include <gtest/gtest.h>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Storage/VSLContainerCache.h"

using namespace vsl;
using namespace vsl::test;

namespace {

struct StageRun {
    bool ok = false;
    uint64_t code = kVSLSuccess;
    std::vector<uint64_t> reported;
};

StageRun stage(std::vector<VSLContainerIdentityRef> identities, const std::shared_ptr<VSLCommandQueue>& queue) {
    StageRun run;
    auto command = VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        std::move(identities), true, [&run](uint64_t code) { run.reported.push_back(code); });
    EXPECT_EQ(3u, command->command());
    queue->insertCommand(command);
    run.ok = queue->executeAllUntilExhaustedOrError(&run.code);
    return run;
}

VSLContainerIdentityRef plain(const std::string& identifier, VSLContainerClass c) {
    uint64_t code = kVSLSuccess;
    return VSLContainerIdentity::containerIdentityWithIdentifier(identifier, c, &code);
}

}  // namespace

TEST_F(CodeSigningTest, StagingABundleRemovesItsRecordsUnlessOnlyATransientCopyGoes) {
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto queue = VSLCommandQueue::create();
    Value info = infoWithEntitlements(dict({}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.app", std::nullopt, queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(
                               info, "com.example.app.widget",
                               dict({{kVSLOptionParentBundleID, Value::string("com.example.app")}}), queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.updating", std::nullopt, queue));
    auto app = makeContainer(user, kVSLClassApplication, "com.example.app");
    auto permanent = makeContainer(user, kVSLClassApplication, "com.example.updating");
    auto transient = makeContainer(user, kVSLClassApplication, "com.example.updating", true);

    StageRun run = stage({plain("com.example.app", kVSLClassApplication), transient->containerIdentity()}, queue);
    EXPECT_TRUE(run.ok);
    EXPECT_TRUE(run.reported.empty());
    EXPECT_TRUE(exists(deathRowPathOf(*app)));
    EXPECT_TRUE(exists(deathRowPathOf(*transient)));
    EXPECT_TRUE(exists(permanent->url()));
    EXPECT_FALSE(cacheHasContainer(user, kVSLClassApplication, "com.example.app"));
    EXPECT_FALSE(cacheHasContainer(user, kVSLClassApplication, "com.example.updating", true));
    EXPECT_TRUE(cacheHasContainer(user, kVSLClassApplication, "com.example.updating"));
    EXPECT_EQ(std::set<std::string>{"com.example.updating"}, mapping_->identifiersWithError(nullptr))
        << "the app and its plug-in lose their records; the update in progress keeps its";
    EXPECT_EQ(1u, log_.count("Skipping removal of code sign mapping since container to be deleted "
                             "[com.example.updating] is transient"));
}

TEST_F(CodeSigningTest, AContainerThatIsNotThereIsReportedWithoutFailingTheRun) {
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto queue = VSLCommandQueue::create();
    auto vanished = makeContainer(user, kVSLClassSystemData, "com.example.vanished");
    removeTree(vanished->url());
    auto present = makeContainer(user, kVSLClassSystemData, "com.example.present");

    std::vector<uint64_t> reported;
    auto command = VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {plain("com.example.present", kVSLClassSystemData), plain("com.example.vanished", kVSLClassSystemData)}, true,
        [&reported](uint64_t code) { reported.push_back(code); });
    uint64_t code = kVSLSuccess;
    EXPECT_TRUE(command->fromQueue(queue, &code)) << "a lookup failure alone does not fail the run";
    ASSERT_EQ(1u, reported.size());
    EXPECT_EQ(kVSLErrorNotFound, reported[0]) << "the directory vanished behind the cache's back";
    EXPECT_EQ(reported[0], code);
    EXPECT_TRUE(exists(deathRowPathOf(*present)));
}
