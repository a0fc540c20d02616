// Typed request arguments from "key=value" text, as vesselctl takes them. Known
// keys of the protocol have their types; "key:type=value" names a type explicitly:
// str, u64, i64, bool, uuid, null, plist (value "@FILE": a property-list file),
// and list types u64s, strs, uuids (comma-separated).
#pragma once

#include <optional>
#include <string>
#include <utility>

#include "Platform/Value.h"

namespace vsl::client {

std::optional<std::pair<std::string, Value>> parseArgument(const std::string& text, std::string* error);

// Whether the protocol has a request key of this name.
bool isRequestKey(const std::string& key);

// Renders a reply for people ("Key: value" lines) or as JSON.
std::string renderHuman(const Value& reply);
std::string renderJson(const Value& value);

}  // namespace vsl::client
