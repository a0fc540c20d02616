#include "Daemon/Service/VSLRequestDecoding.h"

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"

namespace vsl {

std::optional<std::string> stringFromRequest(const Value& request, const char* key) {
    const Value* v = request.find(key);
    if (!v || !v->stringValue()) return std::nullopt;
    return *v->stringValue();
}

std::optional<uint64_t> uint64FromRequest(const Value& request, const char* key) {
    const Value* v = request.find(key);
    return v ? v->uint64Value() : std::nullopt;
}

std::optional<bool> boolFromRequest(const Value& request, const char* key) {
    const Value* v = request.find(key);
    return v ? v->boolValue() : std::nullopt;
}

std::optional<Value> objectFromRequest(const Value& request, const char* key) {
    const Value* v = request.find(key);
    if (!v || v->isNull()) return std::nullopt;
    return *v;
}

std::optional<std::string> identifierFromRequest(const Value& request, const std::optional<std::string>& fallback) {
    if (auto s = stringFromRequest(request, "Identifier")) return s;
    return fallback;
}

namespace {

// The host's multi-user flag; a device without the notion is single-user.
bool isMultiUserDevice() { return deviceFacts().multiUser; }

// With no key name "Identifier" defaults to the client's own; a named key has no default.
std::optional<std::string> requestIdentifier(const Value& request, const char* identifierKey,
                                             VSLClientConnection& connection, uint64_t* code) {
    auto identifier = identifierKey ? stringFromRequest(request, identifierKey)
                                    : identifierFromRequest(request, connection.clientBundleIdentifier());
    if (!identifier && code) *code = kVSLErrorMissingIdentifier;
    return identifier;
}

VSLUserIdentityRef clientUserIdentity(VSLClientConnection& connection) {
    return connection.clientIdentity() ? connection.clientIdentity()->userIdentity() : nullptr;
}

}  // namespace

VSLUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& personaUniqueString,
                                                      VSLClientConnection& connection, uint64_t* code) {
    VSLUserIdentityRef own = clientUserIdentity(connection);
    if (isMultiUserDevice()) return own;
    auto resolved =
        VSLUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentUserWithPersonaUniqueString(
            personaUniqueString);
    if (!resolved) {
        osLog(LogCategory::Ipc, OSLogLevel::Error,
              "Cannot reconstitute a user identity from provided persona unique string; client = [%@], "
              "personaUniqueString = [%@]",
              connection.clientIdentity(), personaUniqueString);
        if (code) *code = kVSLErrorWrongPersona;
        return nullptr;
    }
    if (own && (own->isNoSpecificPersona() || own->isEqual(*resolved))) return resolved;
    osLog(LogCategory::Ipc, OSLogLevel::Error,
          "Persona unique string is not valid for this client; client = [%@], personaUniqueString = [%@]",
          connection.clientIdentity(), personaUniqueString);
    if (code) *code = kVSLErrorWrongPersona;
    return nullptr;
}

VSLUserIdentityRef userIdentityForContainerIdentifier(VSLClientConnection& connection, const std::string& identifier,
                                                      VSLContainerClass containerClass, uint64_t* code) {
    VSLUserIdentityRef own = clientUserIdentity(connection);
    if (!own) {
        if (code) *code = kVSLErrorWrongPersona;
        return nullptr;
    }
    if (!isPerUserContainerClass(containerClass) || !own->isNoSpecificPersona()) return own;

    std::string bundleIdentifier =
        isChildDataContainerClass(containerClass) ? installedBundleIdentifier(identifier) : identifier;
    size_t installed = 0;
    std::string listed;
    auto chosen = chooseInstalledUserIdentity(connection, bundleIdentifier, &installed, &listed);
    osLog(LogCategory::Ipc, OSLogLevel::Debug,
          "Chose bundleIdentifier: %@, userIdentities: %@ for identifier: %@, class: %llu", bundleIdentifier, listed,
          identifier, containerClass);
    if (chosen) return chosen;
    if (installed >= 2) return own;  // ambiguous: the client's own, after all
    LogWrite(kLogLevelError, "userIdentityForContainerIdentifier", "%@ trying to look up persona for %llu:%@",
             connection.clientIdentity(), containerClass, identifier);
    return own;
}

std::string installedBundleIdentifier(const std::string& identifier) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    auto parent = mapping ? mapping->parentIdentifierForChildIdentifier(identifier) : std::nullopt;
    return parent.value_or(identifier);
}

VSLUserIdentityRef chooseInstalledUserIdentity(VSLClientConnection& connection, const std::string& bundleIdentifier,
                                               size_t* installed, std::string* listed) {
    VSLUserIdentityRef own = clientUserIdentity(connection);
    auto identities = VSLUserIdentitySharedCache::sharedInstance()->userIdentitiesForBundleIdentifier(bundleIdentifier);
    *installed = identities.size();
    listed->clear();
    for (const auto& u : identities) *listed += (listed->empty() ? "" : ", ") + u->shortDescription();
    if (identities.size() == 1) return *identities.begin();
    if (identities.empty()) return nullptr;
    for (const auto& u : identities)
        if (own && u->isEqual(*own)) return own;
    osLog(LogCategory::Ipc, OSLogLevel::Fault, "Ambiguous user identity from [%@]. Expected one of [%@], got %@",
          connection.clientIdentity(), *listed, own);
    return nullptr;
}

VSLConcreteContainerIdentityRef concreteIdentityFromRequest(const Value& request, const char* identifierKey,
                                                            const char* classKey, const char* uuidKey,
                                                            const char* personaKey, VSLClientConnection& connection,
                                                            uint64_t* code) {
    auto identifier = requestIdentifier(request, identifierKey, connection, code);
    if (!identifier) return nullptr;
    VSLContainerClass containerClass = uint64FromRequest(request, classKey ? classKey : "ContainerClass").value_or(0);
    const Value* uuid = request.find(uuidKey ? uuidKey : "UUID");

    VSLUserIdentityRef userIdentity;
    uint64_t personaCode = 1;
    if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        userIdentity = userIdentityForPersonaUniqueString(
            stringFromRequest(request, personaKey ? personaKey : "PersonaUniqueString"), connection, &personaCode);
    } else {
        userIdentity = clientUserIdentity(connection);
    }
    if (!userIdentity) {
        if (code) *code = personaCode != 1 ? personaCode : kVSLErrorWrongPersona;
        return nullptr;
    }
    return VSLConcreteContainerIdentity::containerIdentityWithUUID(uuid ? *uuid : Value(), userIdentity,
                                                                   Value::string(*identifier), containerClass, code);
}

VSLConcreteContainerIdentityRef concreteIdentityFromRequestIdentifier(const Value& request,
                                                                      VSLClientConnection& connection,
                                                                      uint64_t* code) {
    return concreteIdentityFromRequest(request, "Identifier", nullptr, nullptr, nullptr, connection, code);
}

VSLContainerIdentityRef identityFromRequest(const Value& request, const char* identifierKey, const char* classKey,
                                            VSLClientConnection& connection, uint64_t* code) {
    auto identifier = requestIdentifier(request, identifierKey, connection, code);
    if (!identifier) return nullptr;
    VSLContainerClass containerClass = uint64FromRequest(request, classKey ? classKey : "ContainerClass").value_or(0);
    if (!isValidContainerClass(containerClass)) {
        if (code) *code = kVSLErrorUnexpectedClass;
        return nullptr;
    }
    auto userIdentity = userIdentityForContainerIdentifier(connection, *identifier, containerClass, code);
    if (!userIdentity) return nullptr;
    return VSLContainerIdentity::containerIdentityWithUserIdentity(userIdentity, *identifier, containerClass, code);
}

void listAccessiblePersonas(const Value&, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                            uint64_t* code) {
    Array strings;
    VSLUserIdentityRef own = clientUserIdentity(*connection);
    if (own && own->isNoSpecificPersona()) {
        VSLUserIdentitySharedCache::sharedInstance()->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [&](const VSLUserIdentityRef& u) {
                if (u && u->personaUniqueString()) strings.push_back(Value::string(*u->personaUniqueString()));
            });
    } else if (own && own->personaUniqueString()) {
        strings.push_back(Value::string(*own->personaUniqueString()));
    }
    reply->set("ReplyPersonaUniqueStringsArray", Value::array(std::move(strings)));
    (void)code;
}

}  // namespace vsl
