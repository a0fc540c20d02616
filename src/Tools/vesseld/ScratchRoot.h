#pragma once

#include <string>

namespace vsl {

// Lays down a working default configuration below the current system root, leaving
// every file that already exists alone: a "mobile" user, the group "systemusers",
// device facts, and a policy store that entitles the vesselctl next to this
// program. Run by someone other than root, the installer, system and mobile uids
// all map to that user so the daemon needs no privileges. Returns false with a
// reason on failure.
bool initializeScratchRoot(std::string* error);

}  // namespace vsl
