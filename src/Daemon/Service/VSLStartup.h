// Start-up work run on the listener queue before the first connection is taken.
#pragma once

#include <memory>

#include "Platform/Transaction.h"
#include "Platform/WorkQueue.h"

namespace vsl {

// `transaction` is the keep-alive that main opened; closed when start-up is done.
void vesseld_init(std::shared_ptr<Transaction> transaction);

const std::shared_ptr<WorkQueue>& lockStateQueue();

}  // namespace vsl
