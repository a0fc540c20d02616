// Test locks: on internal builds a test can hold the global read lock (0) or write
// lock (1) from outside, or close one of the gates 2..6 that daemon code paths pass
// through (waitOnLock), to freeze the daemon at a known point. Gates:
//   2 disk usage, before measuring;  3 create, staged container complete, before the
//   move into place;  4 replacement, after the old container is staged;
//   5 protection-class walk, before the first item;  6 death row: a staging, before
//   it takes the global lock, and destruction, before each item.
// Counts change only on the serial state queue; the command keeps acquisitions and
// releases balanced, and an update that would take a count below 0 stops the process.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <semaphore>
#include <thread>

#include "Platform/WorkQueue.h"

namespace vsl {

class VSLTestLocks {
public:
    static constexpr uint64_t kLockCount = 7;
    static constexpr uint64_t kDiskUsageGate = 2;
    static constexpr uint64_t kCreateGate = 3;
    static constexpr uint64_t kReplaceGate = 4;
    static constexpr uint64_t kProtectionClassGate = 5;
    static constexpr uint64_t kDeathRowGate = 6;

    static VSLTestLocks& sharedInstance();
    VSLTestLocks();
    ~VSLTestLocks();
    VSLTestLocks(const VSLTestLocks&) = delete;
    VSLTestLocks& operator=(const VSLTestLocks&) = delete;

    void acquireLock(uint64_t lock);
    void releaseLock(uint64_t lock);
    void releaseAllLocks();
    // Gates 2..6: returns once the gate is open; at once while the feature is off.
    void waitOnLock(uint64_t gate);
    void setEnabled(bool enabled);
    bool enabled() const;
    const std::shared_ptr<WorkQueue>& stateQueue() const { return stateQueue_; }
    int64_t count(uint64_t lock);  // for tests

    void _stateQueue_updateCountForLock(uint64_t lock, int64_t delta);
    void _stateQueue_acquireLock(uint64_t lock);
    void _stateQueue_releaseLock(uint64_t lock);

private:
    // A closed gate is a barrier item on the gate's queue waiting on the semaphore;
    // waiters run behind it. The queue has no barriers of its own, so `barriers`
    // counts the pending ones and waiters wait for it to reach 0.
    struct Gate {
        std::shared_ptr<WorkQueue> queue;
        std::counting_semaphore<> semaphore{0};
        std::mutex mutex;
        std::condition_variable opened;
        int barriers = 0;
    };
    // Locks 0 and 1 are held by a thread of their own: the global lock records its
    // writer, and a pool thread that held it would stop the process the next time it
    // served a client that takes the lock.
    struct Holder {
        std::thread thread;
        std::binary_semaphore granted{0};
        std::binary_semaphore release{0};
    };

    int64_t counts_[kLockCount] = {};
    std::shared_ptr<Gate> gates_[kLockCount];
    std::unique_ptr<Holder> holders_[2];
    mutable std::mutex enabledMutex_;
    bool enabled_ = false;
    std::shared_ptr<WorkQueue> stateQueue_;
};

}  // namespace vsl
