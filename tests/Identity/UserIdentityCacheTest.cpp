#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <set>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Identity/PersonaTestSupport.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// A persona list handed out from memory, counting how often it was asked for.
struct FakeSource {
    std::mutex mutex;
    std::vector<PersonaAttributesList> answers;  // one per call; the last one repeats
    int calls = 0;

    std::shared_ptr<UserManagement> service() {
        return UserManagement::createWithSource([this]() -> std::optional<PersonaAttributesList> {
            std::lock_guard g(mutex);
            size_t i = std::min<size_t>(calls++, answers.size() - 1);
            return answers[i];
        });
    }
    int callCount() {
        std::lock_guard g(mutex);
        return calls;
    }
};

std::shared_ptr<VSLUserIdentityCache> makeCache(std::shared_ptr<UserManagement> service, bool personas,
                                                std::vector<std::chrono::seconds>* sleeps = nullptr) {
    VSLUserIdentityCache::Options options;
    options.userManagement = std::move(service);
    options.personasSupported = personas;
    options.sleep = [sleeps](std::chrono::seconds s) {
        if (sleeps) sleeps->push_back(s);
    };
    return VSLUserIdentityCache::create(options);
}

// Records invalidations; calls back into the cache to prove its lock is not held.
class RecordingObserver : public VSLUserIdentityCacheObserver {
public:
    void userIdentityCache(VSLUserIdentityCache& cache, const VSLUserIdentityRef& identity) override {
        cache.userIdentityWithPersonaID(1000);
        std::lock_guard g(mutex);
        invalidated.insert(identity->identifier());
        changed.notify_all();
    }
    bool waitFor(const std::set<std::string>& identifiers) {
        return waitUntil(mutex, changed, [&] {
            return std::includes(invalidated.begin(), invalidated.end(), identifiers.begin(), identifiers.end());
        });
    }
    std::set<std::string> seen() {
        std::lock_guard g(mutex);
        return invalidated;
    }

    std::mutex mutex;
    std::condition_variable changed;
    std::set<std::string> invalidated;
};

std::set<std::string> identifiers(const VSLUserIdentitySet& set) {
    std::set<std::string> out;
    for (const auto& u : set) out.insert(u->identifier());
    return out;
}

// Adds a second user with its own home so that re-based homes can be told apart.
void addOtherUser(const TempRoot& root) {
    root.writeFile("etc/passwd", readFile(root.at("etc/passwd")) + "other:x:600:601::/private/var/other:/bin/sh\n");
    root.writeFile("private/var/other/.keep", "");
}

}  // namespace

TEST(UserIdentityCache, WithoutPersonasEverythingIsTheMobileUser) {
    TempRoot root;
    FakeSource source;
    source.answers = {attributesFor(standardPersonas())};
    auto cache = makeCache(source.service(), false);

    auto personal = cache->userIdentityForPersonalPersona(0, 0);
    ASSERT_TRUE(personal);
    EXPECT_EQ(501u, personal->posixUID()) << "a role uid is replaced by the mobile user";
    EXPECT_EQ(501u, personal->posixGID());
    EXPECT_EQ(kVSLPersonaTypePersonal, personal->personaType());
    EXPECT_TRUE(sameUserIdentity(VSLUserIdentityCache::defaultUserIdentity(), personal));

    auto rebased = cache->userIdentityForPersonaUniqueString(std::string("E-1"), 600, 601);
    ASSERT_TRUE(rebased);
    EXPECT_EQ(600u, rebased->posixUID());
    EXPECT_EQ(601u, rebased->posixGID());
    EXPECT_EQ(kVSLPersonaTypePersonal, rebased->personaType()) << "strings mean nothing without personas";
    EXPECT_TRUE(sameUserIdentity(personal, cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1")));
    EXPECT_TRUE(sameUserIdentity(personal, cache->userIdentityForCurrentContext(0, 0)));
    EXPECT_EQ(nullptr, cache->userIdentityWithPersonaID(1001));
    EXPECT_TRUE(cache->isBundleIdentifier("com.example.mail", rebased));

    std::vector<VSLUserIdentityRef> visited;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const VSLUserIdentityRef& u) { visited.push_back(u); });
    ASSERT_EQ(1u, visited.size());
    EXPECT_EQ(VSLUserIdentityCache::defaultUserIdentity(), visited[0]);
    EXPECT_EQ(0, source.callCount()) << "the persona list is never asked for";
}

TEST(UserIdentityCache, LooksUpPersonasByStringIDBundleAndCaller) {
    TempRoot root;
    addOtherUser(root);
    FakeSource source;
    source.answers = {attributesFor(standardPersonas())};
    auto cache = makeCache(source.service(), true);

    auto personal = cache->userIdentityForPersonalPersona(0, 0);
    ASSERT_TRUE(personal);
    EXPECT_EQ(501u, personal->posixUID());
    EXPECT_EQ("P-1", personal->personaUniqueString());
    EXPECT_EQ(1000, personal->kernelPersonaID());
    EXPECT_EQ(VSLFileManager::homeDirectoryURLForPOSIXUID(501), personal->homeDirectoryURL());

    auto personal600 = cache->userIdentityForPersonalPersona(600, 601);
    EXPECT_EQ(600u, personal600->posixUID());
    EXPECT_EQ(root.at("private/var/other"), personal600->homeDirectoryURL()) << "non-enterprise homes follow the uid";
    EXPECT_EQ(1000, personal600->kernelPersonaID());

    auto e1 = cache->userIdentityForPersonaUniqueString(std::string("E-1"), 501, 501);
    ASSERT_TRUE(e1);
    EXPECT_TRUE(e1->isEnterprise());
    EXPECT_EQ("E-1", e1->identifier());
    EXPECT_EQ(root.at("private/var/PersonaVolumes/E-1"), e1->homeDirectoryURL());
    auto e1At600 = cache->userIdentityForPersonaUniqueString(std::string("E-1"), 600, 601);
    EXPECT_EQ(600u, e1At600->posixUID());
    EXPECT_EQ(e1->homeDirectoryURL(), e1At600->homeDirectoryURL()) << "an enterprise home stays";
    EXPECT_EQ(nullptr, cache->userIdentityForPersonaUniqueString(std::string("nope"), 501, 501));

    auto unspecific = cache->userIdentityForPersonaUniqueString(std::nullopt, 501, 501);
    ASSERT_TRUE(unspecific);
    EXPECT_TRUE(unspecific->isNoSpecificPersona());
    EXPECT_EQ(unspecific, cache->userIdentityForPersonaUniqueString(std::string("U-1"), 0, 0));
    EXPECT_EQ(unspecific, cache->userIdentityWithPersonaID(900));
    EXPECT_EQ(unspecific, cache->userIdentityWithPersonaID(901)) << "system persona without a string";
    EXPECT_EQ(personal, cache->userIdentityWithPersonaID(1000));
    EXPECT_EQ(e1, cache->userIdentityWithPersonaID(1001));
    EXPECT_EQ(nullptr, cache->userIdentityWithPersonaID(1003)) << "enterprise without a string is skipped";
    EXPECT_EQ(cache->userIdentityWithPersonaID(1002), cache->userIdentityForCurrentUserWithPersonaUniqueString("E-2"));

    using Ids = std::set<std::string>;
    EXPECT_EQ((Ids{"501"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.unlisted")));
    EXPECT_EQ((Ids{"E-1", "E-2"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.mail")));
    EXPECT_EQ((Ids{"E-2"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.notes")));
    EXPECT_EQ((Ids{"501", "E-1", "E-2"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.phone")));
    EXPECT_EQ((Ids{"501", "E-1", "E-2"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.settings")));
    EXPECT_EQ((Ids{"501"}), identifiers(cache->userIdentitiesForBundleIdentifier("com.example.lost")));
    EXPECT_TRUE(cache->isBundleIdentifier("com.example.mail", e1));
    EXPECT_FALSE(cache->isBundleIdentifier("com.example.mail", personal));
    EXPECT_FALSE(cache->isBundleIdentifier("com.example.unlisted", e1));

    // Callers: uid 502 runs in E-1; root has no persona; the mobile user is personal.
    auto caller = cache->userIdentityForCurrentContext(502, 502);
    EXPECT_EQ("E-1", caller->identifier());
    EXPECT_EQ(502u, caller->posixUID());
    auto rootCaller = cache->userIdentityForCurrentContext(0, 0);
    EXPECT_TRUE(rootCaller->isNoSpecificPersona());
    EXPECT_EQ(501u, rootCaller->posixUID());
    EXPECT_EQ(kVSLPersonaTypePersonal, cache->userIdentityForCurrentContext()->personaType());

    // Metadata files resolve through the cache.
    uint64_t code = 1;
    Value stored = e1->plist();
    EXPECT_EQ(e1, VSLUserIdentity::userIdentityWithPlist(stored, *cache, &code));

    std::set<std::string> visited;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const VSLUserIdentityRef& u) { EXPECT_TRUE(visited.insert(u->identifier()).second); });
    EXPECT_EQ((Ids{"501", "E-1", "E-2"}), visited);
    EXPECT_EQ(1, source.callCount()) << "built once, lazily";
}

TEST(UserIdentityCache, FlushTellsObserversAndRepopulateDoesNot) {
    TempRoot root;
    FakeSource source;
    source.answers = {attributesFor(standardPersonas())};
    auto cache = makeCache(source.service(), true);
    auto observer = std::make_shared<RecordingObserver>();
    auto gone = std::make_shared<RecordingObserver>();
    cache->addObserver(observer);
    cache->addObserver(observer);
    cache->addObserver(gone);
    gone.reset();

    auto personal = VSLUserIdentity::create(501, 501, root.at("p"), std::string("P-9"), kVSLPersonaTypePersonal, 50);
    auto enterprise = VSLUserIdentity::create(501, 501, root.at("e"), std::string("E-9"), kVSLPersonaTypeEnterprise, 51);
    cache->flushAndRepopulateWithUserIdentities({personal, enterprise});
    EXPECT_EQ(enterprise, cache->userIdentityForPersonaUniqueString(std::string("E-9"), 501, 501));
    EXPECT_EQ(50, cache->userIdentityForPersonalPersona()->kernelPersonaID());
    auto unspecific = cache->unspecificUserIdentity();
    EXPECT_TRUE(unspecific->isNoSpecificPersona());
    EXPECT_EQ("P-9", unspecific->personaUniqueString());
    EXPECT_EQ(root.at("p"), unspecific->homeDirectoryURL());
    EXPECT_TRUE(observer->seen().empty());
    EXPECT_EQ(0, source.callCount());

    cache->flush();
    EXPECT_EQ((std::set<std::string>{"E-9"}), observer->seen()) << "each observer told once per identity";
    EXPECT_EQ(nullptr, cache->userIdentityWithPersonaID(51));
    EXPECT_EQ(1, source.callCount()) << "rebuilt on the next read";

    cache->removeObserver(observer);
    observer->invalidated.clear();
    cache->flush();
    EXPECT_TRUE(observer->seen().empty());
}

TEST(UserIdentityCache, RemovedEnterprisePersonaIsInvalidatedWhenTheFileChanges) {
    TempRoot root;
    writePersonas(root, standardPersonas());
    auto cache = makeCache(UserManagement::create(), true);
    ASSERT_TRUE(cache->isRegistered());
    auto observer = std::make_shared<RecordingObserver>();
    cache->addObserver(observer);
    ASSERT_TRUE(cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1"));

    auto rows = standardPersonas();
    rows.erase(rows.begin() + 1);  // E-1
    writePersonas(root, rows);
    // Every enterprise identity is flushed, not only the one that went away.
    ASSERT_TRUE(observer->waitFor({"E-1", "E-2"}));
    EXPECT_EQ((std::set<std::string>{"E-1", "E-2"}), observer->seen());
    EXPECT_EQ(nullptr, cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1"));
    EXPECT_EQ(nullptr, cache->userIdentityWithPersonaID(1001));
    EXPECT_TRUE(cache->userIdentityForCurrentUserWithPersonaUniqueString("E-2"));
}

TEST(UserIdentityCache, UnreadablePersonaFileKeepsTheLastGoodList) {
    TempRoot root;
    LogCapture log(root.at("logs"));
    writePersonas(root, standardPersonas());
    auto cache = makeCache(UserManagement::create(), true);
    ASSERT_TRUE(cache->userIdentityWithPersonaID(1001));

    root.writeFile("etc/vesseld/personas.plist", "<plist><array><dict><key>");
    cache->flush();
    EXPECT_TRUE(cache->userIdentityWithPersonaID(1001)) << "malformed";
    makePersonasUnreadable(root);
    cache->flush();
    EXPECT_TRUE(cache->userIdentityWithPersonaID(1001)) << "unreadable";
    EXPECT_NE(std::string::npos, log.contents().find("Could not read the persona list"));
}

TEST(UserIdentityCache, EmptyOrUnusableListsAreRetriedOneSecondApart) {
    TempRoot root;
    LogCapture log(root.at("logs"));
    FakeSource source;
    auto noPersonalString = standardPersonas();
    noPersonalString[0].uniqueString.reset();
    auto enterpriseOnly = standardPersonas();
    enterpriseOnly.erase(enterpriseOnly.begin());
    source.answers = {{}, attributesFor(enterpriseOnly), attributesFor(noPersonalString),
                      attributesFor(standardPersonas())};
    std::vector<std::chrono::seconds> sleeps;
    auto cache = makeCache(source.service(), true, &sleeps);

    EXPECT_EQ("P-1", cache->userIdentityForPersonalPersona()->personaUniqueString());
    EXPECT_EQ(4, source.callCount());
    EXPECT_EQ(std::vector<std::chrono::seconds>(3, std::chrono::seconds(1)), sleeps);
    std::string lines = log.contents();
    EXPECT_NE(std::string::npos, lines.find("Did not receive any persona attributes"));
    EXPECT_NE(std::string::npos, lines.find("Expected to find a personal persona in"));
    EXPECT_NE(std::string::npos, lines.find("Invalid persona unique string for personal"));
}

TEST(UserIdentityCacheDeathTest, PersonaListThatStaysEmptyEndsTheProcessAfter61Attempts) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    TempRoot root;
    EXPECT_EXIT(
        {
            int attempts = 0;
            auto service = UserManagement::createWithSource([&]() -> std::optional<PersonaAttributesList> {
                if (++attempts > 61) _exit(0);  // one attempt too many
                std::fprintf(stderr, "attempt %d\n", attempts);
                return PersonaAttributesList{};
            });
            VSLUserIdentityCache::Options options;
            options.userManagement = service;
            options.personasSupported = true;
            options.sleep = [](std::chrono::seconds s) {
                if (s != std::chrono::seconds(1)) _exit(0);
            };
            VSLUserIdentityCache::create(options)->userIdentityForPersonalPersona();
            _exit(0);
        },
        testing::KilledBySignal(SIGABRT),
        "attempt 61\n(.|\n)*Could not obtain persona attributes after exhausting retries\\.");
}
