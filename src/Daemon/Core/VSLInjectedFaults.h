// Faults that end-to-end tests inject into a real daemon; kill-point builds only,
// every other build answers false.
#pragma once

#include <string>

namespace vsl {

// VESSELD_TEST_FAIL_CREATE=IDENTIFIER: every creation of a container with exactly
// that identifier fails after its staging directory was made.
bool creationFailureInjectedFor(const std::string& identifier);

#ifdef VESSEL_KILLPOINTS
// VESSELD_TEST_FAIL_DB_WRITES=ID[,ID...]: the code-signing database refuses every
// write of those identifiers' entries; "*" refuses every write.
bool databaseWriteFailureInjectedFor(const std::string& identifier);
#else
inline bool databaseWriteFailureInjectedFor(const std::string&) { return false; }
#endif

}  // namespace vsl
