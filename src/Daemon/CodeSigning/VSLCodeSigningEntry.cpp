#include "Daemon/CodeSigning/VSLCodeSigningEntry.h"

#include <functional>

#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
#include "Platform/Log.h"

namespace vsl {

const char* const kVSLEntitlementsKey = "com.tarrow.Vesselry.Entitlements";

namespace {

const char* const kInfoKey = "CodeSigningInfo";
const char* const kChildrenKey = "ChildBundleIds";
const char* const kInvalidKey = "Invalid";
const char* const kPlaceholderKey = "Placeholder";
const char* const kAdvanceCopyKey = "AdvanceCopy";
const char* const kRegisteredByCallerKey = "RegisteredByCaller";
const char* const kDataContainerClassKey = "DataContainerClass";

bool flag(const Value& dictionary, const char* key) {
    return propertyListTruthValue(dictionary.find(key));
}

}  // namespace

Value stringListValue(const std::optional<std::vector<std::string>>& list) {
    if (!list) return Value();
    Array items;
    items.reserve(list->size());
    for (const auto& s : *list) items.push_back(Value::string(s));
    return Value::array(std::move(items));
}

VSLCodeSigningEntry VSLCodeSigningEntry::initWithCodeSigningInfo(std::optional<Value> codeSigningInfo,
                                                                 uint64_t dataContainerClass) {
    VSLCodeSigningEntry entry;
    entry.codeSigningInfo = std::move(codeSigningInfo);
    entry.dataContainerClass = dataContainerClass;
    return entry;
}

std::optional<VSLCodeSigningEntry> VSLCodeSigningEntry::initWithSerializedDictionary(const Value& dictionary) {
    if (!dictionary.isDictionary()) return std::nullopt;
    VSLCodeSigningEntry entry;
    if (const Value* info = dictionary.find(kInfoKey); info && info->isDictionary()) entry.codeSigningInfo = *info;
    if (const Value* children = dictionary.find(kChildrenKey); children && children->arrayValue()) {
        entry.childBundleIdentifiers.emplace();
        for (const Value& child : *children->arrayValue())
            if (child.stringValue()) entry.childBundleIdentifiers->push_back(*child.stringValue());
    }
    entry.invalid = flag(dictionary, kInvalidKey);
    entry.placeholder = flag(dictionary, kPlaceholderKey);
    entry.advanceCopy = flag(dictionary, kAdvanceCopyKey);
    entry.registeredByCaller = flag(dictionary, kRegisteredByCallerKey);
    if (const Value* c = dictionary.find(kDataContainerClassKey))
        entry.dataContainerClass = c->unsignedNumber().value_or(0);
    return entry;
}

Value VSLCodeSigningEntry::serialize() const {
    Dictionary d;
    if (codeSigningInfo) d[kInfoKey] = *codeSigningInfo;
    if (childBundleIdentifiers) d[kChildrenKey] = stringListValue(childBundleIdentifiers);
    d[kInvalidKey] = Value::uint64(invalid);
    d[kPlaceholderKey] = Value::uint64(placeholder);
    d[kAdvanceCopyKey] = Value::uint64(advanceCopy);
    d[kRegisteredByCallerKey] = Value::uint64(registeredByCaller);
    d[kDataContainerClassKey] = Value::uint64(dataContainerClass);
    return Value::dictionary(std::move(d));
}

const Value* VSLCodeSigningEntry::entitlements() const {
    if (!codeSigningInfo) return nullptr;
    const Value* e = codeSigningInfo->find(kVSLEntitlementsKey);
    return e && !e->isNull() ? e : nullptr;
}

bool VSLCodeSigningEntry::isEqual(const VSLCodeSigningEntry& other) const {
    if (codeSigningInfo.has_value() != other.codeSigningInfo.has_value()) return false;
    if (codeSigningInfo && !propertyListValuesEqual(*codeSigningInfo, *other.codeSigningInfo)) return false;
    return childBundleIdentifiers == other.childBundleIdentifiers && invalid == other.invalid &&
           placeholder == other.placeholder && advanceCopy == other.advanceCopy &&
           registeredByCaller == other.registeredByCaller && dataContainerClass == other.dataContainerClass;
}

size_t VSLCodeSigningEntry::hash() const {
    size_t h = codeSigningInfo ? propertyListHash(*codeSigningInfo) : 0;
    if (childBundleIdentifiers) h ^= propertyListHash(stringListValue(childBundleIdentifiers));
    if (invalid) h += 2;
    if (placeholder) h += 4;
    if (registeredByCaller) h += 8;
    if (dataContainerClass != 0) h += 16;
    if (advanceCopy) h += 32;
    return h;
}

std::string VSLCodeSigningEntry::description() const {
    auto yn = [](bool b) { return b ? 'Y' : 'N'; };
    return formatLog(
        "<%@ invalid: %c, placeholder: %c, advanceCopy: %c, regByCaller: %c, dataClass: %llu, childBundles: %@, "
        "CSinfo: %@>",
        "VSLCodeSigningEntry", yn(invalid), yn(placeholder), yn(advanceCopy), yn(registeredByCaller),
        dataContainerClass,
        childBundleIdentifiers ? std::optional<Value>(stringListValue(childBundleIdentifiers)) : std::nullopt,
        codeSigningInfo);
}

}  // namespace vsl
