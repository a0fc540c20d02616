// Start-up work run on the listener queue before the first connection is taken.
#pragma once

#include <memory>
#include <string>

#include "Platform/NamedSemaphore.h"
#include "Platform/Transaction.h"
#include "Platform/WorkQueue.h"

namespace vsl {

// `transaction` is the keep-alive that main opened; closed when start-up is done. In
// order: the rotating log, the queues, first-boot setup (first start since boot
// only), every-start setup, the kernel upcall server, lock-state registration, then
// the first-boot and every-start clean-ups, which finish on the background queue.
void vesseld_init(std::shared_ptr<Transaction> transaction);

// The marker of a boot whose first-boot clean-up has completed: a named semaphore
// unique to the system root. Removing it makes the next start a first boot.
std::string firstBootSemaphoreName();
// The first-boot clean-up's completion: makes the marker, posts reboot-cleanup-complete.
void set_first_boot_work_completed();

const std::shared_ptr<WorkQueue>& lockStateQueue();

// How many rotated files of "vesseld.log" are kept: 1, or 4 on internal builds.
int diskLoggingParameter();

}  // namespace vsl
