#include "Platform/WorkQueue.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <sys/eventfd.h>
#include <thread>
#include <utility>

namespace vsl {

namespace {

using Clock = std::chrono::steady_clock;

// Beyond the eager workers, a new one is started only after work has waited this long
// with every worker busy and none of them finishing anything (they may all be blocked
// on that work)...
constexpr auto kSpawnDelay = std::chrono::milliseconds(3);
// ...or, while they keep finishing items (starved of CPU, not blocked: more threads would
// only add churn), at most one per this interval, so that low-priority work passed over
// by a steady stream of higher-priority work still gets a thread.
constexpr auto kStarvedSpawnDelay = std::chrono::milliseconds(50);
constexpr size_t kMaxWorkers = 512;
// A serial queue runs this many items per turn before yielding its worker.
constexpr unsigned kSerialBatch = 16;

// Calls work; an exception escaping a work item terminates the process.
void runItem(const WorkQueue::Work& work) noexcept { work(); }

}  // namespace

// One link per queue item the thread is running; a sync item links to the chain of
// the caller blocked on it, so that cross-thread self-deadlocks are caught too.
struct WorkQueue::Frame {
    const WorkQueue* queue;
    const Frame* parent;
};

thread_local const WorkQueue::Frame* WorkQueue::currentFrame_ = nullptr;

// The shared worker pool. Never destroyed: detached workers may outlive static
// destruction at exit.
class WorkQueue::Pool {
public:
    static Pool& shared() {
        static Pool* pool = new Pool;
        return *pool;
    }

    void submit(const std::shared_ptr<WorkQueue>& queue, unsigned count) {
        std::lock_guard lock(mutex_);
        auto& ready = ready_[static_cast<int>(queue->priority())];
        const auto now = Clock::now();
        for (unsigned i = 0; i < count; ++i) ready.push_back({queue, now});
        unsigned uncovered = count;
        // Wake the most recently idled workers first so surplus ones age out.
        while (uncovered > 0 && !idle_.empty()) {
            Idler* idler = idle_.back();
            idle_.pop_back();
            idler->woken = true;
            idler->cv.notify_one();
            --uncovered;
        }
        while (uncovered > 0 && workers_ < eagerWorkers_ && spawnLocked()) --uncovered;
        if (uncovered > 0) {
            if (!monitorStarted_) {
                monitorStarted_ = true;
                std::thread([this] { monitor(); }).detach();
            } else if (monitorWaiting_) {
                monitorCv_.notify_one();
            }
        }
    }

    size_t workerCount() {
        std::lock_guard lock(mutex_);
        return workers_;
    }

    void setIdleTimeout(std::chrono::milliseconds timeout) {
        std::lock_guard lock(mutex_);
        idleTimeout_ = timeout;
        for (Idler* idler : idle_) idler->cv.notify_one();
    }

private:
    struct Entry {
        std::shared_ptr<WorkQueue> queue;
        Clock::time_point since;
    };
    struct Idler {
        std::condition_variable cv;
        bool woken = false;
    };

    Pool() : eagerWorkers_(std::max(2u, std::thread::hardware_concurrency())) {}

    bool popLocked(Entry& entry) {
        for (int p = 2; p >= 0; --p) {
            if (!ready_[p].empty()) {
                entry = std::move(ready_[p].front());
                ready_[p].pop_front();
                return true;
            }
        }
        return false;
    }

    bool hasWorkLocked() const {
        return !ready_[0].empty() || !ready_[1].empty() || !ready_[2].empty();
    }

    bool spawnLocked() {
        ++workers_;
        try {
            std::thread([this] { work(); }).detach();
            return true;
        } catch (const std::system_error& e) {
            --workers_;
            std::fprintf(stderr, "vsl::WorkQueue: cannot start a pool worker: %s\n", e.what());
            return false;
        }
    }

    void work() {
        std::unique_lock lock(mutex_);
        for (;;) {
            Entry entry;
            if (popLocked(entry)) {
                lock.unlock();
                entry.queue->drain();
                entry.queue.reset();  // may destroy the queue: not under the pool lock
                lock.lock();
                ++finished_;
                continue;
            }
            Idler me;
            idle_.push_back(&me);
            const auto idleSince = Clock::now();
            while (!me.woken) {
                // Re-armed on every wake so a changed idle timeout applies at once.
                if (me.cv.wait_until(lock, idleSince + idleTimeout_) == std::cv_status::timeout &&
                    !me.woken) {
                    break;
                }
            }
            if (!me.woken) {
                idle_.erase(std::find(idle_.begin(), idle_.end(), &me));
                if (!hasWorkLocked()) {
                    --workers_;
                    return;
                }
            }
        }
    }

    // Starts a worker whenever the oldest waiting entry has waited kSpawnDelay while no
    // worker was idle or finished an entry: the busy ones may all be blocked on it.
    void monitor() {
        std::unique_lock lock(mutex_);
        size_t finishedBefore = finished_;
        auto lastSpawn = Clock::now() - kStarvedSpawnDelay;
        for (;;) {
            if (!hasWorkLocked()) {
                monitorWaiting_ = true;
                monitorCv_.wait(lock);
                monitorWaiting_ = false;
                continue;
            }
            auto oldest = Clock::time_point::max();
            for (const auto& ready : ready_) {
                if (!ready.empty()) oldest = std::min(oldest, ready.front().since);
            }
            const auto now = Clock::now();
            const bool stalled = finished_ == finishedBefore;
            finishedBefore = finished_;
            if (idle_.empty() && workers_ < kMaxWorkers && now - oldest >= kSpawnDelay &&
                (stalled || now - lastSpawn >= kStarvedSpawnDelay) && spawnLocked()) {
                lastSpawn = now;
            }
            monitorCv_.wait_for(lock, kSpawnDelay);
        }
    }

    std::mutex mutex_;
    std::deque<Entry> ready_[3];  // by QueuePriority
    std::vector<Idler*> idle_;
    size_t workers_ = 0;
    size_t finished_ = 0;  // entries drained, so the monitor can tell blocked from starved
    const size_t eagerWorkers_;  // started without delay, one per core
    std::chrono::milliseconds idleTimeout_{5000};
    std::condition_variable monitorCv_;
    bool monitorStarted_ = false;
    bool monitorWaiting_ = false;
};

// Wakes the thread in runMainLoop() through an eventfd so that stopMainLoop() can be
// called from a signal handler.
class WorkQueue::MainLoop {
public:
    static MainLoop& shared() {
        static MainLoop* loop = new MainLoop;
        return *loop;
    }

    void post(unsigned count) {
        {
            std::lock_guard lock(mutex_);
            tokens_ += count;
        }
        wake();
    }

    void run() {
        if (running_.exchange(true)) {
            std::fprintf(stderr, "vsl::WorkQueue: runMainLoop called while already running\n");
            std::abort();
        }
        for (;;) {
            if (stopRequested_.exchange(false)) break;
            bool have = false;
            {
                std::lock_guard lock(mutex_);
                if (tokens_ > 0) {
                    --tokens_;
                    have = true;
                }
            }
            if (have) {
                WorkQueue::main()->drain();
                continue;
            }
            eventfd_t value;
            while (eventfd_read(fd_, &value) != 0 && errno == EINTR) {
            }
        }
        running_ = false;
    }

    void stop() {
        stopRequested_ = true;
        wake();
    }

private:
    MainLoop() : fd_(eventfd(0, EFD_CLOEXEC)) {
        if (fd_ < 0) {
            std::perror("vsl::WorkQueue: eventfd");
            std::abort();
        }
    }

    void wake() {
        int saved = errno;
        eventfd_write(fd_, 1);
        errno = saved;
    }

    const int fd_;
    std::mutex mutex_;
    size_t tokens_ = 0;
    std::atomic<bool> stopRequested_{false};
    std::atomic<bool> running_{false};
};

std::shared_ptr<WorkQueue> WorkQueue::create(std::string label, Attributes attributes) {
    return std::make_shared<WorkQueue>(Passkey{}, std::move(label), attributes, false);
}

std::shared_ptr<WorkQueue> WorkQueue::serial(std::string label, QueuePriority priority) {
    return create(std::move(label), {.kind = Kind::Serial, .priority = priority});
}

std::shared_ptr<WorkQueue> WorkQueue::concurrent(std::string label, QueuePriority priority) {
    return create(std::move(label), {.kind = Kind::Concurrent, .priority = priority});
}

const std::shared_ptr<WorkQueue>& WorkQueue::main() {
    MainLoop::shared();  // exists before anyone may stop it from a signal handler
    static auto* queue = new std::shared_ptr<WorkQueue>(
        std::make_shared<WorkQueue>(Passkey{}, "main", Attributes{}, true));
    return *queue;
}

WorkQueue::WorkQueue(Passkey, std::string label, Attributes attributes, bool mainThread)
    : label_(std::move(label)),
      attributes_(attributes),
      mainThread_(mainThread),
      suspendCount_(attributes.initiallySuspended ? 1 : 0) {
    if (mainThread_ && attributes_.kind != Kind::Serial) fail("the main queue must be serial");
}

WorkQueue::~WorkQueue() = default;

void WorkQueue::fail(const char* what) const {
    std::fprintf(stderr, "vsl::WorkQueue \"%s\": %s\n", label_.c_str(), what);
    std::abort();
}

void WorkQueue::async(Work work) { push({std::move(work), nullptr, nullptr}); }

void WorkQueue::push(Item item) {
    unsigned tokens;
    {
        std::lock_guard lock(mutex_);
        items_.push_back(std::move(item));
        tokens = claimTokensLocked();
    }
    issue(tokens);
}

// How many new pool entries the queue needs now; counts them as issued.
unsigned WorkQueue::claimTokensLocked() {
    if (suspendCount_ > 0 || items_.empty()) return 0;
    size_t want = 0;
    if (attributes_.kind == Kind::Serial) {
        want = heldLocked() ? 0 : 1;
    } else if (items_.size() > tokens_) {
        want = items_.size() - tokens_;
    }
    tokens_ += want;
    return static_cast<unsigned>(want);
}

void WorkQueue::issue(unsigned tokens) {
    if (tokens == 0) return;
    if (mainThread_) {
        MainLoop::shared().post(tokens);
    } else {
        Pool::shared().submit(shared_from_this(), tokens);
    }
}

// Runs on behalf of one pool entry: a few items of a serial queue, one of a concurrent.
void WorkQueue::drain() {
    const bool serial = attributes_.kind == Kind::Serial;
    std::unique_lock lock(mutex_);
    if (!serial) --tokens_;
    // The main queue runs one item per turn so that a stop takes effect after it.
    const unsigned batch = serial && !mainThread_ ? kSerialBatch : 1;
    std::function<void()> wake;  // the sync caller of the last item run
    for (unsigned done = 0; done < batch; ++done) {
        if (suspendCount_ > 0 || items_.empty()) break;
        Item item = std::move(items_.front());
        items_.pop_front();
        lock.unlock();
        if (wake) std::exchange(wake, nullptr)();
        invoke(item.work, item.parent);
        wake = std::move(item.done);
        item = {};  // release captures (and the transactions they hold) right after the run
        lock.lock();
    }
    if (serial) --tokens_;
    releasedLocked();
    const unsigned tokens = claimTokensLocked();
    lock.unlock();
    issue(tokens);
    if (wake) wake();
}

void WorkQueue::releasedLocked() {
    if (syncWaiters_ > 0 && !heldLocked()) released_.notify_all();
}

void WorkQueue::invoke(const Work& work, const Frame* parent) {
    const Frame frame{this, parent};
    const Frame* saved = currentFrame_;
    currentFrame_ = &frame;
    runItem(work);
    currentFrame_ = saved;
}

void WorkQueue::sync(const Work& work) {
    if (attributes_.kind == Kind::Serial && isCurrent()) {
        fail("sync from a work item of this same serial queue would deadlock");
    }
    {
        std::unique_lock lock(mutex_);
        // Held by another thread with nothing queued behind it (an I/O thread whose
        // peer's next message came in before it let go, or a pool worker finishing
        // its drain): wait for it, then run here.
        while (attributes_.kind == Kind::Serial && !mainThread_ && suspendCount_ == 0 && items_.empty() &&
               heldLocked()) {
            ++syncWaiters_;
            released_.wait(lock);
            --syncWaiters_;
        }
        // Run on the caller's thread when the queue is free: no thread hand-off.
        const bool free = attributes_.kind == Kind::Serial
                              ? items_.empty() && !heldLocked()
                              : true;
        if (!mainThread_ && suspendCount_ == 0 && free) {
            ++inlineRunning_;
            lock.unlock();
            invoke(work, currentFrame_);
            lock.lock();
            --inlineRunning_;
            releasedLocked();
            const unsigned tokens = claimTokensLocked();
            lock.unlock();
            issue(tokens);
            return;
        }
    }
    std::mutex doneMutex;
    std::condition_variable doneCv;
    bool done = false;
    push({[&] { work(); }, currentFrame_, [&] {
              std::lock_guard lock(doneMutex);
              done = true;
              doneCv.notify_one();
          }});
    std::unique_lock lock(doneMutex);
    doneCv.wait(lock, [&] { return done; });
}

void WorkQueue::suspend() {
    std::lock_guard lock(mutex_);
    ++suspendCount_;
}

void WorkQueue::resume() {
    unsigned tokens;
    {
        std::lock_guard lock(mutex_);
        if (suspendCount_ == 0) fail("resume of a queue that is not suspended");
        --suspendCount_;
        tokens = claimTokensLocked();
    }
    issue(tokens);
}

bool WorkQueue::isCurrent() const {
    for (const Frame* f = currentFrame_; f; f = f->parent) {
        if (f->queue == this) return true;
    }
    return false;
}

std::string WorkQueue::currentLabel() {
    return currentFrame_ ? currentFrame_->queue->label_ : std::string();
}

size_t WorkQueue::poolWorkerCount() { return Pool::shared().workerCount(); }

void WorkQueue::setPoolIdleTimeout(std::chrono::milliseconds timeout) {
    Pool::shared().setIdleTimeout(timeout);
}

void runMainLoop() { WorkQueue::MainLoop::shared().run(); }

void stopMainLoop() { WorkQueue::MainLoop::shared().stop(); }

std::shared_ptr<WorkGroup> WorkGroup::create() { return std::make_shared<WorkGroup>(Passkey{}); }

void WorkGroup::enter() {
    std::lock_guard lock(mutex_);
    ++count_;
}

void WorkGroup::leave() {
    decltype(notifications_) ready;
    {
        std::lock_guard lock(mutex_);
        if (count_ == 0) {
            std::fprintf(stderr, "vsl::WorkGroup: leave without a matching enter\n");
            std::abort();
        }
        if (--count_ > 0) return;
        ready.swap(notifications_);
        emptied_.notify_all();
    }
    for (auto& [queue, work] : ready) queue->async(std::move(work));
}

void WorkGroup::async(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work) {
    enter();
    queue->async([group = shared_from_this(), work = std::move(work)] {
        work();
        group->leave();
    });
}

bool WorkGroup::wait(std::optional<std::chrono::milliseconds> timeout) {
    std::unique_lock lock(mutex_);
    auto empty = [&] { return count_ == 0; };
    if (!timeout) {
        emptied_.wait(lock, empty);
        return true;
    }
    return emptied_.wait_for(lock, *timeout, empty);
}

void WorkGroup::notify(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work) {
    {
        std::lock_guard lock(mutex_);
        if (count_ > 0) {
            notifications_.emplace_back(queue, std::move(work));
            return;
        }
    }
    queue->async(std::move(work));
}

}  // namespace vsl
