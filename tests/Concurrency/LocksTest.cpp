#include "Daemon/Concurrency/VSLLocks.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Platform/Log.h"
#include "Platform/Value.h"
#include "Support/TempRoot.h"

namespace vsl {
namespace {

using namespace std::chrono_literals;

// Polls for up to 10 s; only a hang guard, never a measure of speed.
bool eventually(const std::function<bool()>& condition) {
    auto deadline = std::chrono::steady_clock::now() + 10s;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        std::this_thread::sleep_for(1ms);
    }
    return true;
}

// Gives a thread that must stay blocked the chance to wrongly get through.
void settle() {
    std::this_thread::sleep_for(50ms);
}

// One lock call on its own thread. A thread still blocked when the test ends is left
// behind rather than joined, so a broken lock fails the test instead of hanging it.
class Attempt {
public:
    explicit Attempt(std::function<void()> take) : done_(std::make_shared<std::atomic<bool>>(false)) {
        thread_ = std::thread([done = done_, take = std::move(take)] {
            take();
            done->store(true);
        });
    }
    ~Attempt() {
        if (done_->load()) {
            thread_.join();
        } else {
            thread_.detach();
        }
    }
    Attempt(const Attempt&) = delete;
    Attempt& operator=(const Attempt&) = delete;

    bool done() const { return done_->load(); }
    bool finishes() const {
        return eventually([this] { return done(); });
    }

private:
    std::shared_ptr<std::atomic<bool>> done_;
    std::thread thread_;
};

bool allReleased() {
    VSLLocksState s = currentVSLLocksState();
    return s.liveRecords == 0 && s.identifierReaderCount == 0 && s.identifierWriterCount == 0 &&
           s.allReaderWriterState == 0;
}

// Runs `body(worker, progress)` on `count` threads. Threads that stop advancing
// `progress` for 10 s are deadlocked: the lock state is wedged for good, so the
// binary stops rather than run later tests against it.
void runWorkers(int count, const std::function<void(int, std::atomic<uint64_t>&)>& body) {
    std::atomic<uint64_t> progress{0};
    std::atomic<int> finished{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < count; i++) {
        threads.emplace_back([&, i] {
            body(i, progress);
            finished++;
        });
    }
    uint64_t seen = progress.load();
    auto lastChange = std::chrono::steady_clock::now();
    while (finished.load() < count) {
        std::this_thread::sleep_for(5ms);
        if (progress.load() != seen) {
            seen = progress.load();
            lastChange = std::chrono::steady_clock::now();
        } else if (std::chrono::steady_clock::now() - lastChange > 10s) {
            std::fprintf(stderr, "lock workers stopped making progress: deadlock\n");
            std::_Exit(1);
        }
    }
    for (auto& t : threads) t.join();
}

TEST(VSLLocks, WritersOfTheSameIdentifiersInAnyOrderNeverDeadlock) {
    std::atomic<int> holdersA{0}, holdersB{0};
    std::atomic<int> overlaps{0};
    const std::vector<std::vector<std::string>> orders = {{"A", "B"}, {"B", "A"}, {"B", "A", "A", "B"}};
    runWorkers(3, [&](int worker, std::atomic<uint64_t>& progress) {
        for (int i = 0; i < 5000; i++) {
            lock_identifier_for_writing(orders[worker]);
            if (holdersA.fetch_add(1) != 0 || holdersB.fetch_add(1) != 0) overlaps++;
            std::this_thread::yield();
            holdersA--;
            holdersB--;
            unlock_identifier(orders[worker]);
            progress++;
        }
    });
    EXPECT_EQ(overlaps.load(), 0);
    EXPECT_TRUE(allReleased());
}

TEST(VSLLocks, RecordsLiveOnlyWhileHeldOrAwaited) {
    ASSERT_TRUE(allReleased());

    lock_identifier_for_reading(std::string("A"));
    lock_identifier_for_reading(std::string("A"));
    EXPECT_EQ(currentVSLLocksState().liveRecords, 1u);
    EXPECT_EQ(currentVSLLocksState().identifierReaderCount, 2u);

    // A waiting writer keeps the record alive too; it is counted before it blocks.
    Attempt writer([] { lock_identifier_for_writing(std::string("A")); });
    ASSERT_TRUE(eventually([] { return currentVSLLocksState().identifierWriterCount == 1; }));
    unlock_identifier(std::string("A"));
    settle();
    EXPECT_FALSE(writer.done());
    EXPECT_EQ(currentVSLLocksState().liveRecords, 1u);
    unlock_identifier(std::string("A"));
    ASSERT_TRUE(writer.finishes());
    EXPECT_EQ(currentVSLLocksState().liveRecords, 1u);
    // The same call releases the write lock, here from another thread than its taker.
    unlock_identifier(std::string("A"));
    EXPECT_TRUE(allReleased());

    // Duplicates are taken once: writing "B" twice would otherwise never return.
    Attempt duplicates([] { lock_identifier_for_writing({"B", "A", "B"}); });
    ASSERT_TRUE(duplicates.finishes());
    EXPECT_EQ(currentVSLLocksState().liveRecords, 2u);
    EXPECT_EQ(currentVSLLocksState().identifierWriterCount, 2u);
    unlock_identifier({"A", "B", "A"});
    EXPECT_TRUE(allReleased());

    lock_identifier_for_reading(Value::array({Value::string("C"), Value::string("D")}));
    EXPECT_EQ(currentVSLLocksState().liveRecords, 2u);
    unlock_identifier(Value::string("C"));
    EXPECT_EQ(currentVSLLocksState().liveRecords, 1u);
    unlock_identifier(Value::array({Value::string("D")}));
    EXPECT_TRUE(allReleased());
}

TEST(VSLLocks, GlobalWriterWaitsForEveryIdentifierTakerAndAdmitsNoneWhileHeld) {
    ASSERT_TRUE(allReleased());

    lock_identifier_for_reading(std::string("A"));
    Attempt globalWriter([] { lock_all_identifiers_for_writing(); });
    settle();
    EXPECT_FALSE(globalWriter.done());

    // A waiting global writer does not hold back identifier takers.
    Attempt readerB([] { lock_identifier_for_reading(std::string("B")); });
    Attempt writerC([] { lock_identifier_for_writing(std::string("C")); });
    EXPECT_TRUE(readerB.finishes());
    EXPECT_TRUE(writerC.finishes());
    unlock_identifier(std::string("A"));
    unlock_identifier(std::string("C"));
    settle();
    EXPECT_FALSE(globalWriter.done());
    unlock_identifier(std::string("B"));
    ASSERT_TRUE(globalWriter.finishes());
    EXPECT_EQ(currentVSLLocksState().allReaderWriterState, -1);

    // While it is held nobody registers, so nothing shows in the counts.
    Attempt readerD([] { lock_identifier_for_reading(std::string("D")); });
    Attempt writerE([] { lock_identifier_for_writing(std::string("E")); });
    Attempt writerFG([] { lock_identifier_for_writing(std::vector<std::string>{"G", "F"}); });
    settle();
    EXPECT_FALSE(readerD.done());
    EXPECT_FALSE(writerE.done());
    EXPECT_FALSE(writerFG.done());
    VSLLocksState held = currentVSLLocksState();
    EXPECT_EQ(held.identifierReaderCount, 0u);
    EXPECT_EQ(held.identifierWriterCount, 0u);
    EXPECT_EQ(held.liveRecords, 0u);
    unlock_all_identifiers();
    EXPECT_TRUE(readerD.finishes());
    EXPECT_TRUE(writerE.finishes());
    EXPECT_TRUE(writerFG.finishes());
    unlock_identifier(std::string("D"));
    unlock_identifier(std::string("E"));
    unlock_identifier(std::vector<std::string>{"F", "G"});
    EXPECT_TRUE(allReleased());

    // A taker still queued on an identifier's lock already counts.
    lock_identifier_for_writing(std::string("A"));
    Attempt queuedReader([] { lock_identifier_for_reading(std::string("A")); });
    ASSERT_TRUE(eventually([] { return currentVSLLocksState().identifierReaderCount == 1; }));
    Attempt secondGlobalWriter([] { lock_all_identifiers_for_writing(); });
    unlock_identifier(std::string("A"));
    EXPECT_TRUE(queuedReader.finishes());
    settle();
    EXPECT_FALSE(secondGlobalWriter.done());
    unlock_identifier(std::string("A"));
    ASSERT_TRUE(secondGlobalWriter.finishes());

    // Global takers wait for the global writer as well.
    Attempt globalReader([] { lock_all_identifiers_for_reading(); });
    Attempt thirdGlobalWriter([] { lock_all_identifiers_for_writing(); });
    settle();
    EXPECT_FALSE(globalReader.done());
    EXPECT_FALSE(thirdGlobalWriter.done());
    unlock_all_identifiers();
    // Whichever of the two gets in first, the other follows its unlock.
    ASSERT_TRUE(eventually([&] { return globalReader.done() || thirdGlobalWriter.done(); }));
    settle();
    EXPECT_FALSE(globalReader.done() && thirdGlobalWriter.done());
    unlock_all_identifiers();
    ASSERT_TRUE(globalReader.finishes());
    ASSERT_TRUE(thirdGlobalWriter.finishes());
    unlock_all_identifiers();
    EXPECT_TRUE(allReleased());
}

TEST(VSLLocks, GlobalReadersExcludeIdentifierWritersOnly) {
    ASSERT_TRUE(allReleased());

    lock_all_identifiers_for_reading();
    Attempt secondGlobalReader([] { lock_all_identifiers_for_reading(); });
    Attempt readerA([] { lock_identifier_for_reading(std::string("A")); });
    EXPECT_TRUE(secondGlobalReader.finishes());
    EXPECT_TRUE(readerA.finishes());
    Attempt writerB([] { lock_identifier_for_writing(std::string("B")); });
    settle();
    EXPECT_FALSE(writerB.done());
    EXPECT_EQ(currentVSLLocksState().identifierWriterCount, 0u);
    unlock_all_identifiers();
    settle();
    EXPECT_FALSE(writerB.done());
    unlock_all_identifiers();
    ASSERT_TRUE(writerB.finishes());
    unlock_identifier(std::string("A"));
    unlock_identifier(std::string("B"));
    EXPECT_TRUE(allReleased());

    // An identifier writer that is only waiting already holds back new global readers.
    lock_identifier_for_reading(std::string("A"));
    Attempt writerA([] { lock_identifier_for_writing(std::string("A")); });
    ASSERT_TRUE(eventually([] { return currentVSLLocksState().identifierWriterCount == 1; }));
    Attempt globalReader([] { lock_all_identifiers_for_reading(); });
    settle();
    EXPECT_FALSE(writerA.done());
    EXPECT_FALSE(globalReader.done());
    unlock_identifier(std::string("A"));
    ASSERT_TRUE(writerA.finishes());
    settle();
    EXPECT_FALSE(globalReader.done());
    unlock_identifier(std::string("A"));
    ASSERT_TRUE(globalReader.finishes());
    unlock_all_identifiers();
    EXPECT_TRUE(allReleased());
}

TEST(VSLLocks, MixedTakersKeepMutualExclusion) {
    ASSERT_TRUE(allReleased());
    constexpr int kIdentifiers = 6;
    std::vector<std::string> names;
    for (int i = 0; i < kIdentifiers; i++) names.push_back("ID-" + std::to_string(i));

    std::atomic<int> globalReaders{0}, globalWriters{0};
    std::array<std::atomic<int>, kIdentifiers> readers{}, writers{};
    // Plain data written only under the locks: the sanitizer build sees any overlap.
    std::array<uint64_t, kIdentifiers> payload{};
    std::atomic<uint64_t> writes{0};
    std::atomic<int> violations{0};

    auto anyIdentifierHolder = [&] {
        for (int i = 0; i < kIdentifiers; i++) {
            if (readers[i].load() || writers[i].load()) return true;
        }
        return false;
    };
    auto anyIdentifierWriter = [&] {
        for (int i = 0; i < kIdentifiers; i++) {
            if (writers[i].load()) return true;
        }
        return false;
    };

    runWorkers(6, [&](int worker, std::atomic<uint64_t>& progress) {
        std::mt19937 random(static_cast<unsigned>(worker) * 7919u + 1u);
        for (int iteration = 0; iteration < 8000; iteration++) {
            int kind = static_cast<int>(random() % 10);
            if (kind == 0) {
                lock_all_identifiers_for_writing();
                if (globalWriters.fetch_add(1) != 0 || globalReaders.load() || anyIdentifierHolder()) violations++;
                for (auto& p : payload) p++;
                writes += kIdentifiers;
                std::this_thread::yield();
                globalWriters--;
                unlock_all_identifiers();
            } else if (kind == 1) {
                lock_all_identifiers_for_reading();
                globalReaders++;
                if (globalWriters.load() || anyIdentifierWriter()) violations++;
                uint64_t sum = 0;
                for (auto p : payload) sum += p;
                if (sum > writes.load()) violations++;
                globalReaders--;
                unlock_all_identifiers();
            } else {
                bool forWriting = kind >= 6;
                std::vector<int> picked = {static_cast<int>(random() % kIdentifiers)};
                if (kind % 2 == 0) picked.push_back(static_cast<int>(random() % kIdentifiers));
                if (kind == 9) picked.push_back(static_cast<int>(random() % kIdentifiers));
                std::vector<std::string> ids;
                for (int i : picked) ids.push_back(names[i]);
                std::sort(picked.begin(), picked.end());
                picked.erase(std::unique(picked.begin(), picked.end()), picked.end());

                if (forWriting) {
                    lock_identifier_for_writing(ids);
                } else {
                    lock_identifier_for_reading(ids);
                }
                for (int i : picked) {
                    if (forWriting) {
                        if (writers[i].fetch_add(1) != 0 || readers[i].load()) violations++;
                        payload[i]++;
                        writes++;
                    } else {
                        readers[i]++;
                        if (writers[i].load()) violations++;
                        if (payload[i] > writes.load()) violations++;
                    }
                }
                if (globalWriters.load() || (forWriting && globalReaders.load())) violations++;
                std::this_thread::yield();
                for (int i : picked) (forWriting ? writers[i] : readers[i])--;
                unlock_identifier(ids);
            }
            progress++;
        }
    });

    EXPECT_EQ(violations.load(), 0);
    uint64_t total = 0;
    for (auto p : payload) total += p;
    EXPECT_EQ(total, writes.load());
    EXPECT_TRUE(allReleased());
}

size_t occurrences(const std::string& text, const std::string& piece, size_t* last = nullptr) {
    size_t count = 0;
    for (size_t at = text.find(piece); at != std::string::npos; at = text.find(piece, at + 1)) {
        count++;
        if (last) *last = at;
    }
    return count;
}

TEST(VSLLocks, DebugLogTellsTakesReleasesAndTheRecordsEnd) {
    ASSERT_TRUE(allReleased());
    std::string directory = test::makeTempDir("vessel-locks-log-");
    LogFileOptions options;
    options.directory = directory;
    ASSERT_TRUE(openLogFile(options));
    setDebugLogging(true);
    std::vector<OSLogRecord> records;  // every call below runs on this thread
    setOSLogSink([&records](const OSLogRecord& record) { records.push_back(record); });

    lock_identifier_for_reading(std::string("LOGGED"));
    lock_identifier_for_reading(std::string("LOGGED"));
    unlock_identifier(std::string("LOGGED"));
    unlock_identifier(std::string("LOGGED"));
    lock_all_identifiers_for_writing();
    unlock_all_identifiers();

    setOSLogSink(nullptr);
    setDebugLogging(false);
    closeLogFile();
    std::string log = test::readFile(directory + "/vesseld.log");
    test::removeTree(directory);

    EXPECT_EQ(occurrences(log, "Waiting to lock LOGGED for reading"), 2u);
    EXPECT_EQ(occurrences(log, "Got lock on identifier LOGGED"), 2u);
    size_t lastUnlock = 0, destroyed = 0;
    EXPECT_EQ(occurrences(log, "Unlocked identifier LOGGED", &lastUnlock), 2u);
    // The record outlives the first reader's unlock and goes with the second.
    EXPECT_EQ(occurrences(log, "Destroying lock for identifier LOGGED", &destroyed), 1u);
    EXPECT_GT(destroyed, lastUnlock);
    EXPECT_EQ(occurrences(log, "Waiting to lock all identifiers for writing"), 1u);
    EXPECT_EQ(occurrences(log, "Locked all identifiers for writing"), 1u);
    EXPECT_EQ(occurrences(log, "Unlocked all identifiers"), 1u);

    // Hold intervals pair up by id, whichever reader's unlock ends them.
    std::map<std::string, int> events;
    std::map<uint64_t, std::string> open;
    for (const auto& record : records) {
        ASSERT_EQ(record.category, LogCategory::Locking);
        ASSERT_TRUE(record.signpostEvent && record.signpostName);
        std::string name = record.signpostName, event = record.signpostEvent;
        events[name + " " + event]++;
        if (event == "begin") {
            open[record.signpostId] = name;
            if (name == "ReadLockWithIdentifier") {
                EXPECT_THAT(record.message, testing::HasSubstr("uuid=LOGGED"));
            }
        } else {
            EXPECT_EQ(open[record.signpostId], name);
            open.erase(record.signpostId);
        }
    }
    EXPECT_TRUE(open.empty());
    EXPECT_EQ(events["WaitingForReadLockWithIdentifier begin"], 2);
    EXPECT_EQ(events["ReadLockWithIdentifier begin"], 2);
    EXPECT_EQ(events["ReadLockWithIdentifier end"], 2);
    EXPECT_EQ(events["WaitingForGlobalWriteLock end"], 1);
    EXPECT_EQ(events["GlobalWriteLock end"], 1);
}

TEST(VSLLocksDeathTest, BrokenInvariantsStopTheProcessNamingTheExpression) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    using testing::AllOf;
    using testing::HasSubstr;

    // The death statements run in a fresh child, where no identifier was ever taken.
    EXPECT_DEATH(unlock_identifier(std::string("A")),
                 AllOf(HasSubstr("gVSLLocks.identifierToLockMap"), HasSubstr("unlock_one_lock"),
                       HasSubstr("VSLLocks")));
    EXPECT_DEATH(
        {
            lock_identifier_for_reading(std::string("A"));
            unlock_identifier(std::string("B"));
        },
        AllOf(HasSubstr("(lockPtr)"), HasSubstr("unlock_one_lock")));
    EXPECT_DEATH(unlock_all_identifiers(),
                 AllOf(HasSubstr("gVSLLocks.allReaderWriterState > 0"), HasSubstr("unlock_all_identifiers")));
    EXPECT_DEATH(lock_identifier_for_writing(Value::uint64(7)),
                 HasSubstr("_lock_identifier: Unknown parameter type!"));
    EXPECT_DEATH(unlock_identifier(Value::array({Value::string("A"), Value::boolean(true)})),
                 HasSubstr("unlock_identifier: Unknown parameter type!"));
}

// The global write lock is not re-entrant: a thread that asks again for any container
// lock while holding it stops with a report instead of waiting for itself forever.
TEST(VSLLocksDeathTest, TheGlobalWriterTakingAnyLockAgainStops) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    using testing::HasSubstr;
    EXPECT_DEATH(
        {
            lock_all_identifiers_for_writing();
            lock_all_identifiers_for_writing();
        },
        HasSubstr("checkNotGlobalWriter"));
    EXPECT_DEATH(
        {
            lock_all_identifiers_for_writing();
            lock_all_identifiers_for_reading();
        },
        HasSubstr("checkNotGlobalWriter"));
    EXPECT_DEATH(
        {
            lock_all_identifiers_for_writing();
            lock_identifier_for_reading(std::string("A"));
        },
        HasSubstr("checkNotGlobalWriter"));

    // Released by another thread, as queued work does: the taker may take it again,
    // and a second taker simply waits its turn.
    lock_all_identifiers_for_writing();
    std::thread([] { unlock_all_identifiers(); }).join();
    lock_all_identifiers_for_writing();
    std::atomic<bool> secondHolds{false};
    std::thread second([&] {
        lock_all_identifiers_for_writing();
        secondHolds = true;
        unlock_all_identifiers();
    });
    EXPECT_FALSE(secondHolds.load());
    unlock_all_identifiers();
    second.join();
    EXPECT_TRUE(secondHolds.load());
    EXPECT_EQ(currentVSLLocksState().allReaderWriterState, 0);
}

}  // namespace
}  // namespace vsl
