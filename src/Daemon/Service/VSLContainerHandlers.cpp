#include "Daemon/Service/VSLContainerHandlers.h"

#include "Daemon/Service/VSLRequestDecoding.h"
#include "Daemon/Storage/VSLMetadata.h"

namespace vsl {

void handleCreateOrLookup(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                          uint64_t* code) {
    auto identity = identityFromRequest(request, nullptr, nullptr, *connection, code);
    if (!identity) return;
    bool create = boolFromRequest(request, "CreateIfNecessary").value_or(false);
    bool transient = boolFromRequest(request, "Transient").value_or(false);
    auto metadata = connection->createOrLookupContainerWithContainerIdentity(identity, create, transient, true, code);
    if (!metadata) return;
    reply->set("ReplyUUID", Value::uuid(metadata->uuid()));
    reply->set("ReplyExisted", Value::boolean(metadata->existed()));
    reply->set("ReplyPath", Value::string(metadata->url()));
    reply->set("ReplyIdentifier", Value::string(metadata->identifier()));
    if (metadata->userIdentity() && metadata->userIdentity()->personaUniqueString())
        reply->set("ReplyPersonaUniqueString", Value::string(*metadata->userIdentity()->personaUniqueString()));
    issueSandboxExtension(*reply, "ReplySandboxToken", *metadata, connection->clientIdentity());
}

void handleContainersWithClass(const Value& request, const VSLReplyRef& reply,
                               const VSLClientConnectionRef& connection, uint64_t* code) {
    VSLContainerClass c = uint64FromRequest(request, "ContainerClass").value_or(0);
    bool transient = boolFromRequest(request, "Transient").value_or(false);
    auto all = connection->containersWithClass(c, transient, code);
    if (!all) return;
    Array ids, uuids, personas;
    for (const auto& m : *all) {
        ids.push_back(Value::string(m->identifier()));
        uuids.push_back(Value::uuid(m->uuid()));
        const auto& u = m->userIdentity();
        personas.push_back(Value::string(u && u->personaUniqueString() ? *u->personaUniqueString() : ""));
    }
    reply->set("ReplyIdsArray", Value::array(std::move(ids)));
    reply->set("ReplyUUIDsArray", Value::array(std::move(uuids)));
    reply->set("ReplyPersonaUniqueStringsArray", Value::array(std::move(personas)));
}

void handleDeleteContainer(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                           uint64_t* code) {
    auto identity = identityFromRequest(request, "Identifier", nullptr, *connection, code);
    if (!identity) return;
    connection->deleteContainerWithContainerIdentity(identity, boolFromRequest(request, "Transient").value_or(false),
                                                     code);
}

}  // namespace vsl

namespace vsl {

void handleDeleteContainersOnDeathRow(const Value&, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                                      uint64_t*) {
    connection->deleteContainersOnDeathRowWithCompletion([reply](uint64_t result) { reply->sendWithCode(result); });
}

}  // namespace vsl
