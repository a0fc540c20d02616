// The service manager's side of a daemon's life: listening sockets handed over at
// start (socket activation) and the readiness and stopping notifications.
// Outside a service manager every call here does nothing and finds no socket.
#pragma once

#include <string>

#include "Platform/UniqueFd.h"

namespace vsl {

// Takes the sockets passed to this process, keyed by their names ("vesseld",
// "upcall"). Call once, early in main, before any thread starts. A passed descriptor
// that is not a listening Unix stream socket, or has a name nobody asks for, is
// refused with a log line and closed, so that the daemon binds that socket itself.
void adoptActivatedSockets();
// The passed listener of that name, handed over once; invalid when none was passed.
UniqueFd takeActivatedSocket(const std::string& name);

// "READY=1" once start-up has finished; "STOPPING=1" when a clean stop begins.
void notifyServiceReady();
void notifyServiceStopping();

}  // namespace vsl
