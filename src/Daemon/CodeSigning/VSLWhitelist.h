// The well-known containers: system and system-group containers whose identifiers
// the daemon knows in advance, and the lookups a few trusted executables may make
// beyond their entitlements. Built once, at first use, from VSLWhitelistTable.
#pragma once

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/Core/VSLContainerClass.h"
#include "Platform/Value.h"

namespace vsl {

// A lookup table after conversion: dictionaries keep their shape, arrays become
// sets, anything else stays as given (null is the marker for "everything").
struct VSLWhitelistNode {
    enum class Kind { Other, Set, Dictionary };
    Kind kind = Kind::Other;
    Value value;
    std::set<std::string> set;
    std::map<std::string, VSLWhitelistNode> dictionary;

    bool isEverything() const { return kind == Kind::Other && value.isNull(); }
};

class VSLWhitelist {
public:
    using IdentifierMapping = std::map<std::string, std::string>;

    // The process's instance (thread-safe); the internal-only group is included when
    // the global configuration says this is an internal build image.
    static std::shared_ptr<const VSLWhitelist> sharedWhitelist();

    // `whitelistedContainerMapping`: class number (decimal key) -> array of identifiers.
    // `whitelistedCodeSignIdentifierMapping`: code-signing identifier -> null (everything)
    // or a dictionary of class number -> null (everything) or array of identifiers.
    VSLWhitelist(IdentifierMapping systemContainerMapping, IdentifierMapping systemGroupContainerMapping,
                 const Value& whitelistedContainerMapping, const Value& whitelistedCodeSignIdentifierMapping);

    std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) const;
    std::optional<std::string> wellknownSystemGroupContainerForId(const std::string& identifier) const;
    bool systemContainerIdIsWellknown(const std::string& identifier) const;
    bool systemGroupContainerIdIsWellknown(const std::string& identifier) const;
    std::vector<std::string> wellknownSystemContainers() const;
    std::vector<std::string> wellknownSystemGroupContainers() const;
    // Class 12 and 13 only; every other class answers false.
    bool containerIdIsWellknown(const std::string& identifier, VSLContainerClass containerClass) const;
    // Class 13 asks the system-group table, every other class the system table.
    std::optional<std::string> wellknownContainerForId(const std::string& identifier,
                                                       VSLContainerClass containerClass) const;

    bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                   VSLContainerClass containerClass,
                                                   const std::string& containerIdentifier) const;

    // Depth-first with an explicit stack: arrays become sets at every level.
    static VSLWhitelistNode _convertArraysToSetsInNestedDictionary(const Value& dictionary);

private:
    std::array<std::optional<std::set<std::string>>, kVSLClassMax> whitelistedLookupByContainer_;
    VSLWhitelistNode whitelistedLookupByCodeSignIdentifier_;
    IdentifierMapping systemWhitelist_;
    IdentifierMapping systemGroupWhitelist_;
};

}  // namespace vsl
