#include "Daemon/Concurrency/VSLCommandQueue.h"

#include "Platform/Log.h"

namespace vsl {

std::shared_ptr<VSLCommandQueue> VSLCommandQueue::create() {
    return std::shared_ptr<VSLCommandQueue>(new VSLCommandQueue());
}

VSLCommandQueue::VSLCommandQueue() : queue_(WorkQueue::serial("com.tarrow.vesseld.VSLCommandQueue")) {}

void VSLCommandQueue::insertCommand(std::shared_ptr<VSLCommand> command) {
    const void* p = command.get();
    uint64_t number = command->command();
    {
        std::lock_guard<std::mutex> g(mutex_);
        commands_.push_back(std::move(command));
    }
    osLog(LogCategory::Unspecified, OSLogLevel::Info, "Added command <%p; %llu> to queue", p, number);
}

bool VSLCommandQueue::executeNextCommandWithError(uint64_t* code) {
    std::shared_ptr<VSLCommand> command;
    {
        std::lock_guard<std::mutex> g(mutex_);
        if (commands_.empty()) {
            if (code) *code = kVSLCommandQueueExhausted;
            return false;
        }
        command = std::move(commands_.front());
        commands_.pop_front();
    }
    bool ok = false;
    uint64_t result = 1;
    std::weak_ptr<VSLCommandQueue> weakSelf = weak_from_this();
    queue_->sync([&] {
        const void* p = command.get();
        osLog(LogCategory::Unspecified, OSLogLevel::Info, "Executing command <%p; %llu>...", p, command->command());
        auto self = weakSelf.lock();
        ok = command->fromQueue(self, &result);
        osLog(LogCategory::Unspecified, OSLogLevel::Info, "Completed command <%p; %llu>: success = %d, error = %llu", p,
              command->command(), ok, result);
    });
    if (!ok && code) *code = result;
    return ok;
}

bool VSLCommandQueue::executeAllUntilExhaustedOrError(uint64_t* code) {
    uint64_t result = 1;
    while (executeNextCommandWithError(&result)) result = 1;
    if (result == kVSLCommandQueueExhausted) return true;
    if (code) *code = result;
    return false;
}

size_t VSLCommandQueue::pendingCount() const {
    std::lock_guard<std::mutex> g(mutex_);
    return commands_.size();
}

}  // namespace vsl
