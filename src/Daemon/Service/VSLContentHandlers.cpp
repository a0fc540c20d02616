#include "Daemon/Service/VSLContentHandlers.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLRequestDecoding.h"

namespace vsl {

namespace {

const Value& valueFromRequest(const Value& request, const char* key) {
    static const Value kNone;
    const Value* v = request.find(key);
    return v ? *v : kNone;
}

// The identity of `identifier` in a class the command fixes or reads, with the
// inferred persona rule. None without an identifier (the operation says why) or
// when the identity cannot be made (`code` set).
VSLContainerIdentityRef identityFor(const std::optional<std::string>& identifier, VSLContainerClass containerClass,
                                    VSLClientConnection& connection, uint64_t* code, bool* made) {
    *made = false;
    if (!identifier) return nullptr;
    auto user = userIdentityForContainerIdentifier(connection, *identifier, containerClass, code);
    if (!user) return nullptr;
    auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, *identifier, containerClass, code);
    *made = identity != nullptr;
    return identity;
}

void wipe(const Value& request, VSLContainerClass containerClass, VSLClientConnection& connection, uint64_t* code) {
    bool made = false;
    auto identity = identityFor(stringFromRequest(request, "Identifier"), containerClass, connection, code, &made);
    if (!made && *code != kVSLSuccess) return;
    connection.deleteDataContainerContentWithContainerIdentity(identity, code);
}

}  // namespace

void handleWipeContainer(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                         uint64_t* code) {
    wipe(request, kVSLClassPluginData, *connection, code);
}

void handleDeleteContainerContent(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                  uint64_t* code) {
    connection->setUnrestricted(true);
    wipe(request, uint64FromRequest(request, "ContainerClass").value_or(0), *connection, code);
}

void handleStageSharedContent(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                              uint64_t* code) {
    auto destination = connection->stageSharedContentForIdentifier(
        valueFromRequest(request, "Identifier"), valueFromRequest(request, "SourcePath"),
        valueFromRequest(request, "DestPath"), code);
    if (destination) reply->set("ReplyPath", Value::string(*destination));
}

void handleUserManagedAssetsPath(const Value& request, const VSLReplyRef& reply,
                                 const VSLClientConnectionRef& connection, uint64_t* code) {
    bool made = false;
    auto identifier = identifierFromRequest(request, connection->clientBundleIdentifier());
    auto identity = identityFor(identifier, kVSLClassApplicationData, *connection, code, &made);
    if (!made) {
        if (*code == kVSLSuccess) *code = kVSLErrorMissingIdentifier;
        return;
    }
    bool existed = false;
    auto path = connection->userManagedAssetsPathWithContainerIdentity(
        identity, boolFromRequest(request, "IsRelative").value_or(false),
        boolFromRequest(request, "CreateIfNecessary").value_or(false), &existed, code);
    if (!path) return;
    reply->set("ReplyPath", Value::string(*path));
    reply->set("ReplyExisted", Value::boolean(existed));
}

void handleDeleteUserManagedAsset(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                  uint64_t* code) {
    bool made = false;
    auto identity =
        identityFor(stringFromRequest(request, "Identifier"), kVSLClassApplicationData, *connection, code, &made);
    if (!made && *code != kVSLSuccess) return;
    connection->deleteUserManagedAssetWithContainerIdentity(identity, stringFromRequest(request, "SourcePath"), code);
}

}  // namespace vsl
