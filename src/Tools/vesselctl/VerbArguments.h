// The words after a subcommand: positional words, key=value arguments (typed as the
// raw commands type them) and, for the verbs, --class CLASS.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Platform/Value.h"

struct VerbArguments {
    std::vector<std::string> positional;
    std::optional<uint64_t> containerClass;  // --class
    vsl::Dictionary keys;                    // key=value, added to the request last
};

// One key=value argument; an untyped key the protocol does not have is refused
// (key:type=value sends any key).
std::optional<std::pair<std::string, vsl::Value>> parseKeyValue(const std::string& word, std::string* error);

// False with a reason for a malformed key=value or unknown key, an unknown class or, with
// `classOption`, an unknown --option (without it such words stay positional).
bool parseVerbArguments(const std::vector<std::string>& words, VerbArguments* out, std::string* error,
                        bool classOption = true);

// A container class by number, by its short name in the class table (any case), or by
// one of the words people use for the common ones: data, bundle, group, system.
std::optional<uint64_t> containerClassNamed(const std::string& name);

// A decimal number, nothing else.
std::optional<uint64_t> parseNumber(const std::string& text);
