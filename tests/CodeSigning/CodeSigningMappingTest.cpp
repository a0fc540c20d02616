// Registration through the mapping and what it stages on the command queue, with
// staged containers followed onto death row.
#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"

using namespace vsl;
using namespace vsl::test;

namespace {

bool drain(const std::shared_ptr<VSLCommandQueue>& queue, uint64_t* code = nullptr) {
    uint64_t c = kVSLSuccess;
    bool ok = queue->executeAllUntilExhaustedOrError(&c);
    if (code) *code = c;
    return ok;
}

}  // namespace

TEST_F(CodeSigningTest, RegisteringTheSameInfoTwiceChangesNothingAndNoInfoRemovesTheEntry) {
    auto queue = VSLCommandQueue::create();
    // Signed integers come back from the blob unsigned; they must still compare equal.
    Value info = infoWithEntitlements(
        dict({{kVSLApplicationGroupsEntitlement, strings({"group.a"})}, {"com.example.level", Value::int64(3)}}),
        {{"Version", Value::int64(7)}});
    Value options =
        dict({{kVSLOptionDataContainerClass, Value::uint64(2)}, {kVSLOptionPlaceholder, Value::boolean(true)}});

    EXPECT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.app", options, queue));
    EXPECT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.app", options, queue));
    EXPECT_EQ(1u, log_.count("Set Code Signing Mapping for ID: com.example.app")) << "written once";
    EXPECT_EQ(0u, queue->pendingCount());

    auto entry = mapping_->codeSigningEntryForIdentifier("com.example.app", nullptr);
    ASSERT_TRUE(entry);
    EXPECT_TRUE(entry->placeholder);
    EXPECT_FALSE(entry->advanceCopy || entry->registeredByCaller || entry->invalid);
    EXPECT_EQ(2u, mapping_->dataContainerTypeForIdentifier("com.example.app"));
    EXPECT_EQ(std::vector<std::string>{"group.a"}, mapping_->appGroupIdentifiersForIdentifier("com.example.app"));

    EXPECT_EQ(kVSLErrorMissingIdentifier, mapping_->processCodeSigningInfo(info, std::nullopt, options, queue));
    EXPECT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "com.example.never", std::nullopt, queue));
    EXPECT_EQ(0u, log_.count("Deleted Code Signing Mapping")) << "nothing stored, nothing deleted";

    EXPECT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "com.example.app", std::nullopt, queue));
    EXPECT_EQ(1u, log_.count("Deleted Code Signing Mapping for ID: com.example.app"));
    EXPECT_EQ(std::set<std::string>{}, mapping_->identifiersWithError(nullptr));
}

TEST_F(CodeSigningTest, LosingTheSystemContainerEntitlementStagesThatContainer) {
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto container = makeContainer(user, kVSLClassSystemData, "com.example.daemon");
    auto queue = VSLCommandQueue::create();
    Value owning = infoWithEntitlements(dict({{kVSLSystemContainerEntitlement, Value::boolean(true)}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(owning, "com.example.daemon", std::nullopt, queue));
    EXPECT_TRUE(mapping_->identifierHasSystemContainer("com.example.daemon"));

    Value stillOwning = infoWithEntitlements(
        dict({{kVSLSystemContainerEntitlement, Value::boolean(true)}, {"com.example.extra", Value::boolean(true)}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(stillOwning, "com.example.daemon", std::nullopt, queue));
    EXPECT_EQ(0u, queue->pendingCount()) << "keeping the entitlement stages nothing";

    Value lost = infoWithEntitlements(dict({{kVSLSystemContainerEntitlement, Value::boolean(false)}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(lost, "com.example.daemon", std::nullopt, queue));
    EXPECT_EQ(1u, queue->pendingCount());
    EXPECT_EQ(1u, log_.count("Deleting system container for ID: com.example.daemon because it is no longer in the "
                             "entitlements"));
    EXPECT_TRUE(exists(container->url())) << "only queued so far";

    ASSERT_TRUE(drain(queue));
    EXPECT_FALSE(exists(container->url()));
    EXPECT_TRUE(exists(deathRowPathOf(*container)));
    EXPECT_FALSE(cacheHasContainer(user, kVSLClassSystemData, "com.example.daemon"));
    EXPECT_FALSE(mapping_->identifierHasSystemContainer("com.example.daemon"));
}

TEST_F(CodeSigningTest, AGroupNamedByTwoIdentifiersSurvivesOneAndIsStagedWhenTheSecondGoes) {
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto shared = makeContainer(user, kVSLClassAppGroup, "group.shared");
    auto onlyA = makeContainer(user, kVSLClassAppGroup, "group.only-a");
    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(appGroups(strings({"group.shared", "group.only-a", "group.shared"})),
                                               "A", std::nullopt, queue));
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(appGroups(Value::string("group.shared")), "B", std::nullopt, queue));
    EXPECT_EQ(2u, mapping_->copyReferenceCountSetOfType(kVSLGroupTypeApplication)["group.shared"])
        << "A counts once although it names the group twice";

    auto queueA = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(appGroups(strings({})), "A", std::nullopt, queueA));
    EXPECT_EQ(1u, queueA->pendingCount()) << "only the group nobody else names";
    EXPECT_EQ(1u, log_.count("ID: group.shared is 2"));
    ASSERT_TRUE(drain(queueA));
    EXPECT_TRUE(exists(deathRowPathOf(*onlyA)));
    EXPECT_TRUE(exists(shared->url()));
    EXPECT_TRUE(cacheHasContainer(user, kVSLClassAppGroup, "group.shared"));

    auto queueB = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "B", std::nullopt, queueB));
    EXPECT_EQ(1u, queueB->pendingCount());
    ASSERT_TRUE(drain(queueB));
    EXPECT_FALSE(exists(shared->url()));
    EXPECT_TRUE(exists(deathRowPathOf(*shared)));
    EXPECT_EQ(0u, mapping_->copyReferenceCountSetOfType(kVSLGroupTypeApplication).count("group.shared"));
}

TEST_F(CodeSigningTest, GroupsAreStagedOnlyForUsersWithAHome) {
    PersonaAttributes personal;
    personal.isPersonal = true;
    personal.uniqueString = "P-1";
    personal.kernelPersonaID = 1000;
    personal.uid = 501;
    personal.gid = 501;
    PersonaAttributes enterprise;
    enterprise.isEnterprise = true;
    enterprise.uniqueString = "E-1";
    enterprise.kernelPersonaID = 1001;
    enterprise.uid = 501;
    enterprise.gid = 501;
    enterprise.layoutPath = codeSigningTestRoot().at("private/var/enterprise/E-1");
    removeTree(*enterprise.layoutPath);
    makeMapping(identityCacheWithPersonas({personal, enterprise}));

    auto queue = VSLCommandQueue::create();
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(appGroups(strings({"group.x", "group.y"})), "A", std::nullopt, queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(appGroups(strings({"group.y"})), "A", std::nullopt, queue));
    EXPECT_EQ(1u, queue->pendingCount()) << "the personal user only: the enterprise home does not exist";
    EXPECT_TRUE(drain(queue)) << "a container not found does not fail the drain";
    size_t forPersonal = 0, all = 0;
    for (const auto& m : log_.messages()) {
        if (m.find("Failed to destroy group container with identifier group.x for ") == std::string::npos) continue;
        all++;
        if (m.find("personaUniqueString = P-1,") != std::string::npos) forPersonal++;
    }
    EXPECT_EQ(1u, all) << "nothing is on disk, so the one staging reports its lookup failure";
    EXPECT_EQ(1u, forPersonal);

    codeSigningTestRoot().writeFile("private/var/enterprise/E-1/.keep", "");
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "A", std::nullopt, queue));
    EXPECT_EQ(2u, queue->pendingCount()) << "both users now";
    drain(queue);
    removeTree(*enterprise.layoutPath);
}

TEST_F(CodeSigningTest, SystemGroupsFollowThePrefixRuleAndAreNeverStagedIncrementally) {
    auto queue = VSLCommandQueue::create();
    Value primary = infoWithEntitlements(
        dict({{kVSLSystemGroupsEntitlement, strings({"systemgroup.com.example.one", "com.example.unprefixed"})}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(primary, "S", std::nullopt, queue));
    EXPECT_EQ(std::vector<std::string>{"systemgroup.com.example.one"},
              mapping_->systemGroupIdentifiersForIdentifier("S"));
    EXPECT_LE(1u, log_.count("System group ID com.example.unprefixed does not have proper prefix, ignoring."));

    Value fallback =
        infoWithEntitlements(dict({{kVSLSystemGroupsEntitlement, strings({})},
                                   {kVSLSystemGroupContainersEntitlement, Value::string("systemgroup.b")}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(fallback, "T", std::nullopt, queue));
    EXPECT_EQ(std::vector<std::string>{"systemgroup.b"}, mapping_->systemGroupIdentifiersForIdentifier("T"));
    auto counts = mapping_->copyReferenceCountSetOfType(kVSLGroupTypeSystem);
    EXPECT_EQ(1u, counts["systemgroup.b"]);
    EXPECT_EQ(1u, counts["systemgroup.com.example.one"]);

    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "S", std::nullopt, queue));
    EXPECT_EQ(0u, queue->pendingCount());
    EXPECT_EQ(1u, log_.count("Would have removed system group container references for"));

    Value number = infoWithEntitlements(dict({{kVSLApplicationGroupsEntitlement, Value::uint64(5)}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(number, "N", std::nullopt, queue));
    EXPECT_FALSE(mapping_->appGroupIdentifiersForIdentifier("N"));
    EXPECT_LE(1u, log_.count("Entitlement com.tarrow.security.application-groups for N does not contain supported "
                             "types; ignoring."));
    Value mixed = infoWithEntitlements(
        dict({{kVSLApplicationGroupsEntitlement, Value::array({Value::string("group.ok"), Value::uint64(1)})}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(mixed, "N", std::nullopt, queue));
    EXPECT_FALSE(mapping_->appGroupIdentifiersForIdentifier("N"));
}

TEST_F(CodeSigningTest, ChildrenAttachOnlyToStoredParentsAndGoWithThem) {
    auto queue = VSLCommandQueue::create();
    Value childOptions = dict({{kVSLOptionParentBundleID, Value::string("com.example.parent")},
                               {kVSLOptionDataContainerClass, Value::uint64(4)}});
    Value info = infoWithEntitlements(dict({}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.parent.ext", childOptions, queue));
    EXPECT_TRUE(mapping_->codeSigningEntryForIdentifier("com.example.parent.ext", nullptr)) << "the child is written";
    EXPECT_FALSE(mapping_->codeSigningEntryForIdentifier("com.example.parent", nullptr)) << "the blank parent is not";
    EXPECT_FALSE(mapping_->parentIdentifierForChildIdentifier("com.example.parent.ext"));

    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.parent", std::nullopt, queue));
    EXPECT_FALSE(mapping_->parentIdentifierForChildIdentifier("com.example.parent.ext"));
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(info, "com.example.parent.ext", childOptions, queue));
    EXPECT_EQ("com.example.parent", mapping_->parentIdentifierForChildIdentifier("com.example.parent.ext"));
    EXPECT_EQ(std::vector<std::string>{"com.example.parent.ext"},
              mapping_->childBundleIdentifiersForParentIdentifier("com.example.parent"));

    mapping_->removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.parent", queue);
    EXPECT_EQ(std::set<std::string>{}, mapping_->identifiersWithError(nullptr));
}

TEST_F(CodeSigningTest, ExternalReadsHideProvisionalEntriesAndCallerRegistrationYieldsToInstallers) {
    auto queue = VSLCommandQueue::create();
    Value ents = dict({{"com.example.flag", Value::boolean(true)}});
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(infoWithEntitlements(ents), "com.example.placeholder",
                                               dict({{kVSLOptionPlaceholder, Value::boolean(true)}}), queue));
    EXPECT_FALSE(mapping_->getCodeSigningInfoForIdentifier("com.example.placeholder"));
    EXPECT_EQ(ents, mapping_->entitlementsForIdentifier("com.example.placeholder"));
    ASSERT_EQ(kVSLSuccess,
              mapping_->processCodeSigningInfo(infoWithEntitlements(ents), "com.example.real", std::nullopt, queue));
    EXPECT_EQ(infoWithEntitlements(ents), mapping_->getCodeSigningInfoForIdentifier("com.example.real"));
    ASSERT_TRUE(mapping_->invalidateCodeSigningInfoForIdentifier("com.example.real", nullptr));
    EXPECT_FALSE(mapping_->getCodeSigningInfoForIdentifier("com.example.real"));

    // A client registering itself.
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("com.example.client"));
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    EXPECT_EQ(1u, log_.count("Set Code Signing Mapping for ID: com.example.client"));
    Value changed = dict({{"com.example.flag", Value::boolean(false)}});
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(changed, "com.example.client", queue));
    EXPECT_EQ(1u, log_.count("com.example.client has changed entitlements. Re-registering."));
    EXPECT_EQ(changed, mapping_->entitlementsForIdentifier("com.example.client"));

    // Information an installer registered wins over what the client says.
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(changed, "com.example.real", queue));
    EXPECT_EQ(ents, mapping_->entitlementsForIdentifier("com.example.real"));
    EXPECT_FALSE(mapping_->identifierHasCallerRegisteredEntitlements("com.example.real"));
    EXPECT_EQ(kVSLErrorMissingIdentifier, mapping_->processCallerRegisteredEntitlements(ents, std::string(), queue));
}

TEST_F(CodeSigningTest, EntriesWithoutABundleContainerAreInvalidatedAndCachedInfoIsImported) {
    auto user = VSLUserIdentityCache::defaultUserIdentity();
    auto queue = VSLCommandQueue::create();
    Value info = infoWithEntitlements(dict({}));
    auto reg = [&](const char* id, Value options = Value()) {
        ASSERT_EQ(kVSLSuccess,
                  mapping_->processCodeSigningInfo(info, std::string(id),
                                                   options.isNull() ? std::nullopt : std::optional(options), queue));
    };
    reg("gone");
    reg("installed");
    makeContainer(user, kVSLClassApplication, "installed");
    reg("plugin.installed");
    makeContainer(user, kVSLClassPlugin, "plugin.installed");
    reg("gone.ext",
        dict({{kVSLOptionDataContainerClass, Value::uint64(4)}, {kVSLOptionParentBundleID, Value::string("gone")}}));
    reg("orphan.ext", dict({{kVSLOptionDataContainerClass, Value::uint64(4)}}));
    ASSERT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(dict({}), "self.registered", queue));

    EXPECT_EQ(kVSLSuccess, mapping_->invalidateCodeSigningInfoForAppsWithoutBundleContainer());
    auto invalid = [&](const char* id) { return mapping_->codeSigningEntryForIdentifier(id, nullptr)->invalid; };
    EXPECT_TRUE(invalid("gone"));
    EXPECT_TRUE(invalid("gone.ext")) << "kept as a plug-in with a parent, but invalidated as the parent's child";
    EXPECT_TRUE(invalid("orphan.ext"));
    EXPECT_FALSE(invalid("installed"));
    EXPECT_FALSE(invalid("plugin.installed"));
    EXPECT_FALSE(invalid("self.registered"));

    // Nothing stored, but the bundle container still carries what an older install cached.
    Value cached = dict({{"Entitlements", dict({{kVSLApplicationGroupsEntitlement, Value::string("group.old")}})},
                         {"TeamIdentifier", Value::string("T1")}});
    makeContainer(user, kVSLClassApplication, "legacy", false, dict({{kVSLCachedCodeSigningInfoKey, cached}}));
    EXPECT_EQ(std::vector<std::string>{"group.old"}, mapping_->appGroupIdentifiersForIdentifier("legacy"));
    auto imported = mapping_->codeSigningEntryForIdentifier("legacy", nullptr);
    ASSERT_TRUE(imported);
    EXPECT_EQ(kVSLClassApplicationData, imported->dataContainerClass);
    EXPECT_EQ(Value::string("T1"), *imported->codeSigningInfo->find("TeamIdentifier"));
    EXPECT_EQ(1u, log_.count("Migrating code signing info from bundle container upon request for legacy"));
    EXPECT_FALSE(mapping_->entitlementsForIdentifier("unknown"));
}

// Every message checks its sender's own entitlements; an unchanged sender must not
// wait for the code-signing queue (held here by a suspension, as by other clients'
// database work), while any change to the stored entry is still seen at once.
TEST_F(CodeSigningTest, AnUnchangedCallerIsCheckedWithoutTheQueueAndAStoredChangeIsSeen) {
    auto queue = VSLCommandQueue::create();
    Value ents = dict({{"com.example.flag", Value::boolean(true)}});
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(infoWithEntitlements(ents), "com.example.installed",
                                                            std::nullopt, queue));
    // The first check registers the client; the next ones find it stored.
    ASSERT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    ASSERT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(dict({}), "com.example.installed", queue));

    auto checkWhileQueueHeld = [&](const Value& given, const char* identifier) {
        mapping_->queue()->suspend();
        auto done = std::async(std::launch::async, [&] {
            return mapping_->processCallerRegisteredEntitlements(given, std::string(identifier), queue);
        });
        bool answered = done.wait_for(std::chrono::seconds(5)) == std::future_status::ready;
        mapping_->queue()->resume();
        EXPECT_EQ(kVSLSuccess, done.get());
        return answered;
    };
    EXPECT_TRUE(checkWhileQueueHeld(ents, "com.example.client"));
    EXPECT_TRUE(checkWhileQueueHeld(dict({}), "com.example.installed")) << "installer-registered entries win";
    EXPECT_EQ(1u, log_.count("Set Code Signing Mapping for ID: com.example.client"));

    // An installer's registration replaces the client's own: the next check must read it.
    Value installed = dict({{"com.example.flag", Value::boolean(false)}});
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(infoWithEntitlements(installed), "com.example.client",
                                                            std::nullopt, queue));
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    EXPECT_EQ(installed, mapping_->entitlementsForIdentifier("com.example.client"));
    // Removed, the client registers itself again.
    ASSERT_EQ(kVSLSuccess, mapping_->processCodeSigningInfo(std::nullopt, "com.example.client", std::nullopt, queue));
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(ents, "com.example.client", queue));
    EXPECT_EQ(ents, mapping_->entitlementsForIdentifier("com.example.client"));
    EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("com.example.client"));
    // A changed client re-registers.
    EXPECT_EQ(kVSLSuccess, mapping_->processCallerRegisteredEntitlements(installed, "com.example.client", queue));
    EXPECT_EQ(installed, mapping_->entitlementsForIdentifier("com.example.client"));
}
