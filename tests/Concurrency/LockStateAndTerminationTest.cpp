// The lock-state callback against the real lock-state queue, and the termination
// assertion over a lifecycle service that can be made to fail.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "Daemon/Service/VSLApplicationTerminationAssertion.h"
#include "Daemon/Service/VSLLockState.h"
#include "Daemon/Service/VSLStartup.h"
#include "Platform/Keybag.h"
#include "Platform/Lifecycle.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// Whether work queued now runs within a short, bounded wait.
bool queueRuns(std::atomic<int>& counter, int expected) {
    for (int i = 0; i < 100 && counter.load() < expected; i++) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    return counter.load() >= expected;
}

void writeState(const TempRoot& root, const std::string& text) { root.writeFile("run/vesseld/keybag/lockstate", text); }

}  // namespace

TEST(LockState, SuspendsOnceWhileLockedResumesOnceAndIgnoresTransitions) {
    TempRoot root;
    std::atomic<int> ran{0};
    lock_state_notification_callback();  // missing file: unlocked
    EXPECT_EQ(kKeybagUnlocked, storedLockState());

    writeState(root, "1");
    lock_state_notification_callback();
    lock_state_notification_callback();  // a second "locked" must not suspend again
    EXPECT_EQ(kKeybagLocked, storedLockState());
    lockStateQueue()->async([&] { ran++; });
    EXPECT_FALSE(queueRuns(ran, 1));

    writeState(root, "2");  // a transition: still suspended
    lock_state_notification_callback();
    EXPECT_FALSE(queueRuns(ran, 1));
    EXPECT_EQ(kKeybagLocked, storedLockState());

    writeState(root, "0\n");
    lock_state_notification_callback();  // one resume balances the one suspend
    EXPECT_TRUE(queueRuns(ran, 1));
    EXPECT_EQ(kKeybagUnlocked, storedLockState());
    lock_state_notification_callback();  // resuming again would abort the process
    writeState(root, "junk");
    lock_state_notification_callback();
    lockStateQueue()->async([&] { ran++; });
    EXPECT_TRUE(queueRuns(ran, 2));

    // The operator's tool writes the same file.
    ASSERT_EQ(0, setKeybagLockState(true));
    EXPECT_EQ(kKeybagLocked, keybagLockState());
    ASSERT_EQ(0, setKeybagLockState(false));
    EXPECT_EQ(kKeybagUnlocked, keybagLockState());
}

namespace {

class FakeLifecycle : public LifecycleService {
public:
    struct Held : Assertion {};
    bool available = true;
    bool returnsObject = true;
    std::optional<std::string> failure;
    int acquired = 0;
    int invalidated = 0;
    std::string reason;

    bool terminationAssertionsAvailable() override { return available; }
    std::shared_ptr<Assertion> acquireTerminationAssertion(const std::string&, const std::string& r,
                                                           AcquisitionHandler handler) override {
        reason = r;
        if (!returnsObject) return nullptr;
        acquired++;
        // Reported later, from another thread, as the service may do.
        std::thread([handler, f = failure] {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
            handler(f);
        }).detach();
        return std::make_shared<Held>();
    }
    void invalidate(const std::shared_ptr<Assertion>&) override { invalidated++; }
};

struct ServiceSwap {
    explicit ServiceSwap(std::shared_ptr<LifecycleService> s) { LifecycleService::setShared(std::move(s)); }
    ~ServiceSwap() { LifecycleService::setShared(nullptr); }
};

}  // namespace

TEST(TerminationAssertion, FailuresYieldNothingAndInvalidationIsIdempotent) {
    auto fake = std::make_shared<FakeLifecycle>();
    ServiceSwap swap(fake);

    fake->failure = "denied";
    EXPECT_EQ(nullptr, VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 0));
    EXPECT_EQ(1, fake->acquired);
    EXPECT_EQ(1, fake->invalidated);  // nothing stays held

    fake->returnsObject = false;
    EXPECT_EQ(nullptr, VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 1));

    fake->returnsObject = true;
    fake->failure.reset();
    auto held = VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", -1);
    ASSERT_NE(nullptr, held);
    EXPECT_EQ("critical", fake->reason);
    EXPECT_NE(nullptr, held->termAssertion());
    held->invalidate();
    held->invalidate();
    EXPECT_EQ(2, fake->invalidated);
    EXPECT_EQ(nullptr, held->termAssertion());
    held.reset();  // released after invalidation: fine

    fake->available = false;
    auto unprotected = VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 0);
    ASSERT_NE(nullptr, unprotected);
    EXPECT_EQ(nullptr, unprotected->termAssertion());
    unprotected->invalidate();
    EXPECT_EQ(2, fake->invalidated);
}

TEST(TerminationAssertionDeathTest, ReleasingAHeldAssertionStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            LifecycleService::setShared(std::make_shared<FakeLifecycle>());
            auto held = VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 0);
            held.reset();
        },
        "nil == self.termAssertion");
    EXPECT_DEATH(VSLApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 7), "Unknown reason");
}

TEST(TerminationAssertion, MarkersStayInsideTheLaunchBlockDirectoryAndGoOnInvalidate) {
    TempRoot root;
    for (const char* hostile : {"..", ".", "../../etc/passwd", "a/b", ".hidden", "100%"}) {
        auto name = launchBlockMarkerName(hostile);
        ASSERT_TRUE(name) << hostile;
        EXPECT_TRUE(isPlainPathComponent(*name)) << hostile << " -> " << *name;
        EXPECT_NE('.', (*name)[0]) << hostile;
    }
    EXPECT_NE(*launchBlockMarkerName("a/b"), *launchBlockMarkerName("a%2Fb"));
    EXPECT_FALSE(launchBlockMarkerName(""));

    auto service = makeProcessLifecycleService();
    std::optional<std::string> reported = "not called";
    auto assertion = service->acquireTerminationAssertion("../escape", "cache deletion",
                                                          [&](const std::optional<std::string>& e) { reported = e; });
    ASSERT_NE(nullptr, assertion);
    EXPECT_FALSE(reported) << *reported;
    std::string marker = joinPath(launchBlockDirectory(), "%2E.%2Fescape");
    EXPECT_EQ("cache deletion\n", readFile(marker));
    struct stat st;
    EXPECT_NE(0, ::lstat(root.at("run/vesseld/escape").c_str(), &st));
    service->invalidate(assertion);
    service->invalidate(assertion);
    EXPECT_NE(0, ::lstat(marker.c_str(), &st));
}
