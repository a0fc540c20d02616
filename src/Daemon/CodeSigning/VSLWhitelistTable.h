// The platform's well-known containers and trusted lookups, as this platform ships
// them. The sizes and shapes are fixed; only the identifiers are ours to choose.
#pragma once

#include <array>

#include "Daemon/Core/VSLContainerClass.h"

namespace vsl {

// One identifier of one class that any caller may look up.
struct VSLWhitelistContainerRow {
    VSLContainerClass containerClass;
    const char* containerIdentifier;
};

// What one trusted caller may look up: with class 0, everything; with a class and
// no identifier, everything of that class; otherwise that one identifier.
struct VSLWhitelistCallerRow {
    const char* codeSigningIdentifier;
    VSLContainerClass containerClass;
    const char* containerIdentifier;
};

// Well-known system containers (class 12); each maps to itself.
extern const std::array<const char*, 2> kVSLWellKnownSystemContainers;
// Well-known system-group containers (class 13), all "systemgroup." identifiers.
extern const std::array<const char*, 8> kVSLWellKnownSystemGroupContainers;
// Added on internal build images only: the code-coverage data group.
extern const char* const kVSLInternalSystemGroupContainer;
extern const std::array<VSLWhitelistContainerRow, 1> kVSLLookupByContainer;
extern const std::array<VSLWhitelistCallerRow, 9> kVSLLookupByCodeSignIdentifier;

}  // namespace vsl
