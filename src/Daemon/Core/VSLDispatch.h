#pragma once

#include <memory>

#include "Platform/WorkQueue.h"

namespace vsl {

// Runs `work` asynchronously on `queue` inside an open keep-alive transaction, so the
// daemon is not stopped while background work is pending.
void dispatchAsyncWithTransaction(const std::shared_ptr<WorkQueue>& queue, WorkQueue::Work work);

}  // namespace vsl
