#include "Daemon/Service/VSLInfoHandlers.h"

#include "Daemon/Service/VSLRequestDecoding.h"
#include "Daemon/Storage/VSLMetadata.h"

namespace vsl {

namespace {
const Value& keyFromRequest(const Value& request) {
    static const Value kNone;
    const Value* key = request.find("Key");
    return key ? *key : kNone;
}
}  // namespace

void handleSetInfoValue(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                        uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    connection->setInfoValue(objectFromRequest(request, "Value"), keyFromRequest(request), identity, true, code);
}

void handleInfoValueForKey(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                           uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    auto value = connection->infoValueForKey(keyFromRequest(request), identity, true, code);
    if (value) reply->set("ReplyInfoValue", *value);
}

void handleMetadata(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                    uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    auto metadata = connection->metadataWithContainerIdentity(identity, code);
    if (!metadata) return;
    reply->set("ReplyPath", Value::string(metadata->url()));
    reply->set("ReplyTransient", Value::boolean(metadata->transient()));
    if (boolFromRequest(request, "InfoDictRequested").value_or(false) && metadata->info())
        reply->set("ReplyInfoDictionary", *metadata->info());
    issueSandboxExtension(*reply, "ReplySandboxToken", *metadata, connection->clientIdentity());
    const auto& user = metadata->userIdentity();
    if (user && user->personaUniqueString())
        reply->set("ReplyPersonaUniqueString", Value::string(*user->personaUniqueString()));
}

void handleRecreateDefaultStructure(const Value& request, const VSLReplyRef&,
                                    const VSLClientConnectionRef& connection, uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    connection->recreateDefaultStructureWithContainerIdentity(identity, code);
}

void handleRegenerateDirectoryUUID(const Value& request, const VSLReplyRef&,
                                   const VSLClientConnectionRef& connection, uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    connection->regenerateDirectoryUUIDWithContainerIdentity(identity, code);
}

void handleDiskUsage(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                     uint64_t* code) {
    auto identity = concreteIdentityFromRequestIdentifier(request, *connection, code);
    if (!identity) return;
    auto bytes = connection->diskUsageWithContainerIdentity(identity, code);
    if (bytes) reply->set("ReplyDiskUsage", Value::uint64(*bytes));
}

}  // namespace vsl
