// One identifier's code-signing record: its code-signing information dictionary
// (entitlements live inside it), its child bundles, a few flags and the class of
// its data container. A plain value.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Value.h"

namespace vsl {

// Where the entitlements sit inside the code-signing information.
extern const char* const kVSLEntitlementsKey;  // "com.tarrow.Vesselry.Entitlements"

class VSLCodeSigningEntry {
public:
    VSLCodeSigningEntry() = default;
    // Children none, every flag false.
    static VSLCodeSigningEntry initWithCodeSigningInfo(std::optional<Value> codeSigningInfo,
                                                       uint64_t dataContainerClass = 0);

    // The dictionary form of the older file-based store; missing keys read as
    // false / 0 / none. None when `dictionary` is not a dictionary.
    static std::optional<VSLCodeSigningEntry> initWithSerializedDictionary(const Value& dictionary);
    Value serialize() const;

    // The entitlements dictionary inside the information, or null.
    const Value* entitlements() const;

    bool isEqual(const VSLCodeSigningEntry& other) const;
    bool operator==(const VSLCodeSigningEntry& other) const { return isEqual(other); }
    size_t hash() const;
    std::string description() const;

    std::optional<Value> codeSigningInfo;  // a dictionary, or none
    std::optional<std::vector<std::string>> childBundleIdentifiers;
    bool invalid = false;
    bool placeholder = false;
    bool advanceCopy = false;
    bool registeredByCaller = false;
    uint64_t dataContainerClass = 0;
};

// An optional list of strings as an array value (null for none); for logs.
Value stringListValue(const std::optional<std::vector<std::string>>& list);

}  // namespace vsl
