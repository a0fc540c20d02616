#include "Daemon/Service/VSLContainerHandlers.h"

#include "Daemon/Concurrency/VSLCommandStageForDelete.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLRequestDecoding.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// A key of another type reads as absent: an empty array.
const Array& arrayFromRequest(const Value& request, const char* key) {
    static const Array kEmpty;
    const Value* v = request.find(key);
    const Array* a = v ? v->arrayValue() : nullptr;
    return a ? *a : kEmpty;
}

}  // namespace

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

void handleStageContainerForDelete(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                   uint64_t* code) {
    const Array& classes = arrayFromRequest(request, "ContainerClassesArray");
    const Array& uuids = arrayFromRequest(request, "UUIDsArray");
    const Array& identifiers = arrayFromRequest(request, "IdentifiersArray");
    const Array& personas = arrayFromRequest(request, "PersonaUniqueStringsArray");
    const size_t count = uuids.size();
    if (classes.size() != count || identifiers.size() != count || personas.size() != count) {
        LogWrite(kLogLevelError, "stageContainerForDelete",
                 "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %lu, persona "
                 "string count: %lu",
                 static_cast<long>(count), static_cast<long>(classes.size()),
                 static_cast<unsigned long>(identifiers.size()), static_cast<unsigned long>(personas.size()));
        *code = kVSLErrorInvalidArgument;
        return;
    }
    std::vector<VSLContainerIdentityRef> identities;
    for (size_t i = 0; i < count; i++) {
        const VSLContainerClass containerClass = classes[i].uint64Value().value_or(0);
        VSLUserIdentityRef userIdentity;
        uint64_t userCode = kVSLSuccess;
        if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
            const std::string* persona = personas[i].stringValue();
            userIdentity = userIdentityForPersonaUniqueString(
                persona ? std::optional<std::string>(*persona) : std::nullopt, *connection, &userCode);
        } else {
            userIdentity = VSLUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentContext();
        }
        // Without a user identity nothing of the batch is staged.
        if (!userIdentity) {
            *code = userCode != kVSLSuccess ? userCode : kVSLErrorWrongPersona;
            return;
        }
        uint64_t identityCode = kVSLSuccess;
        auto identity = VSLConcreteContainerIdentity::containerIdentityWithUUID(uuids[i], userIdentity, identifiers[i],
                                                                                containerClass, &identityCode);
        if (identity)
            identities.push_back(std::move(identity));
        else
            *code = identityCode;
    }
    if (identities.empty()) return;
    connection->commandQueue()->insertCommand(VSLCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        std::move(identities), true, nullptr));
}

void handleDeleteContainersOnDeathRow(const Value&, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                                      uint64_t*) {
    connection->deleteContainersOnDeathRowWithCompletion([reply](uint64_t result) { reply->sendWithCode(result); });
}

}  // namespace vsl
