#include "Daemon/Core/VSLDispatch.h"

#include "Platform/Transaction.h"

namespace vsl {

void dispatchAsyncWithTransaction(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work) {
    auto transaction = std::make_shared<Transaction>("dispatchAsyncWithTransaction");
    queue->async([transaction, work = std::move(work)]() mutable {
        work();
        transaction->close();
    });
}

}  // namespace vsl
