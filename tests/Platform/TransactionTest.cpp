#include "Platform/Transaction.h"
#include "Platform/WorkQueue.h"

#include <gtest/gtest.h>

#include <memory>
#include <thread>

using namespace std::chrono_literals;
using vsl::openTransactionCount;
using vsl::openTransactionNames;
using vsl::Transaction;
using vsl::waitForNoTransactions;

TEST(TransactionTest, CountsOpenTransactionsByName) {
    ASSERT_EQ(openTransactionCount(), 0u);
    EXPECT_TRUE(waitForNoTransactions(0ms));
    {
        Transaction a("test.a");
        Transaction b("test.b");
        Transaction a2("test.a");
        EXPECT_EQ(openTransactionCount(), 3u);
        EXPECT_EQ(openTransactionNames(), (std::vector<std::string>{"test.a", "test.a", "test.b"}));
        EXPECT_FALSE(waitForNoTransactions(10ms));

        b.close();
        b.close();  // closing twice counts once
        EXPECT_EQ(openTransactionNames(), (std::vector<std::string>{"test.a", "test.a"}));

        Transaction moved(std::move(a));  // a move hands over, it does not open another
        EXPECT_FALSE(a.isOpen());
        EXPECT_EQ(moved.name(), "test.a");
        EXPECT_EQ(openTransactionCount(), 2u);

        Transaction c("test.c");
        c = std::move(a2);  // c's own transaction closes
        EXPECT_EQ(openTransactionNames(), (std::vector<std::string>{"test.a", "test.a"}));
    }
    EXPECT_EQ(openTransactionCount(), 0u);
    EXPECT_TRUE(openTransactionNames().empty());
}

TEST(TransactionTest, StaysOpenUntilAsyncWorkHasRun) {
    auto q = vsl::WorkQueue::create("test.transaction", {.initiallySuspended = true});
    size_t seenInside = 0;
    {
        auto t = std::make_shared<Transaction>("test.async");
        q->async([t, &seenInside] { seenInside = openTransactionCount(); });
    }
    EXPECT_EQ(openTransactionCount(), 1u);
    EXPECT_FALSE(waitForNoTransactions(20ms));

    // Shutdown waits on another thread while the work finishes.
    bool drained = false;
    std::thread shutdown([&] { drained = waitForNoTransactions(60s); });
    q->resume();
    shutdown.join();
    EXPECT_TRUE(drained);
    EXPECT_EQ(seenInside, 1u);
    EXPECT_EQ(openTransactionCount(), 0u);
}
