// The group manager on a temporary root with the real container cache and database:
// the owner query, and the full reconciliation that stages group containers nothing
// names any more, followed onto death row.
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <set>
#include <thread>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/CodeSigning/VSLGroupManager.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLClientConnection.h"

using namespace vsl;
using namespace vsl::test;

namespace {

std::set<std::string> asSet(const std::optional<std::vector<std::string>>& list) {
    return list ? std::set<std::string>(list->begin(), list->end()) : std::set<std::string>{"<none>"};
}

PersonaAttributes persona(bool enterprise, const char* unique, uint32_t id) {
    PersonaAttributes p;
    p.isPersonal = !enterprise;
    p.isEnterprise = enterprise;
    p.uniqueString = unique;
    p.kernelPersonaID = id;
    p.uid = 501;
    p.gid = 501;
    if (enterprise) p.layoutPath = codeSigningTestRoot().at(std::string("private/var/enterprise/") + unique);
    return p;
}

VSLUserIdentityRef userWithPersona(VSLUserIdentityCache& cache, const std::string& unique) {
    VSLUserIdentityRef found;
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& u) {
        if (u->personaUniqueString() == unique) found = u;
    });
    return found;
}

}  // namespace

TEST_F(CodeSigningTest, TheOwnerQueryAnswersFromTheOwnersEntitlements) {
    VSLGroupManager manager(identityCacheWithPersonas({}));
    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(
                  infoWithEntitlements(dict({{kVSLApplicationGroupsEntitlement, strings({"group.a", "group.b"})},
                                             {kVSLSystemGroupsEntitlement, strings({"systemgroup.s", "plain.s"})}})),
                  "com.example.owner", std::nullopt, queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(
                               infoWithEntitlements(dict({{kVSLApplicationGroupsEntitlement, Value::uint64(7)}})),
                               "com.example.number", std::nullopt, queue));

    uint64_t code = kVSLSuccess;
    EXPECT_EQ((std::set<std::string>{"group.a", "group.b"}),
              asSet(manager.groupContainerIdentifiersForOwnerIdentifier(Value::string("com.example.owner"),
                                                                        kVSLClassAppGroup, true, &code)));
    EXPECT_EQ(kVSLSuccess, code);
    EXPECT_EQ((std::set<std::string>{"systemgroup.s"}),
              asSet(manager.groupContainerIdentifiersForOwnerIdentifier(Value::string("com.example.owner"),
                                                                        kVSLClassSystemGroup, false, &code)))
        << "the system-group prefix rule";
    EXPECT_EQ(std::set<std::string>{},
              asSet(manager.groupContainerIdentifiersForOwnerIdentifier(Value::string("com.example.unknown"),
                                                                        kVSLClassAppGroup, true, &code)));
    EXPECT_EQ(kVSLSuccess, code) << "an unknown owner has no groups; that is no failure";
    EXPECT_EQ(std::set<std::string>{},
              asSet(manager.groupContainerIdentifiersForOwnerIdentifier(Value::string("com.example.number"),
                                                                        kVSLClassAppGroup, true, &code)))
        << "an entitlement that is not a string or a list of strings names no group";
    EXPECT_EQ(kVSLSuccess, code);
    EXPECT_FALSE(manager.groupContainerIdentifiersForOwnerIdentifier(Value::uint64(3), kVSLClassAppGroup, true, &code));
    EXPECT_EQ(kVSLErrorInvalidObject, code);
}

TEST_F(CodeSigningTest, ReconciliationStagesUnreferencedAppGroupsForEveryUserWithAHome) {
    PersonaAttributes personal = persona(false, "P-1", 1000);
    PersonaAttributes housed = persona(true, "E-1", 1001);
    PersonaAttributes homeless = persona(true, "E-2", 1002);
    removeTree(*housed.layoutPath);
    removeTree(*homeless.layoutPath);
    codeSigningTestRoot().writeFile("private/var/enterprise/E-1/.keep", "");
    auto identities = identityCacheWithPersonas({personal, housed, homeless});
    makeMapping(identities);
    VSLGroupManager manager(identities);
    auto personalUser = userWithPersona(*identities, "P-1");
    auto housedUser = userWithPersona(*identities, "E-1");
    ASSERT_TRUE(personalUser && housedUser);

    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(appGroups(strings({"group.kept"})), "A", std::nullopt, queue));
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(appGroups(strings({"group.invalid-only"})), "I", std::nullopt, queue));
    ASSERT_TRUE(mapping_->invalidateCodeSigningInfoForIdentifier("I", nullptr));
    auto kept = makeContainer(personalUser, kVSLClassAppGroup, "group.kept");
    auto invalidOnly = makeContainer(personalUser, kVSLClassAppGroup, "group.invalid-only");
    auto orphan = makeContainer(personalUser, kVSLClassAppGroup, "group.orphan");
    auto data = makeContainer(personalUser, kVSLClassApplicationData, "group.orphan");

    auto reconciliation = VSLCommandQueue::create();
    manager.reconcileGroupContainersOfType(kVSLGroupTypeApplication, reconciliation, true);
    // (An enterprise user's containers cannot be read back here: the container cache
    // resolves personas through the process's own identity cache, which has none.)
    EXPECT_EQ(1u, reconciliation->pendingCount()) << "the orphan of the one user with a home and containers";
    EXPECT_EQ(1u, log_.count("Removing group container group.orphan for "));
    EXPECT_EQ(0u, log_.count("Failed to fetch group container list")) << "the user without a home is not looked at";
    EXPECT_FALSE(exists(*homeless.layoutPath));
    EXPECT_TRUE(exists(orphan->url())) << "only queued so far";

    uint64_t code = kVSLSuccess;
    ASSERT_TRUE(reconciliation->executeAllUntilExhaustedOrError(&code)) << code;
    EXPECT_FALSE(exists(orphan->url()));
    EXPECT_TRUE(exists(deathRowPathOf(*orphan)));
    EXPECT_FALSE(cacheHasContainer(personalUser, kVSLClassAppGroup, "group.orphan"));
    for (const auto& stays : {kept, invalidOnly, data}) EXPECT_TRUE(exists(stays->url())) << stays->url();
    EXPECT_TRUE(cacheHasContainer(personalUser, kVSLClassAppGroup, "group.invalid-only"))
        << "an invalid entry still names its groups";

    auto again = VSLCommandQueue::create();
    manager.reconcileGroupContainersOfType(kVSLGroupTypeApplication, again, true);
    EXPECT_EQ(0u, again->pendingCount());
    removeTree(*housed.layoutPath);
}

TEST_F(CodeSigningTest, SystemGroupReconciliationCoversTheDefaultUsersSystemGroups) {
    VSLGroupManager manager(identityCacheWithPersonas({}));
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(
                               infoWithEntitlements(dict({{kVSLSystemGroupsEntitlement, strings({"systemgroup.kept"})}})),
                               "S", std::nullopt, queue));
    auto kept = makeContainer(user, kVSLClassSystemGroup, "systemgroup.kept");
    auto orphan = makeContainer(user, kVSLClassSystemGroup, "systemgroup.orphan");
    auto appGroup = makeContainer(user, kVSLClassAppGroup, "group.orphan");

    auto reconciliation = VSLCommandQueue::create();
    manager.reconcileGroupContainersOfType(kVSLGroupTypeSystem, reconciliation, true);
    EXPECT_EQ(1u, reconciliation->pendingCount());
    uint64_t code = kVSLSuccess;
    ASSERT_TRUE(reconciliation->executeAllUntilExhaustedOrError(&code)) << code;
    EXPECT_TRUE(exists(deathRowPathOf(*orphan)));
    EXPECT_TRUE(exists(kept->url()));
    EXPECT_TRUE(exists(appGroup->url())) << "application groups are another type's business";
}

TEST_F(CodeSigningTest, ReconciliationRunsWhileClientsCreateContainers) {
    VSLGroupManager manager(identityCacheWithPersonas({}));
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(
                  appGroups(strings({"group.n0", "group.n1", "group.n2", "group.n3", "group.n4", "group.n5"})), "A",
                  std::nullopt, queue));
    std::vector<VSLMetadataRef> orphans;
    for (const char* id : {"group.o0", "group.o1", "group.o2", "group.o3"})
        orphans.push_back(makeContainer(user, kVSLClassAppGroup, id));

    // Clients create named groups and data containers while reconciliations run.
    std::atomic<bool> failed{false};
    auto creator = [&](int worker) {
        auto connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(user);
        for (int i = 0; i < 6; i++) {
            for (VSLContainerClass c : {kVSLClassAppGroup, kVSLClassApplicationData}) {
                std::string id = (c == kVSLClassAppGroup ? "group.n" : "com.example.w" + std::to_string(worker) + ".") +
                                 std::to_string(i);
                uint64_t code = kVSLSuccess;
                auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, id, c, &code);
                if (!identity || !connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true,
                                                                                          &code))
                    failed = true;
            }
        }
        return true;
    };
    std::vector<std::future<bool>> creators;
    for (int w = 0; w < 3; w++) creators.push_back(std::async(std::launch::async, creator, w));
    size_t staged = 0;
    for (int round = 0; round < 3; round++) {
        auto reconciliation = VSLCommandQueue::create();
        manager.reconcileGroupContainersOfType(kVSLGroupTypeApplication, reconciliation, true);
        staged += reconciliation->pendingCount();
        uint64_t code = kVSLSuccess;
        EXPECT_TRUE(reconciliation->executeAllUntilExhaustedOrError(&code)) << code;
    }
    for (auto& f : creators) ASSERT_EQ(std::future_status::ready, f.wait_for(std::chrono::seconds(60)));
    EXPECT_FALSE(failed);
    EXPECT_EQ(orphans.size(), staged) << "each orphan once, nothing a client made";
    for (const auto& o : orphans) EXPECT_TRUE(exists(deathRowPathOf(*o)));
    for (int i = 0; i < 6; i++) {
        EXPECT_TRUE(cacheHasContainer(user, kVSLClassAppGroup, "group.n" + std::to_string(i)));
        for (int w = 0; w < 3; w++)
            EXPECT_TRUE(cacheHasContainer(user, kVSLClassApplicationData,
                                          "com.example.w" + std::to_string(w) + "." + std::to_string(i)));
    }
}
