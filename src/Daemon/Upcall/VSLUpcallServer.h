// The kernel upcall server: the channel of UpcallWire.h under the system root, its
// requests run one at a time on the serial queue "com.tarrow.vesseld.upcall".
#pragma once

#include <chrono>
#include <string>

namespace vsl {

// Once per process, at start-up. False (with the reason) when the socket cannot be made.
bool startKernelUpcallServer(std::string* error = nullptr);
// Stops serving; waits at most `grace` for requests still running. False when some were.
bool stopKernelUpcallServer(std::chrono::milliseconds grace);

}  // namespace vsl
