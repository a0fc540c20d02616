#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "Daemon/Core/VSLDispatch.h"
#include "Platform/Transaction.h"

using namespace vsl;

TEST(AsyncWithTransaction, KeepsTheDaemonAliveWhileTheWorkRuns) {
    auto queue = WorkQueue::serial("com.tarrow.vesseld.test.transaction");
    std::mutex m;
    std::condition_variable cv;
    bool release = false;
    size_t seenInside = 0;
    size_t before = openTransactionCount();

    dispatchAsyncWithTransaction(queue, [&] {
        std::unique_lock<std::mutex> l(m);
        seenInside = openTransactionCount();
        cv.wait(l, [&] { return release; });
    });
    // Open from submission on, before the work even starts.
    EXPECT_GE(openTransactionCount(), before + 1);
    EXPECT_FALSE(waitForNoTransactions(std::chrono::milliseconds(20)) && before == 0);
    {
        std::lock_guard<std::mutex> l(m);
        release = true;
    }
    cv.notify_all();
    queue->sync([] {});
    EXPECT_GE(seenInside, before + 1) << "the transaction is open while the work runs";
    EXPECT_TRUE(waitForNoTransactions(std::chrono::seconds(10)) || before > 0);
    EXPECT_EQ(before, openTransactionCount()) << "and closed right after it";
}
