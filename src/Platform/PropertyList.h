// Property lists <-> values. Writes binary format 1.0 ("bplist00"); reads every
// format the parser knows (binary, XML). Integers: the binary format stores 8-byte
// integers signed, so values above INT64_MAX read back as negative int64; readers
// of numbers use Value::unsignedNumber() where the stored signedness does not matter.
#pragma once

#include <optional>
#include <string>

#include "Platform/Value.h"

namespace vsl {

// Null cannot stand in a property list; a uuid becomes 16 bytes of data.
std::optional<std::string> encodeBinaryPropertyList(const Value& root, std::string* error);

// Any root type; parse failures yield none with a reason.
std::optional<Value> decodePropertyList(const void* bytes, size_t length, std::string* error);

}  // namespace vsl
