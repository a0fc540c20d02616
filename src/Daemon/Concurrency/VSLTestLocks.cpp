#include "Daemon/Concurrency/VSLTestLocks.h"

#include "Daemon/Concurrency/VSLLocks.h"
#include "Daemon/Core/VSLInvariant.h"
#include "Platform/Log.h"
#include "Platform/Value.h"

namespace vsl {

namespace {
const char* const kAcquireFn = "-[VSLTestLocks acquireLock:]";
const char* const kReleaseFn = "-[VSLTestLocks releaseLock:]";
const char* const kGateFn = "-[VSLTestLocks _stateQueue_acquireLock:]";
const char* const kWaitFn = "-[VSLTestLocks waitOnLock:]";
}  // namespace

VSLTestLocks& VSLTestLocks::sharedInstance() {
    // Never destroyed: a held gate or lock may still be waited on while the process exits.
    static VSLTestLocks* instance = new VSLTestLocks();
    return *instance;
}

VSLTestLocks::VSLTestLocks() : stateQueue_(WorkQueue::serial("com.tarrow.vesseld.VSLTestLocks.stateQueue")) {
    for (uint64_t i = 2; i < kLockCount; i++) {
        gates_[i] = std::make_shared<Gate>();
        gates_[i]->queue = WorkQueue::concurrent("com.tarrow.vesseld.VSLTestLocks.lockQueue");
    }
}

VSLTestLocks::~VSLTestLocks() { releaseAllLocks(); }

void VSLTestLocks::acquireLock(uint64_t lock) {
    stateQueue_->sync([&] {
        _stateQueue_updateCountForLock(lock, 1);
        LogWrite(kLogLevelNotice, kAcquireFn, "Acquired test lock: %llu; count: %ld", lock, counts_[lock]);
    });
}

void VSLTestLocks::releaseLock(uint64_t lock) {
    stateQueue_->sync([&] {
        _stateQueue_updateCountForLock(lock, -1);
        LogWrite(kLogLevelNotice, kReleaseFn, "Released test lock: %llu; count: %ld", lock, counts_[lock]);
    });
}

void VSLTestLocks::releaseAllLocks() {
    stateQueue_->sync([&] {
        for (uint64_t i = 0; i < kLockCount; i++) _stateQueue_updateCountForLock(i, -counts_[i]);
        LogWrite(kLogLevelNotice, "-[VSLTestLocks releaseAllLocks]", "Released all test locks.");
    });
}

int64_t VSLTestLocks::count(uint64_t lock) {
    int64_t c = 0;
    stateQueue_->sync([&] { c = counts_[lock]; });
    return c;
}

void VSLTestLocks::_stateQueue_updateCountForLock(uint64_t lock, int64_t delta) {
    VSL_INVARIANT(lock < kLockCount);
    if (delta == 0) return;
    const int64_t old = counts_[lock];
    const int64_t updated = old + delta;
    if (updated < 0)
        LogWrite(kLogLevelError, "-[VSLTestLocks _stateQueue_updateCountForLock:byCount:]",
                 "Unbalanced update to test lock: %llu by: %ld from: %ld", lock, static_cast<long>(delta),
                 static_cast<long>(old));
    VSL_INVARIANT(updated >= 0);
    if (old == 0 && updated > 0) _stateQueue_acquireLock(lock);
    if (old > 0 && updated == 0) _stateQueue_releaseLock(lock);
    counts_[lock] = updated;
}

void VSLTestLocks::_stateQueue_acquireLock(uint64_t lock) {
    if (lock < 2) {
        auto holder = std::make_unique<Holder>();
        Holder* h = holder.get();
        h->thread = std::thread([h, lock] {
            if (lock == 0)
                lock_all_identifiers_for_reading();
            else
                lock_all_identifiers_for_writing();
            h->granted.release();
            h->release.acquire();
            unlock_all_identifiers();
        });
        h->granted.acquire();  // the state queue waits until the lock is granted
        holders_[lock] = std::move(holder);
        return;
    }
    // The barrier item owns the gate too: it may still be waking waiters when the
    // locks object goes away (tests make their own).
    std::shared_ptr<Gate> gate = gates_[lock];
    {
        std::lock_guard<std::mutex> g(gate->mutex);
        gate->barriers++;
    }
    gate->queue->async([gate, lock] {
        LogWrite(kLogLevelNotice, kGateFn, "Blocking waiters for lock: %llu", lock);
        gate->semaphore.acquire();
        LogWrite(kLogLevelNotice, kGateFn, "Unblocking waiters for lock: %llu", lock);
        std::lock_guard<std::mutex> g(gate->mutex);
        gate->barriers--;
        gate->opened.notify_all();
    });
}

void VSLTestLocks::_stateQueue_releaseLock(uint64_t lock) {
    if (lock < 2) {
        auto holder = std::move(holders_[lock]);
        if (!holder) return;
        holder->release.release();
        holder->thread.join();
        return;
    }
    gates_[lock]->semaphore.release();
}

void VSLTestLocks::waitOnLock(uint64_t gate) {
    VSL_INVARIANT(gate >= 2 && gate < kLockCount);
    if (!enabled()) return;
    const std::string name = Uuid::random().string();
    LogWrite(kLogLevelNotice, kWaitFn, "[%s] Waiting on lock: %llu", name, gate);
    Gate* g = gates_[gate].get();
    g->queue->sync([g] {
        std::unique_lock<std::mutex> l(g->mutex);
        g->opened.wait(l, [g] { return g->barriers == 0; });
    });
    LogWrite(kLogLevelNotice, kWaitFn, "[%s] No longer waiting on lock: %llu", name, gate);
}

void VSLTestLocks::setEnabled(bool enabled) {
    {
        std::lock_guard<std::mutex> g(enabledMutex_);
        if (enabled_ == enabled) return;
        if (enabled) {
            enabled_ = true;
            LogWrite(kLogLevelNotice, "-[VSLTestLocks setEnabled:]", "Enabled test locks feature.");
            return;
        }
    }
    releaseAllLocks();
    std::lock_guard<std::mutex> g(enabledMutex_);
    enabled_ = false;
    LogWrite(kLogLevelNotice, "-[VSLTestLocks setEnabled:]", "Disabled test locks feature.");
}

bool VSLTestLocks::enabled() const {
    std::lock_guard<std::mutex> g(enabledMutex_);
    return enabled_;
}

}  // namespace vsl
