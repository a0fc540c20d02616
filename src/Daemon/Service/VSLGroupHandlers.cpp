#include "Daemon/Service/VSLGroupHandlers.h"

#include <algorithm>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/CodeSigning/VSLGroupManager.h"
#include "Daemon/CodeSigning/VSLWhitelist.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLRequestDecoding.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kGroupsLogName = "createOrLookupGroupContainers";
const char* const kSystemGroupLogName = "systemGroupContainerPath";
// Asked for by callers that are not entitled to it often enough to make the refusal noise.
const char* const kSilentlyRefusedSystemGroup = "systemgroup.com.tarrow.bellwort";

std::string ownerFromRequest(const Value& request, const VSLClientConnection& connection) {
    return *identifierFromRequest(request, connection.clientBundleIdentifier());
}

VSLUserIdentityRef clientUserIdentity(const VSLClientConnection& connection) {
    return connection.clientIdentity() ? connection.clientIdentity()->userIdentity() : nullptr;
}

// The persona whose groups a client outside personas gets: where the owner (or its
// host application) is installed. Unlike a plain lookup, ambiguity is an error.
VSLUserIdentityRef groupOwnerUserIdentity(VSLClientConnection& connection, const std::string& owner,
                                          uint64_t* code) {
    VSLUserIdentityRef own = clientUserIdentity(connection);
    if (!own) {
        *code = kVSLErrorWrongPersona;
        return nullptr;
    }
    if (!own->isNoSpecificPersona()) return own;
    std::string bundleIdentifier = installedBundleIdentifier(owner);
    size_t installed = 0;
    std::string listed;
    auto chosen = chooseInstalledUserIdentity(connection, bundleIdentifier, &installed, &listed);
    osLog(LogCategory::Ipc, OSLogLevel::Debug,
          "Chose bundleIdentifier: %@ for group container lookup, userIdentities: %@ for identifier: %@",
          bundleIdentifier, listed, owner);
    if (chosen) return chosen;
    *code = kVSLErrorWrongPersona;
    if (installed >= 2) return nullptr;  // ambiguous, logged as such
    LogWrite(kLogLevelError, kGroupsLogName, "%@ trying to look up persona for group owner %@",
             connection.clientIdentity(), owner);
    return nullptr;
}

Value pathDictionary(const std::map<std::string, VSLMetadataRef>& groups) {
    Dictionary paths;
    for (const auto& [group, metadata] : groups) paths[group] = Value::string(metadata->url());
    return Value::dictionary(std::move(paths));
}

}  // namespace

void handleCreateOrLookupGroupContainers(const Value& request, const VSLReplyRef& reply,
                                         const VSLClientConnectionRef& connection, uint64_t* code) {
    const std::string owner = ownerFromRequest(request, *connection);
    auto userIdentity = groupOwnerUserIdentity(*connection, owner, code);
    if (!userIdentity) return;
    auto groups = connection->groupContainersForOwnerIdentifier(owner, userIdentity, kVSLClassAppGroup, code);
    if (!groups) return;
    reply->set("ReplyGroupContainerDict", pathDictionary(*groups));

    const auto& client = connection->clientIdentity();
    if (!client || !client->sandboxed()) return;
    Dictionary tokens, personas;
    for (const auto& [group, metadata] : *groups) {
        if (auto token = sandboxExtensionForContainer(*metadata, client)) tokens[group] = Value::string(*token);
        const auto& user = metadata->userIdentity();
        if (user && user->personaUniqueString()) personas[group] = Value::string(*user->personaUniqueString());
    }
    if (!tokens.empty()) reply->set("ReplySandboxTokenDict", Value::dictionary(std::move(tokens)));
    if (!personas.empty()) reply->set("ReplyPersonaUniqueStringDict", Value::dictionary(std::move(personas)));
}

void handleGroupContainerIdentifiers(const Value& request, const VSLReplyRef& reply,
                                     const VSLClientConnectionRef& connection, uint64_t* code) {
    auto identifiers = VSLGroupManager::defaultManager()->groupContainerIdentifiersForOwnerIdentifier(
        Value::string(ownerFromRequest(request, *connection)), kVSLClassAppGroup, true, code);
    if (!identifiers) return;
    reply->set("ReplyGroupIdentifiersArray", stringListValue(*identifiers));
}

void handleSystemContainerPath(const Value& request, const VSLReplyRef& reply,
                               const VSLClientConnectionRef& connection, uint64_t* code) {
    const std::string identifier = ownerFromRequest(request, *connection);
    if (identifier != connection->clientBundleIdentifier() && !connection->allowOtherIdLookup() &&
        VSLWhitelist::sharedWhitelist()->systemContainerIdIsWellknown(identifier))
        connection->setAllowOtherIdLookup(true);
    auto userIdentity = userIdentityForContainerIdentifier(*connection, identifier, kVSLClassSystemData, code);
    if (!userIdentity) return;
    auto identity =
        VSLContainerIdentity::containerIdentityWithUserIdentity(userIdentity, identifier, kVSLClassSystemData, code);
    if (!identity) return;
    auto metadata = connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true, code);
    if (!metadata) return;
    reply->set("ReplyPath", Value::string(metadata->url()));
}

void handleSystemGroupContainers(const Value& request, const VSLReplyRef& reply,
                                 const VSLClientConnectionRef& connection, uint64_t* code) {
    const std::string owner = ownerFromRequest(request, *connection);
    auto userIdentity = userIdentityForContainerIdentifier(*connection, owner, kVSLClassSystemGroup, code);
    if (!userIdentity) return;
    auto groups = connection->groupContainersForOwnerIdentifier(owner, userIdentity, kVSLClassSystemGroup, code);
    if (!groups) return;
    reply->set("ReplyGroupContainerDict", pathDictionary(*groups));
}

void handleSystemGroupContainerPath(const Value& request, const VSLReplyRef& reply,
                                    const VSLClientConnectionRef& connection, uint64_t* code) {
    const std::string owner = ownerFromRequest(request, *connection);
    const std::optional<std::string> group = stringFromRequest(request, "GroupIdentifier");
    const std::string client = connection->clientBundleIdentifier();
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    const std::vector<std::string> entitled =
        (mapping ? mapping->systemGroupIdentifiersForIdentifier(client) : std::nullopt).value_or(
            std::vector<std::string>{});
    osLog(LogCategory::Ipc, OSLogLevel::Debug, "Group ID: %@, bundle ID: %@, entitled group container IDs: %@", group,
          client, stringListValue(entitled));

    uint64_t userCode = kVSLSuccess;
    auto userIdentity = userIdentityForContainerIdentifier(*connection, owner, kVSLClassSystemGroup, &userCode);
    if (!userIdentity) {
        LogWrite(kLogLevelError, kSystemGroupLogName,
                 "Could not generate a user identity for bundle: %@, class: %llu, error: %llu", owner,
                 static_cast<unsigned long long>(kVSLClassSystemGroup), userCode);
        *code = userCode;
        return;
    }

    std::optional<std::string> path;
    if (group && std::find(entitled.begin(), entitled.end(), *group) != entitled.end()) {
        uint64_t queryCode = kVSLSuccess;
        auto groups =
            connection->groupContainersForOwnerIdentifier(owner, userIdentity, kVSLClassSystemGroup, &queryCode);
        if (!groups) {
            LogWrite(kLogLevelError, kSystemGroupLogName,
                     "No results returned for group container query for identity: %@, error: %llu", userIdentity,
                     queryCode);
        } else if (auto it = groups->find(*group); it != groups->end()) {
            path = it->second->url();
        }
    } else if ((group && VSLWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown(*group)) ||
               connection->allowGroupIdLookup()) {
        connection->setAllowGroupIdLookup(true);
        uint64_t identityCode = kVSLSuccess;
        auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(
            userIdentity, group ? Value::string(*group) : Value(), kVSLClassSystemGroup, &identityCode);
        if (!identity) {
            LogWrite(kLogLevelError, kSystemGroupLogName,
                     "Could not generate a container identity for system group lookup identifier: %@, class: %llu, "
                     "userIdentity: %@, error: %llu",
                     group, static_cast<unsigned long long>(kVSLClassSystemGroup), userIdentity, identityCode);
            *code = identityCode;
            return;
        }
        uint64_t lookupCode = kVSLSuccess;
        if (auto metadata = connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true,
                                                                                     &lookupCode)) {
            path = metadata->url();
        } else {
            LogWrite(kLogLevelError, kSystemGroupLogName,
                     "No results returned for system group lookup identity: %@, error: %llu", identity, lookupCode);
        }
    } else {
        if (group != kSilentlyRefusedSystemGroup)
            LogWrite(kLogLevelError, kSystemGroupLogName,
                     "%@ is not entitled for system group identifier: %@.  Only entitled for: %@", client, group,
                     stringListValue(entitled));
        *code = kVSLErrorNotEntitled;
        return;
    }
    if (!path) {
        LogWrite(kLogLevelError, kSystemGroupLogName, "Did not find system group container with identifier: %@ for %@",
                 group, owner);
        *code = kVSLErrorNotFound;
        return;
    }
    reply->set("ReplyPath", Value::string(*path));
}

}  // namespace vsl
