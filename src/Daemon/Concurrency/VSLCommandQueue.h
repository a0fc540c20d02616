// Work one operation discovers while it runs, deferred until the operation is done:
// commands run in insertion order, one at a time, on the queue's own serial queue,
// each under the locks it takes for itself. The front end drains a message's queue
// after its handler and before the reply.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>

#include "Platform/WorkQueue.h"

namespace vsl {

class VSLCommandQueue;

class VSLCommand {
public:
    virtual ~VSLCommand() = default;
    // The client command number this command stands for; for log lines only.
    virtual uint64_t command() const = 0;
    // `code` starts at 1; a failing command writes its code and returns false.
    virtual bool fromQueue(const std::shared_ptr<VSLCommandQueue>& queue, uint64_t* code) = 0;
};

// Code of a drained queue; never reported to clients.
constexpr uint64_t kVSLCommandQueueExhausted = 77;

class VSLCommandQueue : public std::enable_shared_from_this<VSLCommandQueue> {
public:
    static std::shared_ptr<VSLCommandQueue> create();

    // Any thread, also from a running command of this queue.
    void insertCommand(std::shared_ptr<VSLCommand> command);
    // False with kVSLCommandQueueExhausted when empty; otherwise the command's result.
    bool executeNextCommandWithError(uint64_t* code);
    // True when every command ran; false with the failing command's code, leaving
    // the commands behind it unexecuted. Must not be called from a command.
    bool executeAllUntilExhaustedOrError(uint64_t* code);

    size_t pendingCount() const;

private:
    VSLCommandQueue();
    std::shared_ptr<WorkQueue> queue_;
    mutable std::mutex mutex_;
    std::deque<std::shared_ptr<VSLCommand>> commands_;
};

}  // namespace vsl
