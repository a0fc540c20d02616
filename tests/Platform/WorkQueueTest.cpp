#include "Platform/WorkQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

using namespace std::chrono_literals;
using vsl::WorkGroup;
using vsl::WorkQueue;

namespace {

// Deadlines below only keep a broken build from hanging; nothing asserts on speed.
constexpr auto kPatience = 60s;

class Gate {
public:
    void open() {
        std::lock_guard lock(mutex_);
        open_ = true;
        cv_.notify_all();
    }
    bool wait(std::chrono::milliseconds timeout = kPatience) {
        std::unique_lock lock(mutex_);
        return cv_.wait_for(lock, timeout, [&] { return open_; });
    }

private:
    std::mutex mutex_;
    std::condition_variable cv_;
    bool open_ = false;
};

template <class Pred>
bool eventually(Pred pred) {
    for (auto end = std::chrono::steady_clock::now() + kPatience; !pred();) {
        if (std::chrono::steady_clock::now() > end) return false;
        std::this_thread::sleep_for(2ms);
    }
    return true;
}

// Runs through the queue's backlog: sync returns after every earlier item.
void flush(const std::shared_ptr<WorkQueue>& q) { q->sync([] {}); }

}  // namespace

TEST(WorkQueueTest, SuspendedSerialQueueHoldsItemsThenRunsThemInOrder) {
    auto q = WorkQueue::create("test.suspended", {.initiallySuspended = true});
    std::vector<int> ran;  // touched only by the queue's items
    std::atomic<int> count{0};
    for (int i = 0; i < 200; ++i) {
        q->async([&, i] {
            ran.push_back(i);
            ++count;
        });
    }
    q->suspend();
    q->resume();  // still suspended once
    std::this_thread::sleep_for(50ms);
    EXPECT_EQ(count.load(), 0);

    q->resume();
    ASSERT_TRUE(eventually([&] { return count == 200; }));
    flush(q);
    std::vector<int> expected(200);
    for (int i = 0; i < 200; ++i) expected[i] = i;
    EXPECT_EQ(ran, expected);

    // Suspending while an item runs lets that item finish but starts nothing else.
    Gate entered, release;
    std::atomic<bool> firstDone{false}, secondRan{false};
    q->async([&] {
        entered.open();
        release.wait();
        firstDone = true;
    });
    q->async([&] { secondRan = true; });
    ASSERT_TRUE(entered.wait());
    q->suspend();
    release.open();
    ASSERT_TRUE(eventually([&] { return firstDone.load(); }));
    std::this_thread::sleep_for(50ms);
    EXPECT_FALSE(secondRan);
    q->resume();
    EXPECT_TRUE(eventually([&] { return secondRan.load(); }));

    // A suspended concurrent queue holds its items too.
    auto c = WorkQueue::create("test.suspended.concurrent",
                               {.kind = WorkQueue::Kind::Concurrent, .initiallySuspended = true});
    std::atomic<int> concurrentRan{0};
    for (int i = 0; i < 20; ++i) c->async([&] { ++concurrentRan; });
    std::this_thread::sleep_for(20ms);
    EXPECT_EQ(concurrentRan.load(), 0);
    c->resume();
    EXPECT_TRUE(eventually([&] { return concurrentRan == 20; }));
}

TEST(WorkQueueTest, SerialQueueRunsOneItemAtATimeInSubmissionOrder) {
    auto q = WorkQueue::serial("test.exclusion");
    constexpr int kProducers = 8, kItems = 2000;
    std::atomic<bool> inside{false};
    std::atomic<int> overlaps{0};
    long counter = 0;  // deliberately unsynchronised: the queue is the lock
    std::vector<int> lastSeen(kProducers, -1);
    int outOfOrder = 0;
    auto group = WorkGroup::create();
    std::vector<std::thread> producers;
    for (int p = 0; p < kProducers; ++p) {
        producers.emplace_back([&, p] {
            for (int i = 0; i < kItems; ++i) {
                group->async(q, [&, p, i] {
                    if (inside.exchange(true)) ++overlaps;
                    ++counter;
                    if (lastSeen[p] != i - 1) ++outOfOrder;
                    lastSeen[p] = i;
                    if (WorkQueue::currentLabel() != "test.exclusion") ++overlaps;
                    inside = false;
                });
            }
        });
    }
    for (auto& t : producers) t.join();
    ASSERT_TRUE(group->wait(kPatience));
    flush(q);
    EXPECT_EQ(overlaps.load(), 0);
    EXPECT_EQ(outOfOrder, 0);
    EXPECT_EQ(counter, long{kProducers} * kItems);

    // A concurrent queue does run its items at the same time: each waits for all.
    auto c = WorkQueue::concurrent("test.concurrent");
    constexpr int kWide = 6;
    std::mutex m;
    std::condition_variable cv;
    int arrived = 0, metAll = 0;
    auto wide = WorkGroup::create();
    for (int i = 0; i < kWide; ++i) {
        wide->async(c, [&] {
            std::unique_lock lock(m);
            ++arrived;
            cv.notify_all();
            if (cv.wait_for(lock, kPatience, [&] { return arrived == kWide; })) ++metAll;
        });
    }
    ASSERT_TRUE(wide->wait(kPatience + 10s));
    EXPECT_EQ(metAll, kWide);
}

TEST(WorkQueueTest, SyncRunsOnTheQueueAfterEarlierItems) {
    EXPECT_EQ(WorkQueue::currentLabel(), "");
    auto q = WorkQueue::serial("test.sync");
    auto other = WorkQueue::serial("test.sync.other");

    std::vector<std::string> order;
    Gate release;
    q->async([&] {
        release.wait();
        order.push_back("async");
    });
    std::thread opener([&] {
        std::this_thread::sleep_for(20ms);
        release.open();
    });
    std::string label;
    q->sync([&] {
        order.push_back("sync");
        label = WorkQueue::currentLabel();
    });
    opener.join();
    EXPECT_EQ(order, (std::vector<std::string>{"async", "sync"}));
    EXPECT_EQ(label, "test.sync");
    EXPECT_EQ(WorkQueue::currentLabel(), "");

    // Nested sync onto another queue, and the labels seen along the way.
    std::vector<std::string> labels;
    q->sync([&] {
        other->sync([&] {
            labels.push_back(WorkQueue::currentLabel());
            labels.push_back(q->isCurrent() ? "in q" : "not in q");
        });
        labels.push_back(WorkQueue::currentLabel());
    });
    EXPECT_EQ(labels, (std::vector<std::string>{"test.sync.other", "in q", "test.sync"}));

    // Sync onto a suspended queue waits for the resume.
    q->suspend();
    std::atomic<bool> ran{false};
    std::thread waiter([&] { q->sync([&] { ran = true; }); });
    std::this_thread::sleep_for(30ms);
    EXPECT_FALSE(ran);
    q->resume();
    waiter.join();
    EXPECT_TRUE(ran);

    // Sync onto a concurrent queue from its own item is fine.
    auto c = WorkQueue::concurrent("test.sync.concurrent");
    bool inner = false;
    c->sync([&] { c->sync([&] { inner = true; }); });
    EXPECT_TRUE(inner);
}

TEST(WorkQueueDeathTest, MisuseAbortsNamingTheQueue) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto q = WorkQueue::serial("test.self.sync");
            q->sync([&] { q->sync([] {}); });
        },
        "test.self.sync.*deadlock");
    // Through another queue whose item runs on a different thread.
    EXPECT_DEATH(
        {
            auto a = WorkQueue::serial("test.cycle.a");
            auto b = WorkQueue::serial("test.cycle.b");
            Gate hold;
            b->async([&] { hold.wait(); });  // forces b's sync item onto a pool thread
            std::thread([&] {
                std::this_thread::sleep_for(20ms);
                hold.open();
            }).detach();
            a->sync([&] { b->sync([&] { a->sync([] {}); }); });
        },
        "test.cycle.a.*deadlock");
    EXPECT_DEATH(WorkQueue::serial("test.over.resume")->resume(),
                 "test.over.resume.*not suspended");
    EXPECT_DEATH(WorkGroup::create()->leave(), "leave without a matching enter");
}

TEST(WorkQueueTest, GroupWaitAndNotify) {
    auto q = WorkQueue::concurrent("test.group");
    auto notifyQueue = WorkQueue::serial("test.group.notify");
    auto group = WorkGroup::create();
    EXPECT_TRUE(group->wait(0ms));

    Gate release;
    std::atomic<int> done{0};
    for (int i = 0; i < 10; ++i) {
        group->async(q, [&] {
            release.wait();
            ++done;
        });
    }
    group->enter();  // work tracked by hand
    std::string notifiedOn;
    int doneWhenNotified = -1;
    Gate notified;
    group->notify(notifyQueue, [&] {
        notifiedOn = WorkQueue::currentLabel();
        doneWhenNotified = done;
        notified.open();
    });
    EXPECT_FALSE(group->wait(30ms));
    release.open();
    EXPECT_FALSE(notified.wait(30ms));  // the hand-entered work is still open
    group->leave();
    ASSERT_TRUE(group->wait());
    ASSERT_TRUE(notified.wait());
    EXPECT_EQ(notifiedOn, "test.group.notify");
    EXPECT_EQ(doneWhenNotified, 10);

    // Notifying an empty group submits at once; a notification fires only once.
    Gate again;
    group->notify(notifyQueue, [&] { again.open(); });
    EXPECT_TRUE(again.wait());
    group->async(q, [] {});
    EXPECT_TRUE(group->wait());
    flush(notifyQueue);
}

TEST(WorkQueueTest, BlockedHandlersGetTheQueueThatUnblocksThem) {
    // Each A waits for its B; every A is submitted first, so the pool must keep
    // starting workers while the ones it has are blocked.
    constexpr int kPairs = 64;
    std::vector<std::shared_ptr<WorkQueue>> blocked, unblockers;
    std::vector<std::unique_ptr<Gate>> gates;
    auto group = WorkGroup::create();
    std::atomic<int> satisfied{0};
    for (int i = 0; i < kPairs; ++i) {
        blocked.push_back(WorkQueue::serial("test.pair.a." + std::to_string(i)));
        unblockers.push_back(WorkQueue::serial("test.pair.b." + std::to_string(i),
                                               vsl::QueuePriority::Background));
        gates.push_back(std::make_unique<Gate>());
    }
    for (int i = 0; i < kPairs; ++i) {
        group->async(blocked[i], [&, i] {
            if (gates[i]->wait()) ++satisfied;
        });
    }
    for (int i = 0; i < kPairs; ++i) group->async(unblockers[i], [&, i] { gates[i]->open(); });
    ASSERT_TRUE(group->wait(kPatience + 10s));
    EXPECT_EQ(satisfied.load(), kPairs);
    // Every A was running, blocked, when the first B started.
    EXPECT_GT(WorkQueue::poolWorkerCount(), size_t{kPairs});
}

TEST(WorkQueueTest, IdleWorkersExitAndIdleQueuesCostNoThreads) {
    WorkQueue::setPoolIdleTimeout(100ms);
    std::vector<std::shared_ptr<WorkQueue>> queues;
    auto group = WorkGroup::create();
    Gate release;
    for (int i = 0; i < 1000; ++i) {
        queues.push_back(WorkQueue::serial("test.idle." + std::to_string(i)));
        // A few blocked items force the pool past its eager size.
        if (i % 100 == 0) group->async(queues.back(), [&] { release.wait(); });
        group->async(queues.back(), [] {});
    }
    EXPECT_TRUE(eventually([] { return WorkQueue::poolWorkerCount() >= 10; }));
    release.open();
    ASSERT_TRUE(group->wait());
    EXPECT_TRUE(eventually([] { return WorkQueue::poolWorkerCount() == 0; }))
        << WorkQueue::poolWorkerCount() << " workers left";

    // The pool comes back when there is work again.
    std::atomic<bool> ran{false};
    queues[500]->async([&] { ran = true; });
    EXPECT_TRUE(eventually([&] { return ran.load(); }));
    WorkQueue::setPoolIdleTimeout(5000ms);
}

// Workers that are busy but keep finishing items are short of CPU, not blocked: the pool
// must not start a thread every few milliseconds for them (each one costs a stack and a
// start and an exit later), while a blocked pool still grows (test above).
TEST(WorkQueueTest, BusyWorkersThatKeepFinishingDoNotGrowThePool) {
    WorkQueue::setPoolIdleTimeout(50ms);
    ASSERT_TRUE(eventually([] { return WorkQueue::poolWorkerCount() == 0; }));
    WorkQueue::setPoolIdleTimeout(5000ms);
    auto queue = WorkQueue::concurrent("test.starved");
    auto group = WorkGroup::create();
    std::atomic<size_t> peak{0};
    const auto start = std::chrono::steady_clock::now();
    for (int i = 0; i < 2000; ++i) {
        group->async(queue, [&] {
            const auto until = std::chrono::steady_clock::now() + 300us;
            while (std::chrono::steady_clock::now() < until) {
            }
            size_t seen = peak.load();
            const size_t now = WorkQueue::poolWorkerCount();
            while (now > seen && !peak.compare_exchange_weak(seen, now)) {
            }
        });
    }
    ASSERT_TRUE(group->wait(kPatience));
    const auto elapsed = std::chrono::steady_clock::now() - start;
    // A thread for every few milliseconds of backlog would reach well past this.
    const size_t bound = 6 + static_cast<size_t>(elapsed / 25ms);
    EXPECT_LE(peak.load(), bound)
        << "over " << std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count() << " ms";
}

TEST(WorkQueueTest, QueueLivesUntilItsItemsHaveRun) {
    std::weak_ptr<WorkQueue> weak;
    Gate release;
    std::atomic<int> ran{0};
    {
        auto q = WorkQueue::serial("test.lifetime");
        weak = q;
        q->async([&] { release.wait(); });
        for (int i = 0; i < 5; ++i) q->async([&] { ++ran; });
    }
    EXPECT_FALSE(weak.expired());
    release.open();
    EXPECT_TRUE(eventually([&] { return ran == 5; }));
    EXPECT_TRUE(eventually([&] { return weak.expired(); }));
}

TEST(WorkQueueTest, MainLoopDrainsTheMainQueueUntilStopped) {
    auto& main = WorkQueue::main();
    vsl::stopMainLoop();
    vsl::runMainLoop();  // a stop requested before the loop ends it at once

    const auto self = std::this_thread::get_id();
    std::vector<int> ran;
    int offThread = 0;
    std::string label;
    std::thread producer([&] {
        for (int i = 0; i < 100; ++i) {
            main->async([&, i] {
                ran.push_back(i);
                if (std::this_thread::get_id() != self) ++offThread;
                label = WorkQueue::currentLabel();
                if (i == 49) vsl::stopMainLoop();
            });
        }
    });
    vsl::runMainLoop();
    producer.join();
    EXPECT_EQ(ran.size(), 50u);
    EXPECT_EQ(label, "main");

    // The rest waits for the next run; a sync from another thread runs on this one.
    std::thread stopper([&] {
        main->sync([&] {
            if (std::this_thread::get_id() != self) ++offThread;
        });
        main->async([] { vsl::stopMainLoop(); });
    });
    vsl::runMainLoop();
    stopper.join();
    EXPECT_EQ(offThread, 0);
    ASSERT_EQ(ran.size(), 100u);
    for (int i = 0; i < 100; ++i) EXPECT_EQ(ran[i], i);
}
