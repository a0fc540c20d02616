#include "Daemon/CodeSigning/VSLWhitelist.h"

#include <utility>

#include "Daemon/CodeSigning/VSLWhitelistTable.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"

namespace vsl {

namespace {

std::optional<std::string> lookup(const VSLWhitelist::IdentifierMapping& mapping, const std::string& identifier) {
    auto it = mapping.find(identifier);
    if (it == mapping.end()) return std::nullopt;
    return it->second;
}

std::vector<std::string> keys(const VSLWhitelist::IdentifierMapping& mapping) {
    std::vector<std::string> out;
    for (const auto& [k, v] : mapping) out.push_back(k);
    return out;
}

std::set<std::string> setOfStrings(const Array& items) {
    std::set<std::string> out;
    for (const Value& item : items)
        if (item.stringValue()) out.insert(*item.stringValue());
    return out;
}

std::shared_ptr<const VSLWhitelist> buildSharedWhitelist() {
    VSLWhitelist::IdentifierMapping system;
    for (const char* id : kVSLWellKnownSystemContainers) system[id] = id;
    VSLWhitelist::IdentifierMapping systemGroup;
    for (const char* id : kVSLWellKnownSystemGroupContainers) systemGroup[id] = id;
    if (VSLGlobalConfiguration::sharedInstance()->isInternalImage())
        systemGroup[kVSLInternalSystemGroupContainer] = kVSLInternalSystemGroupContainer;

    Dictionary byContainer;
    for (const auto& row : kVSLLookupByContainer) {
        Value& slot = byContainer[std::to_string(row.containerClass)];
        Array items = slot.arrayValue() ? *slot.arrayValue() : Array();
        items.push_back(Value::string(row.containerIdentifier));
        slot = Value::array(std::move(items));
    }

    Dictionary byCaller;
    for (const auto& row : kVSLLookupByCodeSignIdentifier) {
        if (row.containerClass == kVSLClassUndefined) {
            byCaller[row.codeSigningIdentifier] = Value();
            continue;
        }
        const Value& existing = byCaller[row.codeSigningIdentifier];
        Dictionary classes = existing.dictionaryValue() ? *existing.dictionaryValue() : Dictionary();
        std::string key = std::to_string(row.containerClass);
        if (!row.containerIdentifier) {
            classes[key] = Value();
        } else {
            Array items = classes[key].arrayValue() ? *classes[key].arrayValue() : Array();
            items.push_back(Value::string(row.containerIdentifier));
            classes[key] = Value::array(std::move(items));
        }
        byCaller[row.codeSigningIdentifier] = Value::dictionary(std::move(classes));
    }
    return std::make_shared<const VSLWhitelist>(std::move(system), std::move(systemGroup),
                                                Value::dictionary(std::move(byContainer)),
                                                Value::dictionary(std::move(byCaller)));
}

}  // namespace

std::shared_ptr<const VSLWhitelist> VSLWhitelist::sharedWhitelist() {
    static const std::shared_ptr<const VSLWhitelist> instance = buildSharedWhitelist();
    return instance;
}

VSLWhitelist::VSLWhitelist(IdentifierMapping systemContainerMapping, IdentifierMapping systemGroupContainerMapping,
                           const Value& whitelistedContainerMapping, const Value& whitelistedCodeSignIdentifierMapping)
    : systemWhitelist_(std::move(systemContainerMapping)),
      systemGroupWhitelist_(std::move(systemGroupContainerMapping)) {
    for (VSLContainerClass c = 0; c < kVSLClassMax; c++) {
        const Value* items = whitelistedContainerMapping.find(std::to_string(c));
        if (items && items->arrayValue()) whitelistedLookupByContainer_[c] = setOfStrings(*items->arrayValue());
    }
    whitelistedLookupByCodeSignIdentifier_ =
        _convertArraysToSetsInNestedDictionary(whitelistedCodeSignIdentifierMapping);
}

VSLWhitelistNode VSLWhitelist::_convertArraysToSetsInNestedDictionary(const Value& dictionary) {
    VSLWhitelistNode top;
    top.kind = VSLWhitelistNode::Kind::Dictionary;
    if (!dictionary.dictionaryValue()) return top;
    std::vector<std::pair<const Dictionary*, std::map<std::string, VSLWhitelistNode>*>> stack{
        {dictionary.dictionaryValue(), &top.dictionary}};
    while (!stack.empty()) {
        auto [source, destination] = stack.back();
        stack.pop_back();
        for (const auto& [key, value] : *source) {
            VSLWhitelistNode& node = (*destination)[key];
            if (const Dictionary* nested = value.dictionaryValue()) {
                node.kind = VSLWhitelistNode::Kind::Dictionary;
                stack.emplace_back(nested, &node.dictionary);
            } else if (const Array* items = value.arrayValue()) {
                node.kind = VSLWhitelistNode::Kind::Set;
                node.set = setOfStrings(*items);
            } else {
                node.value = value;
            }
        }
    }
    return top;
}

std::optional<std::string> VSLWhitelist::wellknownSystemContainerForId(const std::string& identifier) const {
    return lookup(systemWhitelist_, identifier);
}

std::optional<std::string> VSLWhitelist::wellknownSystemGroupContainerForId(const std::string& identifier) const {
    return lookup(systemGroupWhitelist_, identifier);
}

bool VSLWhitelist::systemContainerIdIsWellknown(const std::string& identifier) const {
    return systemWhitelist_.count(identifier) != 0;
}

bool VSLWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) const {
    return systemGroupWhitelist_.count(identifier) != 0;
}

std::vector<std::string> VSLWhitelist::wellknownSystemContainers() const {
    return keys(systemWhitelist_);
}

std::vector<std::string> VSLWhitelist::wellknownSystemGroupContainers() const {
    return keys(systemGroupWhitelist_);
}

bool VSLWhitelist::containerIdIsWellknown(const std::string& identifier, VSLContainerClass containerClass) const {
    if (containerClass == kVSLClassSystemData) return systemContainerIdIsWellknown(identifier);
    if (containerClass == kVSLClassSystemGroup) return systemGroupContainerIdIsWellknown(identifier);
    return false;
}

std::optional<std::string> VSLWhitelist::wellknownContainerForId(const std::string& identifier,
                                                                 VSLContainerClass containerClass) const {
    if (containerClass == kVSLClassSystemGroup) return wellknownSystemGroupContainerForId(identifier);
    return wellknownSystemContainerForId(identifier);
}

bool VSLWhitelist::isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                             VSLContainerClass containerClass,
                                                             const std::string& containerIdentifier) const {
    if (containerClass >= kVSLClassMax) return false;
    const auto& byContainer = whitelistedLookupByContainer_[containerClass];
    if (byContainer && byContainer->count(containerIdentifier)) return true;
    auto caller = whitelistedLookupByCodeSignIdentifier_.dictionary.find(codeSignIdentifier);
    if (caller == whitelistedLookupByCodeSignIdentifier_.dictionary.end()) return false;
    if (caller->second.isEverything()) return true;
    if (caller->second.kind != VSLWhitelistNode::Kind::Dictionary) return false;
    auto classEntry = caller->second.dictionary.find(std::to_string(containerClass));
    if (classEntry == caller->second.dictionary.end()) return false;
    if (classEntry->second.isEverything()) return true;
    return classEntry->second.kind == VSLWhitelistNode::Kind::Set && classEntry->second.set.count(containerIdentifier);
}

}  // namespace vsl
