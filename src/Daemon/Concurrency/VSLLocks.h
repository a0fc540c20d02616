// The daemon's container locks: one reader/writer lock per identifier (a container
// UUID's upper-case string) and one global reader/writer lock over all containers.
// The global write lock excludes every identifier lock; the global read lock excludes
// identifier writers only; different identifiers never exclude each other.
//
// Every take blocks until granted and is paired with one unlock of the same argument,
// which may come from any thread. A thread never holds both kinds at once, and takes
// several identifiers in one call (they are locked in ascending order, each once).
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <string>
#include <utility>
#include <vector>

namespace vsl {

class Value;

void lock_identifier_for_reading(const std::string& identifier);
void lock_identifier_for_reading(const std::vector<std::string>& identifiers);
void lock_identifier_for_writing(const std::string& identifier);
void lock_identifier_for_writing(const std::vector<std::string>& identifiers);
// Releases what the matching lock call took, whatever its mode.
void unlock_identifier(const std::string& identifier);
void unlock_identifier(const std::vector<std::string>& identifiers);

// A braced list of literals would otherwise also match std::string's iterator-pair
// constructor.
inline void lock_identifier_for_reading(std::initializer_list<std::string> identifiers) {
    lock_identifier_for_reading(std::vector<std::string>(identifiers));
}
inline void lock_identifier_for_writing(std::initializer_list<std::string> identifiers) {
    lock_identifier_for_writing(std::vector<std::string>(identifiers));
}
inline void unlock_identifier(std::initializer_list<std::string> identifiers) {
    unlock_identifier(std::vector<std::string>(identifiers));
}

// For identifiers that arrive as values: a string or an array of strings. Anything
// else is a programming error that stops the process.
void lock_identifier_for_reading(const Value& identifiers);
void lock_identifier_for_writing(const Value& identifiers);
void unlock_identifier(const Value& identifiers);

void lock_all_identifiers_for_reading();
void lock_all_identifiers_for_writing();
// Releases the caller's global lock, whatever its mode.
void unlock_all_identifiers();

// Holds the global lock until release or scope end. With `use` false it takes nothing:
// for work already running under the global write lock.
class VSLGlobalLockGuard {
public:
    explicit VSLGlobalLockGuard(bool use = true) : use_(use) {}
    ~VSLGlobalLockGuard() { release(); }
    VSLGlobalLockGuard(const VSLGlobalLockGuard&) = delete;
    VSLGlobalLockGuard& operator=(const VSLGlobalLockGuard&) = delete;
    void read() {
        if (use_ && !held_) {
            lock_all_identifiers_for_reading();
            held_ = true;
        }
    }
    void write() {
        if (use_ && !held_) {
            lock_all_identifiers_for_writing();
            held_ = true;
        }
    }
    void release() {
        if (held_) unlock_all_identifiers();
        held_ = false;
    }

private:
    bool use_;
    bool held_ = false;
};

// Holds identifier locks (ascending order, each once) until scope end.
class VSLIdentifierLockGuard {
public:
    VSLIdentifierLockGuard(std::vector<std::string> identifiers, bool forWriting, bool use = true)
        : identifiers_(std::move(identifiers)), held_(use) {
        if (!held_) return;
        if (forWriting)
            lock_identifier_for_writing(identifiers_);
        else
            lock_identifier_for_reading(identifiers_);
    }
    ~VSLIdentifierLockGuard() {
        if (held_) unlock_identifier(identifiers_);
    }
    VSLIdentifierLockGuard(const VSLIdentifierLockGuard&) = delete;
    VSLIdentifierLockGuard& operator=(const VSLIdentifierLockGuard&) = delete;

private:
    std::vector<std::string> identifiers_;
    bool held_;
};

// A consistent view of the bookkeeping, for tests and diagnostics.
struct VSLLocksState {
    size_t liveRecords = 0;  // identifiers held or awaited
    uint32_t identifierReaderCount = 0;
    uint32_t identifierWriterCount = 0;
    int32_t allReaderWriterState = 0;  // 0 free, -1 write-held, n > 0 read-held by n
};
VSLLocksState currentVSLLocksState();

}  // namespace vsl
