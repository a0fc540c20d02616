// Request keys -> container identities, under the persona rules, and the small
// helpers that move values between messages and the daemon's types.
#pragma once

#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReply.h"
#include "Platform/Value.h"

namespace vsl {

std::optional<std::string> stringFromRequest(const Value& request, const char* key);
std::optional<uint64_t> uint64FromRequest(const Value& request, const char* key);
std::optional<bool> boolFromRequest(const Value& request, const char* key);
std::optional<Value> objectFromRequest(const Value& request, const char* key);
std::optional<std::string> identifierFromRequest(const Value& request, const std::optional<std::string>& fallback);

// Key names left null fall back to "ContainerClass", "UUID", "PersonaUniqueString";
// with no identifier key, "Identifier" defaults to the client's bundle identifier.
VSLConcreteContainerIdentityRef concreteIdentityFromRequest(const Value& request, const char* identifierKey,
                                                            const char* classKey, const char* uuidKey,
                                                            const char* personaKey, VSLClientConnection& connection,
                                                            uint64_t* code);
VSLConcreteContainerIdentityRef concreteIdentityFromRequestIdentifier(const Value& request,
                                                                      VSLClientConnection& connection,
                                                                      uint64_t* code);
VSLContainerIdentityRef identityFromRequest(const Value& request, const char* identifierKey, const char* classKey,
                                            VSLClientConnection& connection, uint64_t* code);

// The explicit persona rule.
VSLUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& personaUniqueString,
                                                      VSLClientConnection& connection, uint64_t* code);
// The inferred persona rule.
VSLUserIdentityRef userIdentityForContainerIdentifier(VSLClientConnection& connection, const std::string& identifier,
                                                      VSLContainerClass containerClass, uint64_t* code);

// The identifier whose installation decides a persona: a child's parent where the
// code-signing information names one, else `identifier` itself.
std::string installedBundleIdentifier(const std::string& identifier);
// Among the personas `bundleIdentifier` is installed in: the only one, or the
// client's own when it is one of several. None when there is none (`*installed` is
// 0) or when several exclude the client's (logged as ambiguous). `listed` names them.
VSLUserIdentityRef chooseInstalledUserIdentity(VSLClientConnection& connection, const std::string& bundleIdentifier,
                                               size_t* installed, std::string* listed);
// Command 32.
void listAccessiblePersonas(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                            uint64_t* code);

}  // namespace vsl
