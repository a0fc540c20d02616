// A strict JSON reader for tests that check what tools print: objects become
// dictionaries, arrays arrays, numbers int64 (uint64 above its range), true/false
// booleans, null the empty value.
#pragma once

#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl::test {

// None, with the offset and reason in *error, unless `text` is one JSON value
// (surrounding white space allowed).
std::optional<Value> parseJson(const std::string& text, std::string* error = nullptr);

}  // namespace vsl::test
