#include "Client/VSLContainerInfo.h"

namespace vsl::client {

namespace {
VSLReply send(VSLConnection& connection, Dictionary request) {
    return connection.sendRequest(Value::dictionary(std::move(request)));
}
}  // namespace

Dictionary identityRequest(uint64_t command, const VSLContainerRef& container) {
    Dictionary request{{"Command", Value::uint64(command)},
                       {"Identifier", Value::string(container.identifier)},
                       {"ContainerClass", Value::uint64(container.containerClass)},
                       {"UUID", Value::uuid(container.uuid)}};
    if (container.personaUniqueString)
        request["PersonaUniqueString"] = Value::string(*container.personaUniqueString);
    return request;
}

uint64_t replyCode(const VSLReply& reply) {
    const Value* code = reply.ok() ? reply.body.find("ReplyError") : nullptr;
    return code && code->uint64Value() ? *code->uint64Value() : 0;
}

VSLReply setInfoValue(VSLConnection& connection, const VSLContainerRef& container, const std::string& key,
                      const std::optional<Value>& value) {
    Dictionary request = identityRequest(5, container);
    request["Key"] = Value::string(key);
    if (value) request["Value"] = *value;
    return send(connection, std::move(request));
}

VSLReply infoValueForKey(VSLConnection& connection, const VSLContainerRef& container, const std::string& key) {
    Dictionary request = identityRequest(6, container);
    request["Key"] = Value::string(key);
    return send(connection, std::move(request));
}

VSLReply metadata(VSLConnection& connection, const VSLContainerRef& container, bool infoDictionary) {
    Dictionary request = identityRequest(7, container);
    request["InfoDictRequested"] = Value::boolean(infoDictionary);
    return send(connection, std::move(request));
}

VSLReply recreateDefaultStructure(VSLConnection& connection, const VSLContainerRef& container) {
    return send(connection, identityRequest(8, container));
}

VSLReply regenerateDirectoryUUID(VSLConnection& connection, const VSLContainerRef& container) {
    return send(connection, identityRequest(9, container));
}

VSLReply diskUsage(VSLConnection& connection, const VSLContainerRef& container) {
    return send(connection, identityRequest(23, container));
}

VSLReply setTestLock(VSLConnection& connection, uint64_t lock, bool enable) {
    return send(connection, {{"Command", Value::uint64(31)},
                             {"TestLock", Value::uint64(lock)},
                             {"Enable", Value::boolean(enable)}});
}

VSLReply retryTest(VSLConnection& connection, uint64_t numRetryCrashes) {
    return send(connection, {{"Command", Value::uint64(25)}, {"NumRetryCrashes", Value::uint64(numRetryCrashes)}});
}

}  // namespace vsl::client
