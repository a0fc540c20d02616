// Names of the result codes, for people and scripts ("NotFound" for 21).
#pragma once

#include <cstdint>

namespace vsl {

// The code's name without its prefix; "Unknown" for a number outside the numbering.
const char* errorCodeName(uint64_t code);

}  // namespace vsl
