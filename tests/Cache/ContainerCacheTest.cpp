#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <future>
#include <map>
#include <set>
#include <stdexcept>
#include <thread>

#include "Cache/CacheTestSupport.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// Generous: only a deadlock ever gets near it.
constexpr auto kBound = std::chrono::seconds(60);

const std::string kAppData = "[501]-appData";

class ContainerCache : public ::testing::Test {
protected:
    void SetUp() override {
        resetCacheTestRoot();
        identities = identityCacheWithoutPersonas();
        mobile = VSLUserIdentityCache::defaultUserIdentity();
        ASSERT_TRUE(mobile);
        cache = makeCache();
    }

    // A new cache over the same tree, as after a daemon restart; its directory scans
    // are counted per key and `willScan` (if any) runs inside each.
    std::shared_ptr<VSLContainerCache> makeCache(std::function<void(const std::string&)> willScan = {}) {
        VSLContainerCache::Hooks hooks;
        hooks.willScanClassDirectory = [this, willScan](const std::string& key, bool transient, const std::string&) {
            {
                std::lock_guard<std::mutex> lock(scanMutex);
                scans[transient ? key + "(transient)" : key]++;
            }
            if (willScan) willScan(key);
        };
        hooks.postUserInvalidatedNotification = [this] {
            notifications++;
            return 0u;
        };
        return VSLContainerCache::initWithUserIdentityCache(identities, nullptr, hooks);
    }

    int scansOf(const std::string& key) {
        std::lock_guard<std::mutex> lock(scanMutex);
        return scans[key];
    }
    int totalScans() {
        std::lock_guard<std::mutex> lock(scanMutex);
        int n = 0;
        for (const auto& [key, count] : scans) n += count;
        return n;
    }

    static VSLContainerIdentityRef identityOf(const VSLUserIdentityRef& user, VSLContainerClass c,
                                              const std::string& identifier) {
        uint64_t code = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, identifier, c, &code);
        EXPECT_TRUE(identity) << code;
        return identity;
    }

    static VSLMetadataRef lookup(VSLContainerCache& on, const VSLUserIdentityRef& user, VSLContainerClass c,
                                 const std::string& identifier, VSLErrorRef* error = nullptr,
                                 bool allowKernelLookup = false, bool transient = false) {
        return on.containerForContainerIdentity(identityOf(user, c, identifier), transient, true, allowKernelLookup,
                                                error);
    }

    static std::map<std::string, std::string> urlsByIdentifier(const std::vector<VSLMetadataRef>& records) {
        std::map<std::string, std::string> out;
        for (const auto& r : records) out[r->identifier()] = r->url();
        return out;
    }

    static std::map<std::string, std::string> sandboxItems(uid_t uid, uint64_t type) {
        std::map<std::string, std::string> out;
        EXPECT_EQ(0, SandboxState::iterateItems(uid, [&](const SandboxContainerItem& item) {
            if (item.type == type) out[item.identifier + "@" + std::to_string(item.personaID)] = item.path;
        }));
        return out;
    }

    std::shared_ptr<VSLUserIdentityCache> identities;
    VSLUserIdentityRef mobile;
    std::shared_ptr<VSLContainerCache> cache;
    std::mutex scanMutex;
    std::map<std::string, int> scans;
    std::atomic<int> notifications{0};
};

TEST_F(ContainerCache, IndexIsBuiltOnceKeptCurrentAndMatchesTheDiskAfterARestart) {
    auto a = makeContainer(mobile, 2, "com.a");
    auto b = makeContainer(mobile, 2, "com.b");
    auto t = makeContainer(mobile, 2, "com.t", true);
    VSLErrorRef error;

    // Added without updating the sandbox before any lookup: nothing recorded, no scan.
    ASSERT_TRUE(cache->addContainerMetadata(a, a->url(), false, false, &error));
    EXPECT_EQ(0, totalScans());

    auto found = lookup(*cache, mobile, 2, "com.a", &error);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(a->url(), found->url());
    EXPECT_EQ(a->uuid(), found->uuid());
    ASSERT_TRUE(lookup(*cache, mobile, 2, "com.b"));
    for (int i = 0; i < 2; i++) {
        EXPECT_FALSE(lookup(*cache, mobile, 2, "com.none", &error));
        EXPECT_EQ(21, error->code);
        EXPECT_EQ("Cache: Data/Application: Container Not Found with ID: com.none", error->localizedDescription);
    }
    EXPECT_EQ(1, scansOf(kAppData));

    // The concrete form matches on the UUID too.
    uint64_t code = kVSLSuccess;
    auto concrete = VSLConcreteContainerIdentity::containerIdentityWithUUID(a->uuid(), mobile, "com.a", 2, &code);
    found = cache->containerForContainerIdentity(concrete);
    ASSERT_TRUE(found);
    EXPECT_FALSE(found->transient());
    auto wrongUUID = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), mobile, "com.a", 2, &code);
    EXPECT_FALSE(cache->containerForContainerIdentity(wrongUUID));

    // A container made after the scan is known once added; one removed is forgotten.
    auto c = makeContainer(mobile, 2, "com.c");
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.c"));
    ASSERT_TRUE(cache->addContainerMetadata(c, c->url(), false, true, &error));
    EXPECT_TRUE(lookup(*cache, mobile, 2, "com.c"));
    removeTree(b->url());
    ASSERT_TRUE(cache->removeContainerForUserIdentity(mobile, 2, "com.b", false, &error));
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.b", &error));
    EXPECT_EQ(21, error->code);
    EXPECT_EQ(1, scansOf(kAppData));

    // Other classes and the transient directories have indexes of their own.
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.t"));
    found = lookup(*cache, mobile, 2, "com.t", &error, false, true);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(t->url(), found->url());
    EXPECT_EQ(1, scansOf(kAppData + "(transient)"));
    auto g = makeContainer(mobile, 7, "group.g");
    EXPECT_TRUE(lookup(*cache, mobile, 7, "group.g"));
    EXPECT_EQ(1, scansOf("[501]-appGroup"));

    auto restarted = makeCache();
    auto all = restarted->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all);
    EXPECT_EQ((std::map<std::string, std::string>{{"com.a", a->url()}, {"com.c", c->url()}}), urlsByIdentifier(*all));
    auto allCached = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(allCached);
    EXPECT_EQ(urlsByIdentifier(*all), urlsByIdentifier(*allCached));
}

TEST_F(ContainerCache, InconsistenciesAreReportedWithoutLosingAValidContainer) {
    auto a = makeContainer(mobile, 2, "com.a");
    auto b = makeContainer(mobile, 2, "com.b");
    std::string classDir = classDirectory(mobile, 2);
    // A directory without metadata, one whose name is no UUID, damaged files, a class 2
    // record in the class 4 directory, and two directories claiming one identifier.
    ASSERT_EQ(0, ::mkdir(joinPath(classDir, Uuid::random().string()).c_str(), 0755));
    auto hidden = makeContainer(mobile, 2, "com.hidden");
    ASSERT_EQ(0, ::rename(hidden->url().c_str(), joinPath(classDir, "NotAUUID").c_str()));
    for (const std::string& bytes : {std::string("bplist00\x01", 9), std::string(), binaryPlist(Value::array({}))}) {
        std::string dir = joinPath(classDir, Uuid::random().string());
        ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755));
        writeBytes(metadataPathOf(dir), bytes);
    }
    auto misplaced = makeContainer(mobile, 2, "com.misplaced");
    std::string inClass4 = joinPath(classDirectory(mobile, 4), Uuid::random().string());
    ASSERT_EQ(0, ::rename(misplaced->url().c_str(), inClass4.c_str()));
    auto dup1 = makeContainer(mobile, 2, "com.dup");
    auto dup2 = makeContainer(mobile, 2, "com.dup");

    VSLErrorRef error;
    auto all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all) << error->description();
    auto urls = urlsByIdentifier(*all);
    std::set<std::string> identifiers;
    for (const auto& [identifier, url] : urls) identifiers.insert(identifier);
    EXPECT_EQ((std::set<std::string>{"com.a", "com.b", "com.dup"}), identifiers);
    EXPECT_EQ(3u, all->size());
    EXPECT_TRUE(urls["com.dup"] == dup1->url() || urls["com.dup"] == dup2->url());
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.hidden"));
    EXPECT_FALSE(lookup(*cache, mobile, 4, "com.misplaced", &error));
    EXPECT_EQ(21, error->code);

    // A container deleted behind the cache's back: reported once, then forgotten.
    removeTree(a->url());
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.a", &error));
    EXPECT_EQ(44, error->code);
    EXPECT_EQ("Cache: Data/Application: INCONSISTENT-No Metadata at: " + metadataPathOf(a->url()) +
                  " for id: com.a, class: 2",
              error->localizedDescription);
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.a", &error));
    EXPECT_EQ(21, error->code);
    EXPECT_TRUE(lookup(*cache, mobile, 2, "com.b"));

    // Listing leaves a vanished one out without failing, and forgets it.
    removeTree(b->url());
    all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all);
    EXPECT_EQ(1u, all->size());
    EXPECT_FALSE(lookup(*cache, mobile, 2, "com.b", &error));
    EXPECT_EQ(21, error->code);
    EXPECT_EQ(1, scansOf(kAppData));
}

TEST_F(ContainerCache, SystemClassReadsWellKnownNamesAndXMLFiles) {
    auto names = VSLWhitelist::sharedWhitelist()->wellknownSystemContainers();
    ASSERT_FALSE(names.empty());
    auto s = makeContainer(mobile, 12, "com.example.system");
    auto wellKnown = makeContainer(mobile, 12, names[0]);
    std::string named = joinPath(classDirectory(mobile, 12), names[0]);
    ASSERT_EQ(0, ::rename(wellKnown->url().c_str(), named.c_str()));
    auto other = makeContainer(mobile, 12, "com.example.other");
    ASSERT_EQ(0, ::rename(other->url().c_str(), joinPath(classDirectory(mobile, 12), "com.example.other").c_str()));
    // An XML file among them is read like any other.
    std::string xmlDir = joinPath(classDirectory(mobile, 12), Uuid::random().string());
    ASSERT_EQ(0, ::mkdir(xmlDir.c_str(), 0755));
    writeBytes(metadataPathOf(xmlDir),
               "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>VSLMetadataIdentifier</key>"
               "<string>com.example.xml</string><key>VSLMetadataUUID</key><string>" +
                   Uuid::random().string() +
                   "</string><key>VSLMetadataContentClass</key><integer>12</integer></dict></plist>");

    VSLErrorRef error;
    auto all = cache->allContainersForUserIdentity(mobile, 12, false, &error);
    ASSERT_TRUE(all) << error->description();
    EXPECT_EQ((std::map<std::string, std::string>{{"com.example.system", s->url()},
                                                  {names[0], named},
                                                  {"com.example.xml", xmlDir}}),
              urlsByIdentifier(*all));
    EXPECT_EQ(1, scansOf("systemData"));
}

TEST_F(ContainerCache, ARebuildBlocksOnlyLookupsOfItsOwnKey) {
    auto other = VSLUserIdentity::create(600, 600, cacheTestRoot().at("private/var/enterprise/600"), std::nullopt,
                                         kVSLPersonaTypePersonal, 600);
    makeContainer(mobile, 2, "com.a");
    makeContainer(mobile, 7, "group.g");
    makeContainer(other, 2, "com.o");
    makeContainer(mobile, 1, "com.bundle");

    std::promise<void> entered;
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    auto blocking = makeCache([&](const std::string& key) {
        if (key == kAppData) {
            entered.set_value();
            released.wait();
        }
    });
    auto stuck = std::async(std::launch::async, [&] { return lookup(*blocking, mobile, 2, "com.a"); });
    ASSERT_EQ(std::future_status::ready, entered.get_future().wait_for(kBound));

    // While that scan is held: another class, another user and a global class answer.
    auto group = std::async(std::launch::async, [&] { return lookup(*blocking, mobile, 7, "group.g"); });
    auto otherUser = std::async(std::launch::async, [&] { return lookup(*blocking, other, 2, "com.o"); });
    auto bundle = std::async(std::launch::async, [&] { return lookup(*blocking, mobile, 1, "com.bundle"); });
    bool allAnswered = group.wait_for(kBound) == std::future_status::ready &&
                       otherUser.wait_for(kBound) == std::future_status::ready &&
                       bundle.wait_for(kBound) == std::future_status::ready;
    release.set_value();
    ASSERT_TRUE(allAnswered);
    EXPECT_TRUE(group.get());
    EXPECT_TRUE(otherUser.get());
    EXPECT_TRUE(bundle.get());
    EXPECT_TRUE(stuck.get());
    EXPECT_EQ(1, scansOf(kAppData));
}

TEST_F(ContainerCache, KernelStateAnswersALookupWithoutAScan) {
    auto a = makeContainer(mobile, 2, "com.a");
    auto g = makeContainer(mobile, 7, "group.g");
    auto s = makeContainer(mobile, 12, "com.system");
    auto bundle = makeContainer(mobile, 1, "com.bundle");
    VSLErrorRef error;
    for (const auto& m : {a, g, s, bundle}) ASSERT_TRUE(cache->addContainerMetadata(m, m->url(), false, true, &error));

    const std::string persona = "@" + std::to_string(mobile->kernelPersonaID());
    EXPECT_EQ((std::map<std::string, std::string>{{"com.a" + persona, a->url()}}), sandboxItems(501, 1));
    EXPECT_EQ((std::map<std::string, std::string>{{"group.g" + persona, g->url()}}), sandboxItems(501, 2));
    EXPECT_EQ(1u, sandboxItems(0, 4).size());

    // After a restart the kernel still knows them: no directory is listed.
    scans.clear();
    auto restarted = makeCache();
    for (const auto& m : {a, g, s}) {
        auto found = lookup(*restarted, mobile, m->containerClass(), m->identifier(), &error, true);
        ASSERT_TRUE(found) << m->identifier();
        EXPECT_EQ(m->url(), found->url());
    }
    EXPECT_EQ(0, totalScans());
    // Bundles are never mirrored, and the kernel is asked only when allowed.
    EXPECT_TRUE(lookup(*restarted, mobile, 1, "com.bundle", &error, true));
    EXPECT_EQ(1, scansOf("app"));
    EXPECT_TRUE(lookup(*restarted, mobile, 2, "com.a", &error, false));
    EXPECT_EQ(1, scansOf(kAppData));

    // A kernel item pointing at some other container is not believed.
    ASSERT_EQ(0, SandboxState::setItem(501, {1, mobile->kernelPersonaID(), "com.liar", a->url()}));
    auto third = makeCache();
    EXPECT_FALSE(lookup(*third, mobile, 2, "com.liar", &error, true));
    EXPECT_EQ(21, error->code);
    EXPECT_EQ(2, scansOf(kAppData));
}

TEST_F(ContainerCache, InvalidClassesAreRefusedAndInvalidationStartsOver) {
    auto a = makeContainer(mobile, 2, "com.a");
    VSLErrorRef error;
    for (VSLContainerClass bad : {0, 14}) {
        EXPECT_FALSE(cache->allContainersForUserIdentity(mobile, bad, false, &error));
        EXPECT_EQ(47, error->code);
        EXPECT_EQ("Invalid Content Class: " + std::to_string(bad), error->localizedDescription);
        EXPECT_FALSE(cache->removeContainerForUserIdentity(mobile, bad, "com.a", false, &error));
        EXPECT_EQ(47, error->code);
    }
    EXPECT_FALSE(cache->addContainerMetadata(nullptr, a->url(), false, true, &error));
    EXPECT_EQ(47, error->code);
    EXPECT_EQ("Invalid Metadata Content Class: 0", error->localizedDescription);
    EXPECT_FALSE(cache->addContainerMetadata(a, "", false, true, &error));
    EXPECT_EQ(47, error->code);

    ASSERT_TRUE(lookup(*cache, mobile, 2, "com.a"));
    EXPECT_EQ(1u, sandboxItems(501, 1).size());
    cache->invalidateUserIdentity(mobile);
    EXPECT_TRUE(sandboxItems(501, 1).empty());
    EXPECT_EQ(1, notifications.load());
    ASSERT_TRUE(lookup(*cache, mobile, 2, "com.a"));
    EXPECT_EQ(2, scansOf(kAppData));
}

TEST_F(ContainerCache, ConcurrentChangesAndInvalidationsLoseNoContainer) {
    constexpr int kWorkers = 3, kSteps = 40;
    std::vector<std::set<std::string>> live(kWorkers);
    std::atomic<bool> done{false};
    std::vector<std::future<void>> workers;
    for (int w = 0; w < kWorkers; w++) {
        workers.push_back(std::async(std::launch::async, [&, w] {
            std::map<std::string, VSLMetadataRef> mine;
            for (int step = 0; step < kSteps; step++) {
                std::string identifier = "com.w" + std::to_string(w) + "." + std::to_string(step % 7);
                VSLContainerClass c = step % 3 == 0 ? 7 : 2;
                std::string key = identifier + "/" + std::to_string(c);
                VSLErrorRef error;
                if (auto it = mine.find(key); it != mine.end()) {
                    EXPECT_TRUE(lookup(*cache, mobile, c, identifier, &error)) << key;
                    removeTree(it->second->url());
                    EXPECT_TRUE(cache->removeContainerForUserIdentity(mobile, c, identifier, false, &error)) << key;
                    mine.erase(it);
                } else {
                    auto m = makeContainer(mobile, c, identifier);
                    EXPECT_TRUE(cache->addContainerMetadata(m, m->url(), false, true, &error)) << key;
                    mine[key] = m;
                }
            }
            for (const auto& [key, m] : mine) live[w].insert(m->url());
        }));
    }
    auto churn = std::async(std::launch::async, [&] {
        while (!done) {
            cache->invalidateUserIdentity(mobile);
            VSLErrorRef error;
            EXPECT_TRUE(cache->allContainersForUserIdentity(mobile, 2, false, &error));
        }
    });
    for (auto& f : workers) ASSERT_EQ(std::future_status::ready, f.wait_for(kBound));
    done = true;
    ASSERT_EQ(std::future_status::ready, churn.wait_for(kBound));

    std::set<std::string> expected;
    for (const auto& s : live) expected.insert(s.begin(), s.end());
    for (const auto& on : {cache, makeCache()}) {
        std::set<std::string> listed;
        for (VSLContainerClass c : {2, 7}) {
            VSLErrorRef error;
            auto all = on->allContainersForUserIdentity(mobile, c, false, &error);
            ASSERT_TRUE(all);
            for (const auto& m : *all) listed.insert(m->url());
        }
        EXPECT_EQ(expected, listed);
    }
}

TEST_F(ContainerCache, AnInvalidationRacingARebuildLeavesNoBuiltIndexUnmirrored) {
    makeContainer(mobile, 2, "com.a");
    std::promise<void> scanning, release;
    std::shared_future<void> released = release.get_future().share();
    std::atomic<int> appDataScans{0};
    auto raced = makeCache([&](const std::string& key) {
        if (key == kAppData && appDataScans++ == 0) {
            scanning.set_value();
            released.wait();
        }
    });
    // A rebuild stalls in its scan; an invalidation of the same identity comes, then
    // another lookup of the key. The pauses only give each a chance to get as far as
    // it can; whatever the order, the outcome below must hold.
    auto first = std::async(std::launch::async, [&] { return lookup(*raced, mobile, 2, "com.a"); });
    scanning.get_future().wait();
    auto invalidation = std::async(std::launch::async, [&] { raced->invalidateUserIdentity(mobile); });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    auto second = std::async(std::launch::async, [&] { return lookup(*raced, mobile, 2, "com.a"); });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    release.set_value();
    ASSERT_EQ(std::future_status::ready, first.wait_for(kBound));
    ASSERT_EQ(std::future_status::ready, invalidation.wait_for(kBound));
    ASSERT_EQ(std::future_status::ready, second.wait_for(kBound));
    EXPECT_TRUE(first.get());
    EXPECT_TRUE(second.get());

    // A built index pushes nothing more, so its container must already be in the
    // sandbox state; an index that was dropped is rebuilt here and pushes it.
    ASSERT_TRUE(lookup(*raced, mobile, 2, "com.a"));
    EXPECT_EQ(1u, sandboxItems(501, 1).size()) << appDataScans.load() << " scans";
}

TEST_F(ContainerCache, AnExceptionBecomesCode40AndLeavesTheCacheUsable) {
    makeContainer(mobile, 2, "com.a");
    bool thrown = false;
    auto throwing = makeCache([&](const std::string&) {
        if (!thrown) {
            thrown = true;
            throw std::runtime_error("scan failed");
        }
    });
    VSLErrorRef error;
    EXPECT_FALSE(lookup(*throwing, mobile, 2, "com.a", &error));
    EXPECT_EQ(40, error->code);
    EXPECT_TRUE(lookup(*throwing, mobile, 2, "com.a", &error));
}

TEST_F(ContainerCache, WithPersonasASharedBundleIsMirroredForThePersonalIdentityOnly) {
    PersonaAttributes personal;
    personal.isPersonal = true;
    personal.uniqueString = "P-1";
    personal.kernelPersonaID = 1000;
    PersonaAttributes universal;
    universal.isUniversal = true;
    universal.uniqueString = "U-1";
    universal.kernelPersonaID = 1002;
    universal.bundleIdentifiers = {"com.shared"};
    PersonaAttributes enterprise;
    enterprise.isEnterprise = true;
    enterprise.uniqueString = "E-1";
    enterprise.kernelPersonaID = 1001;
    enterprise.bundleIdentifiers = {"com.shared"};
    enterprise.layoutPath = cacheTestRoot().at("private/var/enterprise/E-1");
    identities = identityCacheWithPersonas({personal, universal, enterprise});
    cache = makeCache();

    auto me = identities->userIdentityForPersonalPersona();
    auto work = identities->userIdentityForPersonaUniqueString(std::string("E-1"), 501, 501);
    ASSERT_TRUE(me && work && work->isEnterprise());
    auto mine = makeContainer(me, 2, "com.shared");
    auto theirs = makeContainer(work, 2, "com.shared");
    VSLErrorRef error;
    auto found = lookup(*cache, work, 2, "com.shared", &error);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(theirs->url(), found->url());
    found = lookup(*cache, me, 2, "com.shared", &error);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(mine->url(), found->url());
    EXPECT_EQ((std::map<std::string, std::string>{{"com.shared@1000", mine->url()}}), sandboxItems(501, 1));

    // A persona-list change invalidates the enterprise identity through the observer.
    identities->flush();
    EXPECT_TRUE(lookup(*cache, work, 2, "com.shared"));
    EXPECT_EQ(2, scansOf("[E-1]-appData"));
}

}  // namespace
