// Work queues, groups and the main run loop.
//
// A serial queue runs one item at a time in submission order; a concurrent queue runs
// many at once. Queues own no threads: every queue is drained by one shared worker pool
// that grows when all its workers are busy and work has waited a short while (handlers
// block on locks and disk, and the item that would unblock them must still get a
// thread), up to a generous cap, and shrinks again when workers sit idle. Idle queues
// cost nothing but their memory.
//
// Work items must not throw: an escaping exception terminates the process.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace vsl {

// A hint for the pool: among waiting work, higher priorities are started first.
enum class QueuePriority { Background, Default, UserInitiated };

enum class QueueKind { Serial, Concurrent };

struct QueueAttributes {
    QueueKind kind = QueueKind::Serial;
    QueuePriority priority = QueuePriority::Default;
    bool initiallySuspended = false;  // as if suspend() had been called once
};

class WorkQueue : public std::enable_shared_from_this<WorkQueue> {
    struct Passkey {};

public:
    using Work = std::function<void()>;
    using Kind = QueueKind;
    using Attributes = QueueAttributes;

    static std::shared_ptr<WorkQueue> create(std::string label, Attributes attributes = {});
    static std::shared_ptr<WorkQueue> serial(std::string label,
                                             QueuePriority priority = QueuePriority::Default);
    static std::shared_ptr<WorkQueue> concurrent(std::string label,
                                                 QueuePriority priority = QueuePriority::Default);
    // The serial queue drained by whichever thread calls runMainLoop().
    static const std::shared_ptr<WorkQueue>& main();

    WorkQueue(Passkey, std::string label, Attributes attributes, bool mainThread);
    ~WorkQueue();  // items still queued (only possible while suspended) are dropped
    WorkQueue(const WorkQueue&) = delete;
    WorkQueue& operator=(const WorkQueue&) = delete;

    const std::string& label() const { return label_; }
    Kind kind() const { return attributes_.kind; }
    QueuePriority priority() const { return attributes_.priority; }

    // The queue keeps itself alive until the item has run.
    void async(Work work);
    // Returns after work has run on this queue. On a serial queue, calling it from an
    // item of that same queue (directly or through other sync calls) aborts: it could
    // never run.
    void sync(const Work& work);

    // Counted: a suspended queue starts nothing new (a running item finishes) until
    // every suspend() has been matched by a resume(). Resuming more often aborts.
    void suspend();
    void resume();

    // Whether the calling thread runs an item of this queue, directly or on behalf of a
    // sync call waiting on it.
    bool isCurrent() const;
    // Label of the queue whose item the calling thread runs; empty when none.
    static std::string currentLabel();

    // Pool introspection and tuning, for tests and diagnostics.
    static size_t poolWorkerCount();
    static void setPoolIdleTimeout(std::chrono::milliseconds timeout);

private:
    class Pool;
    class MainLoop;
    struct Frame;
    struct Item {
        Work work;
        const Frame* parent = nullptr;  // chain of the sync caller waiting on this item
        // Wakes that sync caller; run once the queue has let go of the item, so that
        // the caller's next sync finds the queue free and runs on its own thread.
        std::function<void()> done;
    };
    static thread_local const Frame* currentFrame_;
    friend void runMainLoop();
    friend void stopMainLoop();

    void push(Item item);
    void drain();
    void invoke(const Work& work, const Frame* parent);
    unsigned claimTokensLocked();
    void issue(unsigned tokens);
    [[noreturn]] void fail(const char* what) const;

    const std::string label_;
    const Attributes attributes_;
    const bool mainThread_;
    std::mutex mutex_;
    std::deque<Item> items_;
    unsigned suspendCount_;
    // Pending pool entries. For a serial queue: 1 while scheduled or draining.
    size_t tokens_ = 0;
    size_t inlineRunning_ = 0;  // sync calls running on their caller's thread
    // A serial queue is held while a pool entry drains it or a sync call runs inline.
    bool heldLocked() const { return tokens_ != 0 || inlineRunning_ != 0; }
    // Sync callers waiting for another thread to let go of an otherwise empty serial
    // queue, so that they run on their own thread instead of handing off to the pool.
    size_t syncWaiters_ = 0;
    std::condition_variable released_;
    void releasedLocked();
};

// Drains the main queue on the calling thread until stopMainLoop(). Only one thread
// may run it at a time.
void runMainLoop();
// Makes runMainLoop() return after the item it is running, or at once if it is called
// later. Async-signal-safe once WorkQueue::main() or runMainLoop() has been called.
void stopMainLoop();

// Tracks a set of work items: wait for them, or be notified once they have all left.
class WorkGroup : public std::enable_shared_from_this<WorkGroup> {
    struct Passkey {};

public:
    static std::shared_ptr<WorkGroup> create();
    explicit WorkGroup(Passkey) {}

    void enter();
    void leave();  // aborts when it does not match an enter()
    void async(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work);
    // True when the group emptied; false when the timeout passed first.
    bool wait(std::optional<std::chrono::milliseconds> timeout = std::nullopt);
    // Submits work to queue once the group is empty (at once if it is now).
    void notify(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work);

private:
    std::mutex mutex_;
    std::condition_variable emptied_;
    size_t count_ = 0;
    std::vector<std::pair<std::shared_ptr<WorkQueue>, WorkQueue::Work>> notifications_;
};

}  // namespace vsl
