// The one creation rule of every directory of the layout: made with its parents,
// mode 0755, with the given owner (0: left alone) and protection class, on every
// call; a failure is logged with the accessor's own message and otherwise ignored,
// so the caller's next file operation reports the real error.
#pragma once

#include <sys/types.h>

#include <string>

#include "Daemon/Storage/VSLFileManager.h"

namespace vsl {

void createLayoutDirectory(const std::string& path, uid_t owner, VSLDataProtectionClass protectionClass,
                           const char* function, const char* failureMessage);

}  // namespace vsl
