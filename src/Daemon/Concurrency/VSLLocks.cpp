#include "Daemon/Concurrency/VSLLocks.h"

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <unordered_map>

#include "Daemon/Core/VSLInvariant.h"
#include "Platform/Log.h"
#include "Platform/Value.h"

namespace vsl {

namespace {

// A reader/writer lock without owners: unlocks come from whichever thread finishes
// the work, which the system rwlock does not allow (it tells a writer's release from
// a reader's by the calling thread). Readers are preferred, as with the system
// default, so a reader that already holds an identifier can take it again.
class SharedLock {
public:
    void lockExclusive() {
        std::unique_lock<std::mutex> guard(mutex_);
        changed_.wait(guard, [this] { return !writer_ && readers_ == 0; });
        writer_ = true;
    }
    void lockShared() {
        std::unique_lock<std::mutex> guard(mutex_);
        changed_.wait(guard, [this] { return !writer_; });
        readers_++;
    }
    void unlock() {
        std::lock_guard<std::mutex> guard(mutex_);
        if (writer_) {
            writer_ = false;
        } else if (--readers_ > 0) {
            return;
        }
        changed_.notify_all();
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool writer_ = false;
    uint32_t readers_ = 0;
};

struct identifier_lock {
    SharedLock rwlock;
    uint64_t useCount = 0;  // guarded by gVSLLocks.mutex
    std::atomic<int32_t> lockState{0};
    // Open hold intervals; any reader's unlock may close any reader's interval.
    std::mutex intervalMutex;
    std::vector<std::unique_ptr<SignpostInterval>> holdIntervals;
};

using IdentifierToLockMap = std::unordered_map<std::string, std::unique_ptr<identifier_lock>>;

struct VSLLocksRecord {
    std::mutex mutex;
    std::condition_variable globalWriterCondition;
    std::condition_variable globalReaderCondition;
    std::condition_variable identifierWriterCondition;
    std::condition_variable identifierReaderCondition;
    std::unique_ptr<IdentifierToLockMap> identifierToLockMap;  // created on the first take
    uint32_t identifierReaderCount = 0;
    uint32_t identifierWriterCount = 0;
    int32_t allReaderWriterState = 0;
    std::vector<std::unique_ptr<SignpostInterval>> globalHoldIntervals;
    std::thread::id globalWriter;  // who took the global write lock, while it is held
};

// Never destroyed: worker threads may still unlock while the process exits.
VSLLocksRecord& gVSLLocks = *new VSLLocksRecord();

constexpr const char* kUuidAttribute = " uuid=%{private, signpost.description:attribute}@ ";

const char* modeName(bool forWriting) {
    return forWriting ? "writing" : "reading";
}

// Debug and test builds: a thread that holds the global write lock and asks for any
// container lock would wait for itself forever; stop loudly instead. Caller holds
// gVSLLocks.mutex.
void checkNotGlobalWriter() {
#if defined(VESSEL_KILLPOINTS) || !defined(NDEBUG)
    VSL_INVARIANT(gVSLLocks.allReaderWriterState != -1 || gVSLLocks.globalWriter != std::this_thread::get_id());
#endif
}

// Caller holds gVSLLocks.mutex.
bool nothingRegistered() {
    return gVSLLocks.identifierWriterCount == 0 && gVSLLocks.identifierReaderCount == 0 &&
           gVSLLocks.allReaderWriterState == 0;
}

// Each interval is a structured-log record at its begin and end; they are kept to
// debugging sessions so that the lock path stays cheap.
bool tracingLocks() {
    return isDebugLogging();
}

// Runs `take` inside a "WaitingFor..." interval.
template <class F>
void whileWaiting(const char* intervalName, F&& take) {
    std::optional<SignpostInterval> waiting;
    if (tracingLocks()) waiting.emplace(LogCategory::Locking, intervalName, std::string());
    take();
}

std::unique_ptr<SignpostInterval> globalHoldInterval(const char* name) {
    if (!tracingLocks()) return nullptr;
    return std::make_unique<SignpostInterval>(LogCategory::Locking, name, std::string());
}

void beginHoldInterval(identifier_lock* lockPtr, const char* name, const std::string& identifier) {
    if (!tracingLocks()) return;
    auto interval = std::make_unique<SignpostInterval>(LogCategory::Locking, name, kUuidAttribute, identifier);
    std::lock_guard<std::mutex> guard(lockPtr->intervalMutex);
    lockPtr->holdIntervals.push_back(std::move(interval));
}

// The interval emits its end event when freed, after intervalMutex is released.
void endHoldInterval(identifier_lock* lockPtr) {
    std::unique_ptr<SignpostInterval> interval;
    {
        std::lock_guard<std::mutex> guard(lockPtr->intervalMutex);
        if (lockPtr->holdIntervals.empty()) return;
        interval = std::move(lockPtr->holdIntervals.back());
        lockPtr->holdIntervals.pop_back();
    }
}

void take_one_lock(const std::string& identifier, bool forWriting) {
    identifier_lock* lockPtr = nullptr;
    {
        std::unique_lock<std::mutex> guard(gVSLLocks.mutex);
        checkNotGlobalWriter();
        if (forWriting) {
            gVSLLocks.identifierWriterCondition.wait(guard, [] { return gVSLLocks.allReaderWriterState == 0; });
            gVSLLocks.identifierWriterCount++;
        } else {
            gVSLLocks.identifierReaderCondition.wait(guard, [] { return gVSLLocks.allReaderWriterState != -1; });
            gVSLLocks.identifierReaderCount++;
        }
        if (!gVSLLocks.identifierToLockMap) {
            gVSLLocks.identifierToLockMap = std::make_unique<IdentifierToLockMap>();
        }
        auto& record = (*gVSLLocks.identifierToLockMap)[identifier];
        if (!record) record = std::make_unique<identifier_lock>();
        record->useCount++;
        lockPtr = record.get();
    }
    // Registered above: the record lives at least until this taker unlocks.
    LogWrite(kLogLevelDebug, __func__, "Waiting to lock %@ for %s", identifier, modeName(forWriting));
    if (forWriting) {
        lockPtr->rwlock.lockExclusive();
        int32_t expected = 0;
        VSL_INVARIANT(atomic_compare_exchange_strong(&lockPtr->lockState, &expected, -1));
        beginHoldInterval(lockPtr, "WriteLockWithIdentifier", identifier);
    } else {
        lockPtr->rwlock.lockShared();
        VSL_INVARIANT(atomic_fetch_add(&lockPtr->lockState, 1) >= 0);
        beginHoldInterval(lockPtr, "ReadLockWithIdentifier", identifier);
    }
    LogWrite(kLogLevelDebug, __func__, "Got lock on identifier %@", identifier);
}

void unlock_one_lock(const std::string& identifier) {
    std::lock_guard<std::mutex> guard(gVSLLocks.mutex);
    VSL_INVARIANT(gVSLLocks.identifierToLockMap);
    auto found = gVSLLocks.identifierToLockMap->find(identifier);
    identifier_lock* lockPtr = found == gVSLLocks.identifierToLockMap->end() ? nullptr : found->second.get();
    VSL_INVARIANT(lockPtr);
    VSL_INVARIANT(atomic_load(&lockPtr->lockState) != 0);

    if (atomic_load(&lockPtr->lockState) != -1) {
        VSL_INVARIANT(atomic_fetch_sub(&lockPtr->lockState, 1) > 0);
        VSL_INVARIANT(gVSLLocks.allReaderWriterState >= 0);
        VSL_INVARIANT(gVSLLocks.identifierReaderCount > 0);
        gVSLLocks.identifierReaderCount--;
        endHoldInterval(lockPtr);
        if (nothingRegistered()) gVSLLocks.globalWriterCondition.notify_one();
    } else {
        int32_t expected = -1;
        VSL_INVARIANT(atomic_compare_exchange_strong(&lockPtr->lockState, &expected, 0));
        VSL_INVARIANT(gVSLLocks.allReaderWriterState == 0);
        VSL_INVARIANT(gVSLLocks.identifierWriterCount > 0);
        gVSLLocks.identifierWriterCount--;
        endHoldInterval(lockPtr);
        if (nothingRegistered()) gVSLLocks.globalWriterCondition.notify_one();
        if (gVSLLocks.identifierWriterCount == 0 && gVSLLocks.allReaderWriterState != -1) {
            gVSLLocks.globalReaderCondition.notify_all();
        }
    }

    lockPtr->useCount--;
    lockPtr->rwlock.unlock();
    LogWrite(kLogLevelDebug, __func__, "Unlocked identifier %@", identifier);
    if (lockPtr->useCount > 0) return;

    LogWrite(kLogLevelDebug, __func__, "Destroying lock for identifier %@", identifier);
    VSL_INVARIANT(0 == atomic_load(&lockPtr->lockState));
    gVSLLocks.identifierToLockMap->erase(found);
}

// Ascending for locking, descending for unlocking; each identifier once.
std::vector<std::string> distinctInOrder(std::vector<std::string> identifiers, bool ascending) {
    if (ascending) {
        std::sort(identifiers.begin(), identifiers.end());
    } else {
        std::sort(identifiers.begin(), identifiers.end(), std::greater<>());
    }
    identifiers.erase(std::unique(identifiers.begin(), identifiers.end()), identifiers.end());
    return identifiers;
}

void _lock_identifier(const std::string& identifier, bool forWriting) {
    take_one_lock(identifier, forWriting);
}

void _lock_identifier(const std::vector<std::string>& identifiers, bool forWriting) {
    for (const auto& identifier : distinctInOrder(identifiers, true)) take_one_lock(identifier, forWriting);
}

// A string, or an array whose elements are all strings; nullptr otherwise.
std::unique_ptr<std::vector<std::string>> identifiersOfValue(const Value& identifiers) {
    auto out = std::make_unique<std::vector<std::string>>();
    if (const std::string* one = identifiers.stringValue()) {
        out->push_back(*one);
        return out;
    }
    const Array* many = identifiers.arrayValue();
    if (!many) return nullptr;
    for (const Value& element : *many) {
        const std::string* identifier = element.stringValue();
        if (!identifier) return nullptr;
        out->push_back(*identifier);
    }
    return out;
}

void _lock_identifier(const Value& identifiers, bool forWriting) {
    auto list = identifiersOfValue(identifiers);
    if (!list) VSLFatalError(__func__, "Unknown parameter type!");
    _lock_identifier(*list, forWriting);
}

void _lock_all_identifiers(bool forWriting) {
    LogWrite(kLogLevelDebug, __func__, "Waiting to lock all identifiers for %s", modeName(forWriting));
    std::unique_lock<std::mutex> guard(gVSLLocks.mutex);
    checkNotGlobalWriter();
    if (forWriting) {
        gVSLLocks.globalWriterCondition.wait(guard, [] { return nothingRegistered(); });
        gVSLLocks.allReaderWriterState = -1;
        gVSLLocks.globalWriter = std::this_thread::get_id();
        if (auto interval = globalHoldInterval("GlobalWriteLock")) {
            gVSLLocks.globalHoldIntervals.push_back(std::move(interval));
        }
    } else {
        gVSLLocks.globalReaderCondition.wait(guard, [] {
            return gVSLLocks.identifierWriterCount == 0 && gVSLLocks.allReaderWriterState != -1;
        });
        gVSLLocks.allReaderWriterState++;
        if (auto interval = globalHoldInterval("GlobalReadLock")) {
            gVSLLocks.globalHoldIntervals.push_back(std::move(interval));
        }
    }
    LogWrite(kLogLevelDebug, __func__, "Locked all identifiers for %s", modeName(forWriting));
}

}  // namespace

void lock_identifier_for_reading(const std::string& identifier) {
    whileWaiting("WaitingForReadLockWithIdentifier", [&] { _lock_identifier(identifier, false); });
}

void lock_identifier_for_reading(const std::vector<std::string>& identifiers) {
    whileWaiting("WaitingForReadLockWithIdentifier", [&] { _lock_identifier(identifiers, false); });
}

void lock_identifier_for_reading(const Value& identifiers) {
    whileWaiting("WaitingForReadLockWithIdentifier", [&] { _lock_identifier(identifiers, false); });
}

void lock_identifier_for_writing(const std::string& identifier) {
    whileWaiting("WaitingForWriteLockWithIdentifier", [&] { _lock_identifier(identifier, true); });
}

void lock_identifier_for_writing(const std::vector<std::string>& identifiers) {
    whileWaiting("WaitingForWriteLockWithIdentifier", [&] { _lock_identifier(identifiers, true); });
}

void lock_identifier_for_writing(const Value& identifiers) {
    whileWaiting("WaitingForWriteLockWithIdentifier", [&] { _lock_identifier(identifiers, true); });
}

void unlock_identifier(const std::string& identifier) {
    unlock_one_lock(identifier);
}

void unlock_identifier(const std::vector<std::string>& identifiers) {
    for (const auto& identifier : distinctInOrder(identifiers, false)) unlock_one_lock(identifier);
}

void unlock_identifier(const Value& identifiers) {
    auto list = identifiersOfValue(identifiers);
    if (!list) VSLFatalError(__func__, "Unknown parameter type!");
    unlock_identifier(*list);
}

void lock_all_identifiers_for_reading() {
    whileWaiting("WaitingForGlobalReadLock", [&] { _lock_all_identifiers(false); });
}

void lock_all_identifiers_for_writing() {
    whileWaiting("WaitingForGlobalWriteLock", [&] { _lock_all_identifiers(true); });
}

void unlock_all_identifiers() {
    std::unique_ptr<SignpostInterval> held;
    {
        std::lock_guard<std::mutex> guard(gVSLLocks.mutex);
        if (!gVSLLocks.globalHoldIntervals.empty()) {
            held = std::move(gVSLLocks.globalHoldIntervals.back());
            gVSLLocks.globalHoldIntervals.pop_back();
        }
        if (gVSLLocks.allReaderWriterState != -1) {
            VSL_INVARIANT(gVSLLocks.allReaderWriterState > 0);
            gVSLLocks.allReaderWriterState--;
            if (gVSLLocks.allReaderWriterState == 0) gVSLLocks.identifierWriterCondition.notify_all();
            if (nothingRegistered()) gVSLLocks.globalWriterCondition.notify_one();
        } else {
            gVSLLocks.allReaderWriterState = 0;
            gVSLLocks.globalWriter = std::thread::id();
            gVSLLocks.globalWriterCondition.notify_one();
            gVSLLocks.globalReaderCondition.notify_all();
            gVSLLocks.identifierWriterCondition.notify_all();
            gVSLLocks.identifierReaderCondition.notify_all();
        }
    }
    LogWrite(kLogLevelDebug, __func__, "Unlocked all identifiers");
}

VSLLocksState currentVSLLocksState() {
    std::lock_guard<std::mutex> guard(gVSLLocks.mutex);
    VSLLocksState state;
    state.liveRecords = gVSLLocks.identifierToLockMap ? gVSLLocks.identifierToLockMap->size() : 0;
    state.identifierReaderCount = gVSLLocks.identifierReaderCount;
    state.identifierWriterCount = gVSLLocks.identifierWriterCount;
    state.allReaderWriterState = gVSLLocks.allReaderWriterState;
    return state;
}

}  // namespace vsl
