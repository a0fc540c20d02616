#include "Client/VSLGroups.h"

#include "Client/VSLProtocol.h"

namespace vsl::client {

namespace {

VSLReply send(VSLConnection& connection, const char* command, const std::optional<std::string>& identifier,
              Dictionary extra = {}) {
    extra["Command"] = Value::uint64(*commandNumberForName(command));
    if (identifier) extra["Identifier"] = Value::string(*identifier);
    return connection.sendRequest(Value::dictionary(std::move(extra)));
}

}  // namespace

VSLReply createOrLookupGroupContainers(VSLConnection& connection, const std::optional<std::string>& owner) {
    return send(connection, "createOrLookupGroupContainers", owner);
}

VSLReply groupContainerIdentifiers(VSLConnection& connection, const std::optional<std::string>& owner) {
    return send(connection, "groupContainerIdentifiers", owner);
}

VSLReply systemContainerPath(VSLConnection& connection, const std::optional<std::string>& identifier) {
    return send(connection, "systemContainerPath", identifier);
}

VSLReply systemGroupContainers(VSLConnection& connection, const std::optional<std::string>& owner) {
    return send(connection, "systemGroupContainers", owner);
}

VSLReply systemGroupContainerPath(VSLConnection& connection, const std::string& groupIdentifier,
                                  const std::optional<std::string>& owner) {
    return send(connection, "systemGroupContainerPath", owner, {{"GroupIdentifier", Value::string(groupIdentifier)}});
}

std::map<std::string, std::string> groupStrings(const VSLReply& reply, const char* key) {
    std::map<std::string, std::string> out;
    const Value* v = reply.ok() ? reply.body.find(key) : nullptr;
    if (const Dictionary* d = v ? v->dictionaryValue() : nullptr)
        for (const auto& [group, item] : *d)
            if (item.stringValue()) out[group] = *item.stringValue();
    return out;
}

std::vector<std::string> groupIdentifiers(const VSLReply& reply) {
    std::vector<std::string> out;
    const Value* v = reply.ok() ? reply.body.find("ReplyGroupIdentifiersArray") : nullptr;
    if (const Array* a = v ? v->arrayValue() : nullptr)
        for (const auto& item : *a)
            if (item.stringValue()) out.push_back(*item.stringValue());
    return out;
}

}  // namespace vsl::client
