#pragma once

#include <sys/types.h>

#include <string>

namespace vsl {

// Home directory of `uid` from the password database, real path, as a host path;
// "/private/var/mobile" below the system root when there is none.
std::string homeDirectoryURLForPOSIXUID(uid_t uid);

}  // namespace vsl
