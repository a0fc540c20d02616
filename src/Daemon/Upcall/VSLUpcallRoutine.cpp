#include "Daemon/Upcall/VSLUpcallRoutine.h"

#include <map>
#include <memory>
#include <optional>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Client/VSLUpcallProtocol.h"
#include "Daemon/Upcall/VSLUpcallRequest.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"
#include "Platform/PersonaInfo.h"
#include "Platform/SystemRoot.h"
#include "packbuff/packbuff_handle.hpp"

namespace vsl {

namespace {

const char* const kFunction = "server_get_process_containers";

UserManagement& personaService() {
    static const std::shared_ptr<UserManagement> service = UserManagement::create();
    return *service;
}

// The identity whose containers the process gets; none (with the fault logged) when
// its persona is unknown.
VSLUserIdentityRef userIdentityForRequest(const VSLUpcallRequest& request) {
    auto cache = VSLUserIdentitySharedCache::sharedInstance();
    VSLUserIdentityRef identity;
    if (deviceFacts().multiUser) {
        identity = cache->userIdentityForPersonalPersona(request.uid, request.uid);
    } else if (request.personaID == kVSLUpcallNoPersona) {
        identity = cache->userIdentityForPersonalPersona();
    } else {
        auto info = kernelPersonaInfo(personaService(), request.personaID);
        if (!info) {
            osLog(LogCategory::Upcall, OSLogLevel::Fault, "%s: Could not look up info for persona id %u", kFunction,
                  request.personaID);
            return nullptr;
        }
        identity = info->type == 2 || info->type == 5 ? cache->userIdentityWithPersonaID(request.personaID)
                                                      : cache->userIdentityForPersonalPersona();
    }
    if (!identity) {
        osLog(LogCategory::Upcall, OSLogLevel::Fault, "%s: Unable to find user identity for persona id %u", kFunction,
              request.personaID);
    }
    return identity;
}

void checkUID(const VSLClientConnection& connection, VSLContainerClass containerClass, uint32_t uid) {
    const uid_t expected = connection.clientIdentity()->posixUIDForContainerClass(containerClass);
    if (expected != uid) LogWrite(kLogLevelError, kFunction, "Invalid UID from kernel: %u, expected: %u", uid, expected);
}

// The class of the process's data container, from its code-signing record and kind.
VSLContainerClass dataContainerClass(const std::string& identifier, uint32_t containerType) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    VSLContainerClass stored = mapping ? mapping->dataContainerTypeForIdentifier(identifier) : kVSLClassUndefined;
    if (isPerUserContainerClass(stored)) {
        if (containerType == kVSLUpcallContainerTypePlugin && stored != kVSLClassPluginData) {
            LogWrite(kLogLevelNotice, kFunction, "SB Type: %u but data container class: %llu; using class: %llu",
                     containerType, stored, static_cast<uint64_t>(kVSLClassPluginData));
            return kVSLClassPluginData;
        }
        if (containerType == kVSLUpcallContainerTypeApplication && stored != kVSLClassApplicationData) {
            LogWrite(kLogLevelNotice, kFunction, "SB Type: %u with data container class: %llu", containerType, stored);
        }
        return stored;
    }
    LogWrite(kLogLevelError, kFunction, "Invalid data container class for %@: %llu", identifier, stored);
    const VSLContainerClass fallback =
        containerType == kVSLUpcallContainerTypePlugin ? kVSLClassPluginData : kVSLClassApplicationData;
    LogWrite(kLogLevelNotice, kFunction, "SB Type: %u, falling back to class: %llu", containerType, fallback);
    return fallback;
}

// The path of the container, created when missing; none with the failure logged.
std::optional<std::string> containerPath(VSLClientConnection& connection, const VSLUserIdentityRef& userIdentity,
                                         const std::string& identifier, VSLContainerClass containerClass,
                                         const char* failure) {
    uint64_t code = 1;
    auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(userIdentity, identifier, containerClass,
                                                                            &code);
    VSLMetadataRef metadata;
    if (identity) metadata = connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, &code);
    if (!metadata) {
        LogWrite(kLogLevelError, kFunction, failure, code);
        return std::nullopt;
    }
    return metadata->url();
}

std::string describe(const std::map<std::string, std::string>& pairs) {
    std::string s = "{";
    for (const auto& [identifier, path] : pairs) s += (s.size() > 1 ? "; " : " ") + identifier + " = " + path;
    return s + (pairs.empty() ? "}" : " }");
}

struct Paths {
    std::optional<std::string> home, data, temporary, systemContainer;
    std::map<std::string, std::string> groups, systemGroups;
};

// Packs the paths in reply order while all goes well, then the status.
void packReply(sb_packbuff* pb, const Paths& paths, bool success) {
    auto packPath = [&](uint16_t type, const std::optional<std::string>& path) {
        if (!success || !path) return;
        if (int rc = sb_packbuff_pack_string(pb, type, path->c_str(), path->size())) {
            LogWrite(kLogLevelError, kFunction, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", rc, type,
                     *path);
            success = false;
        }
    };
    auto packPairs = [&](uint16_t keyType, uint16_t valueType, const std::map<std::string, std::string>& pairs,
                         const char* failure) {
        for (const auto& [identifier, path] : pairs) {
            if (!success) return;
            if (int rc = sb_packbuff_pack_key_with_string_value(pb, keyType, identifier.c_str(), valueType,
                                                                path.c_str())) {
                LogWrite(kLogLevelError, kFunction, failure, rc, identifier, path);
                success = false;
            }
        }
    };
    packPath(kVSLUpcallReplyHome, paths.home);
    packPath(kVSLUpcallReplyDataContainer, paths.data);
    packPath(kVSLUpcallReplyTemporaryDirectory, paths.temporary);
    packPairs(kVSLUpcallReplyGroupIdentifier, kVSLUpcallReplyGroupPath, paths.groups,
              "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, group container: %s\n");
    packPath(kVSLUpcallReplySystemContainer, paths.systemContainer);
    packPairs(kVSLUpcallReplySystemGroupIdentifier, kVSLUpcallReplySystemGroupPath, paths.systemGroups,
              "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, system group container: %s\n");
    const uint32_t status = success ? 1 : 0;
    if (int rc = sb_packbuff_pack_uint32(pb, kVSLUpcallReplyStatus, status)) {
        LogWrite(kLogLevelError, kFunction, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", rc,
                 static_cast<unsigned>(kVSLUpcallReplyStatus), status);
    }
}

int32_t serve(const void* requestBytes, size_t requestSize, std::string* reply) {
    LogWrite(kLogLevelDebug, kFunction, "request size: %u (%p)", static_cast<uint32_t>(requestSize), requestBytes);
    VSLUpcallRequest request;
    if (int32_t rc = unpackUpcallRequest(requestBytes, requestSize, &request)) return rc;

    PackbuffHandle pb(sb_packbuff_new(4096));
    if (!pb) return kVSLUpcallMemoryFailure;
    VSLUserIdentityRef userIdentity = userIdentityForRequest(request);
    if (!userIdentity) return kVSLUpcallInvalidArgument;

    auto connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(userIdentity, true);
    connection->setAllowOtherIdLookup(true);
    connection->setAllowGroupIdLookup(true);
    connection->setUnrestricted(true);

    bool success = true;
    Paths paths;
    const std::optional<std::string>& dataIdentifier = request.containerID ? request.containerID
                                                                           : request.codeSignatureID;
    if (dataIdentifier) {
        const VSLContainerClass containerClass = dataContainerClass(*dataIdentifier, request.containerType);
        checkUID(*connection, containerClass, request.uid);
        paths.data = containerPath(*connection, userIdentity, *dataIdentifier, containerClass,
                                   "createOrLookupContainerForUser: Failed with error: %llu");
        success = success && paths.data.has_value();
    }
    if (request.systemContainerID) {
        paths.systemContainer = containerPath(*connection, userIdentity, *request.systemContainerID,
                                              kVSLClassSystemData,
                                              "createOrLookupContainerForUser:(system container) Failed with error: %llu");
        success = success && paths.systemContainer.has_value();
    }
    auto groups = [&](const std::vector<std::string>& identifiers, VSLContainerClass containerClass,
                      const char* failure, std::map<std::string, std::string>* out) {
        if (identifiers.empty()) return;
        checkUID(*connection, containerClass, request.uid);
        for (const std::string& identifier : identifiers) {
            if (out->count(identifier)) continue;  // the same group twice is one pair
            auto path = containerPath(*connection, userIdentity, identifier, containerClass, failure);
            if (path) {
                out->emplace(identifier, *path);
            } else {
                success = false;
            }
        }
    };
    groups(request.appGroupIDs, kVSLClassAppGroup, "createOrLookupGroupContainersForUser: Failed with error: %llu",
           &paths.groups);
    groups(request.systemGroupIDs, kVSLClassSystemGroup,
           "createOrLookupContainerForUser:(system group container) Failed with error: %llu", &paths.systemGroups);

    if (success) {
        if (paths.data) paths.temporary = joinPath(*paths.data, "tmp");
        paths.home = request.uid == 0 ? rootedPath("/private/var/root") : userIdentity->homeDirectoryURL();
        LogWrite(kLogLevelDebug, kFunction, "UPCALL-Containers for %@(%u):", dataIdentifier, request.uid);
        LogWrite(kLogLevelDebug, kFunction, "dataContainerURL: %@", paths.data);
        LogWrite(kLogLevelDebug, kFunction, "tempContainerURL: %@", paths.temporary);
        LogWrite(kLogLevelDebug, kFunction, "homeDirURL: %@", paths.home);
        LogWrite(kLogLevelDebug, kFunction, "groupURLs: %@", describe(paths.groups));
        LogWrite(kLogLevelDebug, kFunction, "systemContainerURL: %@", paths.systemContainer);
        LogWrite(kLogLevelDebug, kFunction, "systemGroupURLs: %@", describe(paths.systemGroups));
    }
    packReply(pb.get(), paths, success);
    reply->assign(static_cast<const char*>(sb_packbuff_get_bytes(pb.get())), sb_packbuff_get_size(pb.get()));
    LogWrite(kLogLevelDebug, kFunction, "packbuff bytes: %p, reply bytes: %p, reply size: %u",
             sb_packbuff_get_bytes(pb.get()), static_cast<const void*>(reply->data()),
             static_cast<uint32_t>(reply->size()));
    return kVSLUpcallSuccess;
}

}  // namespace

int32_t server_get_process_containers(const VSLAuditToken& auditToken, const void* request, size_t requestSize,
                                      std::string* reply) {
    SignpostInterval interval(LogCategory::Upcall, "KernelUpcall", "");
    reply->clear();
    // Only the kernel asks; anyone else learns nothing and changes nothing.
    if (auditToken[5] != 0) return kVSLUpcallFailure;
    return serve(request, requestSize, reply);
}

}  // namespace vsl
