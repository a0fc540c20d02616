// VSLTestLocks on its own: gates hold every waiter while closed and release them all
// at once; with the feature off nothing waits.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Concurrency/VSLTestLocks.h"

using namespace vsl;

TEST(TestLocks, AClosedGateHoldsEveryWaiterAndOpensForAllAtOnce) {
    VSLTestLocks locks;
    locks.setEnabled(true);
    locks.acquireLock(VSLTestLocks::kCreateGate);
    locks.acquireLock(VSLTestLocks::kCreateGate);  // counted, one barrier
    EXPECT_EQ(2, locks.count(VSLTestLocks::kCreateGate));

    std::atomic<int> started{0}, passed{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < 4; i++)
        waiters.emplace_back([&] {
            started++;
            locks.waitOnLock(VSLTestLocks::kCreateGate);
            passed++;
        });
    // Another gate stays open meanwhile.
    locks.waitOnLock(VSLTestLocks::kDeathRowGate);
    while (started < 4) std::this_thread::yield();
    locks.releaseLock(VSLTestLocks::kCreateGate);
    EXPECT_EQ(0, passed.load());  // still one acquisition outstanding
    locks.releaseLock(VSLTestLocks::kCreateGate);
    for (auto& t : waiters) t.join();
    EXPECT_EQ(4, passed.load());
    EXPECT_EQ(0, locks.count(VSLTestLocks::kCreateGate));
    // Open again: a later waiter passes at once.
    locks.waitOnLock(VSLTestLocks::kCreateGate);
}

TEST(TestLocks, WithTheFeatureOffWaitingReturnsAtOnceAndTurningItOffReleasesAll) {
    VSLTestLocks locks;
    locks.acquireLock(VSLTestLocks::kDiskUsageGate);
    locks.waitOnLock(VSLTestLocks::kDiskUsageGate);  // off: returns although closed

    locks.setEnabled(true);
    locks.acquireLock(0);  // the global read lock, held by the test locks
    EXPECT_EQ(1, currentVSLLocksState().allReaderWriterState);
    locks.setEnabled(false);
    EXPECT_EQ(0, locks.count(0));
    EXPECT_EQ(0, locks.count(VSLTestLocks::kDiskUsageGate));
    EXPECT_EQ(0, currentVSLLocksState().allReaderWriterState);
    // The global write lock held by a test lock leaves this thread free to take it later.
    locks.acquireLock(1);
    EXPECT_EQ(-1, currentVSLLocksState().allReaderWriterState);
    locks.releaseLock(1);
    lock_all_identifiers_for_writing();
    unlock_all_identifiers();
}

TEST(TestLocksDeathTest, AnUnbalancedReleaseStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            VSLTestLocks locks;
            locks.releaseLock(4);
        },
        "updated >= 0");
}
