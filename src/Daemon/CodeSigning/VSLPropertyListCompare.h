// Equality of property-list values by meaning rather than by stored type: a stored
// dictionary comes back from its blob with non-negative integers unsigned and uuids
// as 16 bytes of data, and must still equal what a client sends again.
#pragma once

#include <cstddef>

#include "Platform/Value.h"

namespace vsl {

// Numbers equal by value whatever their type (booleans stay apart), a uuid equals
// data of its 16 bytes; arrays in order, dictionaries by key.
bool propertyListValuesEqual(const Value& a, const Value& b);
// Consistent with propertyListValuesEqual.
size_t propertyListHash(const Value& v);

// An entitlement-style truth value: a boolean or a number; anything else is false.
bool propertyListTruthValue(const Value* v);

}  // namespace vsl
